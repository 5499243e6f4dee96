#include "check/check.h"

#include "findings.h"
#include "procedure.h"
#include "stick/stick_check.h"
#include "unit/unit_check.h"

#include <cstring>
#include <ostream>

namespace
{

/// "1.2.0 -> 1.3.0, would be installed"
std::string plan(const std::string& installed, const std::string& candidate)
{
    if (installed.empty() || candidate.empty()) {
        return "not known: a version cannot be read";
    }
    return installed == candidate ? installed + ", up to date"
                                  : installed + " -> " + candidate + ", would be installed";
}

void addPlans(const Unit& unit, Report& report)
{
    const std::string board = plan(report.fact("board_version"), report.fact("version"));
    report.addFact("package_plan", "Package",
                   plan(report.fact("package_installed"), report.fact("package_candidate")) +
                       " as of the last refresh");
    report.addFact("board_plan", "Board", board);
    const bool installs = board.find("would be installed") != std::string::npos;
    const std::int64_t seconds = outcomeWait + giveBackWait + (installs ? boardWait : 0);
    report.addFact("shortest_s", "Takes at least",
                   std::to_string((seconds + 59) / 60) + " min, and what downloading and copying take", seconds);
    if (unit.isMainHead() && installs) {
        report.add("update-offered");
    }
}

} // namespace

int runCheck(const std::string& path, bool json, const UnitSite& site, std::ostream& out, std::ostream& errors)
{
    const StickFolder stick(path);
    if (stick.error() != 0) {
        errors << "harl-updater-tool: " << shown(path) << " cannot be read: " << std::strerror(stick.error())
               << ". Name the folder that the stick is mounted at.\n";
        if (json) {
            out << refusal("check", std::string("the stick cannot be read: ") + std::strerror(stick.error())).dump(2)
                << '\n';
        }
        return Report::STATUS_UNCHECKED;
    }
    const Unit unit(site);
    Report report("check", "This update", "likely to do what it should");
    const bool isUnit = unit.property("harl-updater", "LoadState") == "loaded";
    if (isUnit) {
        checkUnit(unit, report);
    }
    checkStick(stick, isUnit, report);
    if (isUnit) {
        addPlans(unit, report);
    } else {
        report.add("not-a-unit");
    }
    report.write(json, out);
    return report.status();
}
