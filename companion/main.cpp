#include "check/check.h"
#include "findings.h"
#include "fleet/fleet_command.h"
#include "log/catalogue.h"
#include "log/log_command.h"
#include "procedure.h"
#include "stick/make.h"
#include "stick/stick_check.h"
#include "terminal.h"
#include "unit/unit_check.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <exception>
#include <iostream>
#include <new>
#include <numeric>
#include <sstream>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>
#include <unistd.h>

namespace
{

/// How many letters must be put in, left out or changed to make `to` of `from`.
std::size_t distance(const std::string& from, const std::string& to)
{
    std::vector<std::size_t> row(to.size() + 1);
    std::iota(row.begin(), row.end(), std::size_t{0});
    for (std::size_t line = 0; line < from.size(); ++line) {
        std::size_t before = std::exchange(row[0], line + 1);
        for (std::size_t column = 0; column < to.size(); ++column) {
            const std::size_t changed = before + (from[line] == to[column] ? 0 : 1);
            before = row[column + 1];
            row[column + 1] = std::min({changed, row[column] + 1, before + 1});
        }
    }
    return row.back();
}

/// "stick make", the command that a command line names; empty without one.
std::string commandIn(const CLI::App& app)
{
    std::string name;
    for (const CLI::App* command = &app; !command->get_subcommands().empty();) {
        command = command->get_subcommands().front();
        name += (name.empty() ? "" : " ") + command->get_name();
    }
    return name;
}

/// What is wrong with a command line, in plain words.
std::string usageText(const CLI::App& app, const CLI::ParseError& error)
{
    const std::string parsed = commandIn(app);
    const std::vector<std::string> rest = app.remaining(true);
    if (parsed.empty() && rest.empty()) {
        return "Name a command: stick, unit, check, verify, log, fleet, explain or report.";
    }
    if (parsed.empty()) {
        if (rest.front().rfind('-', 0) == 0) {
            return "Name a command before " + rest.front() + '.';
        }
        std::string text = rest.front() + " is not a command.";
        for (const CLI::App* command : app.get_subcommands([](const CLI::App*) { return true; })) {
            const std::string name = command->get_name();
            if (distance(rest.front(), name) <= std::min<std::size_t>(2, name.size() / 2)) {
                text += " Did you mean " + name + '?';
            }
        }
        return text;
    }
    if (!rest.empty()) {
        return rest.front() +
               (rest.front().rfind('-', 0) == 0 ? " is not an option of " : " is one argument too many for ") + parsed +
               '.';
    }
    // "--html: 1 required PAGE missing", "FILE is required", "--oldest requires --sign", "--run: Number less ..."
    const std::string text = error.what();
    const std::string option = text.substr(0, text.find_first_of(": "));
    const std::size_t value = text.find("required ");
    if (text.find(" is required") != std::string::npos) {
        return option + " is missing.";
    }
    if (text.find(" requires ") != std::string::npos) {
        return text + '.';
    }
    return value == std::string::npos
               ? option + " needs a number from 1 on."
               : "Name " + text.substr(value + 9, text.rfind(' ') - value - 9) + " behind " + option + '.';
}

/// Reports a wrong command line.
int refuseUsage(const std::string& command, bool json, const std::string& text)
{
    return refuse(command.substr(0, command.find(' ')), json,
                  text + " See: harl-updater-tool " + command + (command.empty() ? "" : " ") + "--help", std::cout,
                  std::cerr);
}

/// Prints the help that was asked for at the terminal's width: what goes on in a further line begins below its column.
void printHelp(const CLI::App& app)
{
    const std::size_t column = widthOf(std::cout) < 60 ? 16 : 30;
    app.get_formatter()->column_width(column);
    std::istringstream lines(app.help());
    for (std::string line; std::getline(lines, line);) {
        if (line.size() > column && line.front() == ' ' && line[column - 1] == ' ') {
            line.insert(column, "\t");
        }
        printText(line + '\n', std::cout);
    }
}

int run(std::vector<std::string> arguments)
{
    CLI::App app("Answers what a technician asks before and after an update. It never changes the updater.",
                 "harl-updater-tool");
    app.require_subcommand(1);
    app.set_version_flag("-V,--version", "harl-updater-tool " TOOL_VERSION,
                         "Print the program's name and version and exit");

    std::string stickPath = stickMountPoint;
    bool json = false;
    CLI::App* stick = app.add_subcommand("stick", "Show what the updater would do with a stick. Reads only.");
    stick->add_option("PATH", stickPath, "the folder that the stick is mounted at")
        ->type_name("")
        ->capture_default_str();
    stick->add_flag("--json", json, "print one JSON object");
    std::string keyring;
    stick->add_option("--keyring", keyring, "verify the stick with these keys instead of the installed ones")
        ->type_name("FILE");
    stick->footer("Exit status: 0 fit for an update, 1 not fit, 2 wrong usage or not everything could be read.\n");

    MakeOptions makeOptions;
    CLI::App* make = stick->add_subcommand("make", "Make a stick: write it, read it back, sign it.");
    make->add_option("TARGET", makeOptions.target, "the folder that the stick is mounted at, or any folder")
        ->type_name("")
        ->required();
    make->add_option("--archive", makeOptions.archive, "the board's upgrade archive")->type_name("ZIP")->required();
    make->add_option("--script", makeOptions.script, "the board's install script")->type_name("SCRIPT")->required();
    make->add_option("--version", makeOptions.version, "the version, as the board will report it")
        ->type_name("VERSION")
        ->required();
    make->add_flag("--replace", makeOptions.replace, "replace the version that is on the stick");
    make->add_flag("--teamviewer", makeOptions.teamViewer, "request TeamViewer on a main head");
    CLI::Option* sign =
        make->add_option("--sign", makeOptions.key, "sign the stick with this key of gpg's")->type_name("KEY");
    make->add_option("--oldest", makeOptions.oldest, "the oldest version that this one may replace")
        ->type_name("VERSION")
        ->needs(sign);
    make->footer("Exit status: 0 made and fit, 1 not fit, 2 wrong usage or it could not be made.\n");

    UnitOptions unitOptions;
    CLI::App* unit = app.add_subcommand("unit", "Show whether this unit is fit for an update. Run it as root.");
    unit->add_flag("--panel", unitOptions.panel, "lamp test instead: all 14 LEDs in every colour");
    unit->add_flag("--sound", unitOptions.sound, "play both sounds instead");
    unit->add_flag("--json", json, "print one JSON object");
    unit->footer("Exit status: 0 fit or test passed, 1 not fit or test failed, 2 wrong usage, test refused or not "
                 "everything could be checked.\n");

    std::string checkPath = stickMountPoint;
    CLI::App* check = app.add_subcommand("check", "Show what an update would do now: unit and stick. Run it as root.");
    check->add_option("PATH", checkPath, "the folder that the stick is mounted at")
        ->type_name("")
        ->capture_default_str();
    check->add_flag("--json", json, "print one JSON object");
    check->footer(
        "Exit status: 0 the update will likely succeed, 1 it will not, 2 wrong usage or not everything could be "
        "checked.\n");

    VerifyOptions verifyOptions;
    CLI::App* verify = app.add_subcommand("verify", "Show whether this unit is well after an update. Run it as root.");
    verify->add_flag("--record", verifyOptions.record, "print one line for the service's journal");
    verify->add_flag("--json", json, "print one JSON object");
    verify->footer("Exit status: 0 well, 1 not well, 2 wrong usage or not everything could be checked.\n");

    LogOptions logOptions;
    CLI::App* log = app.add_subcommand("log", "Explain the updater's log: what happened, why, and what to do now.");
    log->add_option("FILE", logOptions.files, "the log, or several in their order; - for standard input")
        ->type_name("");
    log->add_flag("--journal", logOptions.journal, "read the journal of the service harl-updater");
    log->add_flag("--list", logOptions.list, "print one line for each run");
    log->add_option("--run", logOptions.run, "explain only the run with this number")
        ->type_name("N")
        ->check(CLI::Validator(CLI::PositiveNumber).description(""));
    log->add_flag("--last", logOptions.last, "explain only the last run");
    log->add_flag("--strict", logOptions.strict, "a warning is not status 0 either");
    log->add_flag("--follow", logOptions.follow, "show the run that goes on, until it ends");
    log->add_flag("--json", json, "print one JSON object; with --follow one for each change");
    log->add_option("--html", logOptions.htmlFile, "also write a page with each run's timeline")->type_name("PAGE");
    log->footer("Exit status: 0 the last run went well, 1 it failed or did not finish, 2 wrong usage or no log.\n");

    FleetOptions fleetOptions;
    CLI::App* fleet = app.add_subcommand("fleet", "Show which of many units failed, why, and what runs on them.");
    fleet
        ->add_option("FILE", fleetOptions.paths,
                     "logs, journals and reports of units, or folders with them; - for "
                     "standard input")
        ->type_name("")
        ->required();
    fleet->add_option("--since", fleetOptions.since, "count only runs since then, and show which units had none")
        ->type_name("DATE");
    fleet->add_option("--failed", fleetOptions.failed, "only units whose last run met this failure")->type_name("NAME");
    fleet->add_flag("--json", json,
                    "print one JSON object for the fleet, then one for each unit, on lines of their own");
    fleet->add_flag("--csv", fleetOptions.csv, "print a line for each unit, as a spreadsheet reads it");
    fleet->add_option("--html", fleetOptions.htmlFile, "also write a page with charts and a table")->type_name("PAGE");
    fleet->footer(
        "Exit status: 0 all units are well, 1 a unit needs somebody, 2 wrong usage or not everything could be "
        "read.\n");

    std::string failure;
    CLI::App* explain = app.add_subcommand("explain", "Explain a failure by its name, or list all of them.");
    explain->add_option("NAME", failure, "as in brackets in a report, such as mirrors-unreachable")->type_name("");
    explain->add_flag("--json", json, "print one JSON object");
    explain->footer("Exit status: 0 explained, 2 wrong usage or no such name.\n");

    ReportOptions reportOptions;
    reportOptions.stick = stickMountPoint;
    CLI::App* report = app.add_subcommand("report", "Pack what support needs into one archive. Run it as root.");
    report->add_option("FILE", reportOptions.file, "the archive to make, such as /tmp/report.tar.gz")
        ->type_name("")
        ->required();
    report->add_flag("--json", json, "print one JSON object");
    report->footer("Exit status: 0 made, 2 wrong usage or the archive cannot be made.\n");

    if (!arguments.empty() && arguments.front() == "help") { // "help log" is "log --help"
        arguments.erase(arguments.begin());
        arguments.resize(std::min<std::size_t>(arguments.size(), 1));
        arguments.emplace_back("--help");
    }
    const bool wantsJson = std::find(arguments.begin(), arguments.end(), "--json") != arguments.end();
    std::reverse(arguments.begin(), arguments.end()); // as CLI::App takes them
    try {
        app.parse(std::move(arguments));
    } catch (const CLI::ParseError& error) {
        if (error.get_name() == "CallForHelp") {
            printHelp(app);
            return 0;
        }
        if (error.get_exit_code() == 0) {
            return app.exit(error); // --version
        }
        return refuseUsage(commandIn(app), wantsJson, usageText(app, error));
    }
    if (make->parsed()) {
        makeOptions.progress = isatty(STDERR_FILENO) == 1;
        return makeStick(makeOptions, std::cout, std::cerr);
    }
    if (stick->parsed()) {
        return runStick(stickPath, json, std::cout, std::cerr, keyring);
    }
    if (log->parsed()) {
        logOptions.json = json;
        logOptions.terminal = isatty(STDOUT_FILENO) == 1;
        const std::string wrong = conflictIn(logOptions);
        return wrong.empty() ? runLog(logOptions, std::cout, std::cerr) : refuseUsage("log", json, wrong);
    }
    if (fleet->parsed()) {
        fleetOptions.json = json;
        const std::string wrong = conflictIn(fleetOptions);
        return wrong.empty() ? runFleet(fleetOptions, std::cout, std::cerr) : refuseUsage("fleet", json, wrong);
    }
    if (explain->parsed()) {
        return printCatalogue(failure, json, std::cout)
                   ? 0
                   : refuseUsage("explain", json, escaped(failure) + " is not a name of the catalogue.");
    }
    if (check->parsed()) {
        return runCheck(checkPath, json, thisUnit(), std::cout, std::cerr);
    }
    if (report->parsed()) {
        reportOptions.json = json;
        return runReport(reportOptions, thisUnit(), std::cout, std::cerr);
    }
    if (verify->parsed()) {
        verifyOptions.json = json;
        return runVerify(verifyOptions, thisUnit(), std::cout);
    }
    unitOptions.json = json;
    return runUnit(unitOptions, thisUnit(), std::cout, std::cerr);
}

} // namespace

int main(int argc, char** argv)
{
    try {
        std::cout.exceptions(std::ios::badbit); // a full disk must not pass for a good answer
        const int status = run({argv + std::min(argc, 1), argv + argc});
        std::cout.flush();
        return status;
    } catch (const std::ios_base::failure&) {
        const char* advice = errno == EPIPE || errno == EBADF ? "Nobody reads it." : "Make room or name another file.";
        std::fprintf(stderr, "harl-updater-tool: the output cannot be written: %s. %s\n", std::strerror(errno), advice);
    } catch (const std::bad_alloc&) {
        std::fputs("harl-updater-tool: there is not enough memory. End other programs and try again.\n", stderr);
    } catch (const std::exception& error) {
        std::fprintf(stderr,
                     "harl-updater-tool: internal error: %s. Report this line with the command to the "
                     "manufacturer.\n",
                     error.what());
    }
    return Report::STATUS_UNCHECKED;
}
