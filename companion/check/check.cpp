#include "check/check.h"

#include "findings.h"
#include "log/run.h"
#include "log/text.h"
#include "procedure.h"
#include "stick/signature.h"
#include "stick/stick_check.h"
#include "unit/unit_check.h"

#include <filesystem>
#include <optional>
#include <ostream>
#include <sstream>

namespace
{

const auto filesLimit = 120s; // dpkg(1) reads every file of the package

/// Whether two versions are not the same text; nothing when one of them is not known.
std::optional<bool> differ(const std::string& one, const std::string& other)
{
    return one.empty() || other.empty() ? std::nullopt : std::optional(one != other);
}

/// "1.2.0 -> 1.3.0, would be installed"
std::string plan(const std::string& installed, const std::string& candidate, const char* since = "")
{
    const std::optional<bool> update = differ(installed, candidate);
    return !update   ? "not known: a version cannot be read"
           : *update ? installed + " -> " + candidate + ", would be installed" + since
                     : installed + ", up to date" + since;
}

void addPlans(const Unit& unit, Report& report)
{
    const std::string installed = report.fact("package_installed");
    const std::string now = report.fact("package_now");
    const std::string candidate = now.empty() ? report.fact("package_candidate") : now;
    report.addFact("package_plan", "Package",
                   plan(installed, candidate, now.empty() ? ", as of the last refresh" : ""));
    const std::string onBoard = report.fact("board_version");
    const std::string onStick = report.fact("version");
    report.addFact("board_plan", "Board", plan(onBoard, onStick));

    const std::optional<bool> package = differ(installed, candidate);
    const std::optional<bool> board = differ(onBoard, onStick);
    const std::int64_t reading = unit.isMainHead() ? 0 : outcomeWait; // of the panel
    const std::int64_t seconds = reading + giveBackWait + (board.value_or(false) ? boardWait : 0);
    report.addFact("shortest_s", "Takes at least", durationText(seconds) + ", and what downloading and copying take",
                   seconds);
    const bool teamViewer = report.toJson()["facts"]["teamviewer_requested"] == true;
    if (unit.isMainHead() && package && board && (*package || *board || teamViewer)) {
        report.add("update-offered");
    }
}

/// Checks the package's files against the database. Changed configuration files are the technician's own.
void checkFiles(const Unit& unit, Report& report)
{
    const CommandResult files = unit.run({"dpkg", "--verify", unit.package()}, filesLimit);
    if (files.exitCode < 0 || (!files.succeeded() && files.output.empty())) {
        report.add("package-files.unknown", {{"complaint", complaint(files)}});
        return;
    }
    std::vector<std::string> wrong;
    for (const std::string& line : linesOf(files.output)) { // "??5??????   /path", with c before a configuration file's
        const std::size_t path = line.find('/');
        std::istringstream words(line);
        std::string state;
        std::string mark;
        words >> state >> mark;
        if (path != std::string::npos && mark != "c") {
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
        if (words >> path && std::filesystem::exists(unit.path(path + ".dpkg-dist"))) {
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
        report.addFact("package_installed", "Package installed", shown(package.output), installed);
    }
    checkBoard(unit, report);
    if (run.steps.empty()) {
        report.add("last-run");
        return;
    }
    const auto compare = [&](const char* check, const std::string& found, const Versions& versions, StepKind step) {
        if (run.mainHead && versions.differ() && run.find(step) == nullptr) {
            return; // its user did not want it
        }
        const std::string& wanted = versions.differ() ? versions.candidate : versions.installed;
        if (versions.found() && differ(found, wanted).value_or(false)) {
            report.add(check, {{"found", shown(found)}, {"wanted", shown(wanted)}});
        }
    };
    compare("package-version", installed, run.package, StepKind::INSTALL_PACKAGE);
    compare("board-version-old", report.fact("board_version"), run.board, StepKind::UPLOAD_BOARD);
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
