// Usage: unit-on-standin unit|verify [NAME=VALUE...]
//        unit-on-standin check STICK [NAME=VALUE...]
// Runs this check of `harl-updater-tool` on a stand-in unit with these settings of standins.sh.

#include "check/check.h"
#include "unit/unit_check.h"

#include "unit/standin.h"

#include <iostream>

int main(int argc, char** argv)
{
    const std::vector<std::string> arguments(argv + 1, argv + argc);
    const std::string& command = arguments.at(0);
    const std::string stick = command == "check" ? std::filesystem::absolute(arguments.at(1)) : "";
    StandInUnit unit;
    for (std::size_t index = stick.empty() ? 1 : 2; index < arguments.size(); ++index) {
        const std::size_t equals = arguments[index].find('=');
        unit.set(arguments[index].substr(0, equals), arguments[index].substr(equals + 1));
    }
    std::filesystem::current_path(unit.folder.path()); // the search path is shown: the same for every run
    UnitSite site = unit.site();
    site.searchPath = "bin";
    return command == "check"    ? runCheck(stick, false, site, std::cout, std::cerr)
           : command == "verify" ? runVerify({}, site, std::cout)
                                 : runUnit({}, site, std::cout, std::cerr);
}
