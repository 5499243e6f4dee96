#include "check/check.h"
#include "findings.h"
#include "fleet/fleet_command.h"
#include "log/catalogue.h"
#include "log/log_command.h"
#include "procedure.h"
#include "stick/make.h"
#include "stick/stick_check.h"
#include "texts.h"
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
#include <type_traits>
#include <utility>
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
    if (parsed.empty() && startsWith(rest.front(), "-")) {
        return "Name a command before " + rest.front() + '.';
    }
    if (parsed.empty()) {
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
               (startsWith(rest.front(), "-") ? " is not an option of " : " is one argument too many for ") + parsed +
               '.';
    }
    // "--html: 1 required PAGE missing", "FILE is required", "--oldest requires --sign", "--run: Number less ..."
    const std::string text = error.what();
    const std::string option = text.substr(0, text.find_first_of(": "));
    const std::size_t value = text.find("required ");
    if (contains(text, " is required")) {
        return option + " is missing.";
    }
    if (contains(text, " requires ")) {
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

/// A command with the texts that the catalogue has for its help.
CLI::App* addCommand(CLI::App& parent, const std::string& name)
{
    const auto& texts = catalogue("commands").at(name);
    CLI::App* const command = parent.add_subcommand(name, unfilled(texts.at("does")));
    command->footer("Exit status: " + unfilled(texts.at("status")) + ".\n");
    return command;
}

/// @param name  as in the catalogue: "--list", "--run N", or "FILE" for an argument
template <typename Value>
CLI::Option* addOption(CLI::App* command, const std::string& name, Value& value)
{
    const std::string text = unfilled(catalogue("commands").at(command->get_name()).at("options").at(name));
    if constexpr (std::is_same_v<Value, bool>) {
        return command->add_flag(name, value, text);
    } else {
        const std::size_t blank = name.find(' ');
        return command->add_option(name.substr(0, blank), value, text)
            ->type_name(blank == std::string::npos ? "" : name.substr(blank + 1));
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
    std::string keyring;
    CLI::App* stick = addCommand(app, "stick");
    addOption(stick, "PATH", stickPath)->capture_default_str();
    addOption(stick, "--keyring FILE", keyring);

    MakeOptions makeOptions;
    CLI::App* make = addCommand(*stick, "make");
    addOption(make, "TARGET", makeOptions.target)->required();
    addOption(make, "--archive ZIP", makeOptions.archive)->required();
    addOption(make, "--script SCRIPT", makeOptions.script)->required();
    addOption(make, "--version VERSION", makeOptions.version)->required();
    addOption(make, "--replace", makeOptions.replace);
    addOption(make, "--teamviewer", makeOptions.teamViewer);
    CLI::Option* sign = addOption(make, "--sign KEY", makeOptions.key);
    addOption(make, "--oldest VERSION", makeOptions.oldest)->needs(sign);

    UnitOptions unitOptions;
    CLI::App* unit = addCommand(app, "unit");
    addOption(unit, "--panel", unitOptions.panel);
    addOption(unit, "--sound", unitOptions.sound);

    std::string checkPath = stickMountPoint;
    CLI::App* check = addCommand(app, "check");
    addOption(check, "PATH", checkPath)->capture_default_str();

    VerifyOptions verifyOptions;
    CLI::App* verify = addCommand(app, "verify");
    addOption(verify, "--record", verifyOptions.record);

    bool json = false;
    LogOptions logOptions;
    CLI::App* log = addCommand(app, "log");
    addOption(log, "FILE", logOptions.files);
    addOption(log, "--journal", logOptions.journal);
    addOption(log, "--list", logOptions.list);
    addOption(log, "--run N", logOptions.run)->check(CLI::Validator(CLI::PositiveNumber).description(""));
    addOption(log, "--last", logOptions.last);
    addOption(log, "--strict", logOptions.strict);
    addOption(log, "--follow", logOptions.follow);
    addOption(log, "--json", json);
    addOption(log, "--html PAGE", logOptions.htmlFile);

    FleetOptions fleetOptions;
    CLI::App* fleet = addCommand(app, "fleet");
    addOption(fleet, "FILE", fleetOptions.paths)->required();
    addOption(fleet, "--since DATE", fleetOptions.since);
    addOption(fleet, "--failed NAME", fleetOptions.failed);
    addOption(fleet, "--json", json);
    addOption(fleet, "--csv", fleetOptions.csv);
    addOption(fleet, "--html PAGE", fleetOptions.htmlFile);

    std::string failure;
    CLI::App* explain = addCommand(app, "explain");
    addOption(explain, "NAME", failure);

    ReportOptions reportOptions;
    CLI::App* report = addCommand(app, "report");
    addOption(report, "FILE", reportOptions.file)->required();

    for (CLI::App* command : {stick, unit, check, verify, explain, report}) {
        addOption(command, "--json", json);
    }

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
    unitOptions.json = verifyOptions.json = logOptions.json = fleetOptions.json = reportOptions.json = json;
    logOptions.terminal = isatty(STDOUT_FILENO) == 1;
    const std::string wrong = log->parsed() ? conflictIn(logOptions) : fleet->parsed() ? conflictIn(fleetOptions) : "";
    if (!wrong.empty()) {
        return refuseUsage(commandIn(app), json, wrong);
    }
    if (explain->parsed()) {
        return printCatalogue(failure, json, std::cout)
                   ? 0
                   : refuseUsage("explain", json, escaped(failure) + " is not a name of the catalogue.");
    }
    return log->parsed()      ? runLog(logOptions, std::cout, std::cerr)
           : fleet->parsed()  ? runFleet(fleetOptions, std::cout, std::cerr)
           : check->parsed()  ? runCheck(checkPath, json, thisUnit(), std::cout, std::cerr)
           : report->parsed() ? runReport(reportOptions, thisUnit(), std::cout, std::cerr)
           : verify->parsed() ? runVerify(verifyOptions, thisUnit(), std::cout)
                              : runUnit(unitOptions, thisUnit(), std::cout, std::cerr);
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
    } catch (const std::bad_alloc&) { // std::cerr would flush std::cout first
        std::fputs("harl-updater-tool: there is not enough memory. End other programs and try again.\n", stderr);
    } catch (const std::exception& error) {
        std::fprintf(stderr,
                     "harl-updater-tool: internal error: %s. Report this line with the command to the "
                     "manufacturer.\n",
                     error.what());
    }
    return Report::STATUS_UNCHECKED;
}
