// Usage: unit-on-standin [NAME=VALUE...]
// Runs the check of `harl-updater-tool unit` on a stand-in unit with these settings of standins.sh.

#include "unit/unit_check.h"

#include "unit/standin.h"

#include <iostream>

int main(int argc, char** argv)
{
    StandInUnit unit;
    for (int index = 1; index < argc; ++index) {
        const std::string argument = argv[index];
        const std::size_t equals = argument.find('=');
        unit.set(argument.substr(0, equals), argument.substr(equals + 1));
    }
    std::filesystem::current_path(unit.folder.path()); // the search path is shown: the same for every run
    UnitSite site = unit.site();
    site.searchPath = "bin";
    return runUnit({}, site, std::cout, std::cerr);
}
