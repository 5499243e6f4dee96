#include "check/check.h"

#include "findings.h"
#include "log/run.h"
#include "procedure.h"
#include "stick/signature.h"
#include "stick/stick_check.h"
#include "unit/unit_check.h"

#include <filesystem>
#include <ostream>
#include <sstream>

namespace
{

const auto filesLimit = 120s; // dpkg(1) reads every file of the package

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
    const std::string candidate = report.fact("package_now");
    report.addFact(
        "package_plan", "Package",
        plan(report.fact("package_installed"), candidate.empty() ? report.fact("package_candidate") : candidate) +
            (candidate.empty() ? ", as of the last refresh" : ""));
    report.addFact("board_plan", "Board", board);
    const bool installs = contains(board, "would be installed");
    const std::int64_t seconds = outcomeWait + giveBackWait + (installs ? boardWait : 0);
    report.addFact("shortest_s", "Takes at least",
                   std::to_string((seconds + 59) / 60) + " min, and what downloading and copying take", seconds);
    if (unit.isMainHead() && installs) {
        report.add("update-offered");
    }
}

/// Checks the package's files against the database. Changed configuration files are the technician's own.
void checkFiles(const Unit& unit, Report& report)
{
    const CommandResult files = unit.run({"dpkg", "--verify", unit.package()}, filesLimit);
    if (!files.started || files.timedOut || (files.exitCode != 0 && files.output.empty())) {
        report.add("package-files.unknown", {{"complaint", complaint(files)}});
        return;
    }
    std::vector<std::string> wrong;
    for (const std::string& line : linesOf(files.output)) { // "??5??????   /path", with c before a configuration file's
        const std::size_t path = line.find('/');
        if (path != std::string::npos && path > 2 && line.substr(path - 2, 2) != "c ") {
            wrong.push_back(line.substr(path));
        }
    }
    if (!wrong.empty()) {
        report.add("package-files", {{"files", listed(wrong)}});
    }
}

/// Looks for configuration files that the package brought and that were not put in place of changed ones.
void checkConfiguration(const Unit& unit, Report& report)
{
    const CommandResult list =
        unit.run({"dpkg-query", "--show", "--showformat=${Conffiles}\\n", unit.package()}, quick);
    std::vector<std::string> kept;
    for (const std::string& line : linesOf(list.output)) { // " /etc/file checksum"
        std::istringstream words(line);
        std::string path;
        if (words >> path && path.front() == '/' && std::filesystem::exists(unit.path(path + ".dpkg-dist"))) {
            kept.push_back(path);
        }
    }
    if (!kept.empty()) {
        report.add("configuration-kept", {{"files", listed(kept)}});
    }
}

/// The last run in the journal; without a step when there is none.
Run lastRun(const Unit& unit)
{
    Run last;
    RunBuilder builder([&](Run& run) { last = run; });
    LogParser parser(builder);
    parser.feed(unit.journal());
    parser.finish();
    builder.finish();
    return last;
}

void checkVersions(const Unit& unit, Report& report)
{
    const Run run = lastRun(unit);
    const CommandResult package = unit.run({"dpkg-query", "--show", "--showformat=${Version}", unit.package()}, quick);
    const std::string installed = escaped(package.output);
    if (package.succeeded()) {
        report.addFact("package_installed", "Package installed", installed);
    }
    checkBoard(unit, report);
    if (run.steps.empty()) {
        report.add("last-run");
        return;
    }
    const auto compare = [&](const char* check, const std::string& found, const Versions& versions) {
        const std::string& wanted = versions.differ() ? versions.candidate : versions.installed;
        if (!found.empty() && versions.found() && !wanted.empty() && found != wanted) {
            report.add(check, {{"found", shown(found)}, {"wanted", shown(wanted)}});
        }
    };
    compare("package-version", installed, run.package);
    compare("board-version-old", report.fact("board_version"), run.board);
}

/// The line for the journal.
std::string recordOf(const Report& report)
{
    const bool bad = report.status() == Report::STATUS_NOT_FIT;
    std::string names;
    for (const Finding& finding : report.findings()) {
        if (finding.severity == (bad ? Severity::ERROR : Severity::UNCHECKED)) {
            names += (names.empty() ? "" : ", ") + finding.check;
        }
    }
    return "verify: " + (bad             ? "the unit is not well: " + names
                         : names.empty() ? "the unit is well"
                                         : "not everything could be checked: " + names);
}

} // namespace

bool isUnit(const Unit& unit)
{
    return unit.property("harl-updater", "LoadState") == "loaded";
}

int runCheck(const std::string& path, bool json, const UnitSite& site, std::ostream& out, std::ostream& errors)
{
    const StickFolder stick(path);
    if (stick.error() != 0) {
        return refuseStick("check", path, stick.error(), json, out, errors);
    }
    const Unit unit(site);
    Report report("check", "This update", "likely to do what it should");
    if (isUnit(unit)) {
        checkUnit(unit, report);
    }
    checkStick(stick, isUnit(unit), report);
    checkSignature(path, "", report);
    if (isUnit(unit)) {
        addPlans(unit, report);
        checkReplaced(path, report);
    } else {
        report.add("not-a-unit");
    }
    report.write(json, out);
    return report.status();
}

int runVerify(const VerifyOptions& options, const UnitSite& site, std::ostream& out)
{
    const Unit unit(site);
    if (options.record && unit.updaterRuns()) {
        return Report::STATUS_UNCHECKED; // the next run has begun; its end is verified
    }
    Report report("verify", "The unit", "well");
    unit.defineTexts(report);
    const std::string state = unit.property("harl", "ActiveState");
    if (state != "active") {
        report.add(state.empty() ? "application.unknown" : "application", {{"state", shown(state)}});
    }
    checkUnfinishedWork(unit, report);
    checkFiles(unit, report);
    checkConfiguration(unit, report);
    checkVersions(unit, report);
    if (!options.record) {
        report.write(options.json, out);
    } else if (Unit(site).updaterRuns()) {
        return Report::STATUS_UNCHECKED; // it has begun meanwhile
    } else {
        out << recordOf(report) << '\n';
    }
    return report.status();
}
