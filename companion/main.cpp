#include "findings.h"
#include "log/log_command.h"
#include "procedure.h"
#include "stick/stick_check.h"
#include "unit/unit_check.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <exception>
#include <iostream>
#include <new>
#include <string>

#include <CLI/CLI.hpp>
#include <unistd.h>

namespace
{

int run(int argc, char** argv)
{
    CLI::App app("Answers what a technician asks before and after an update. It never changes the updater.",
                 "harl-updater-tool");
    app.require_subcommand(1);
    app.set_version_flag("--version", "harl-updater-tool " VERSION, "Print the program's name and version and exit");

    std::string stickPath = stickMountPoint;
    bool json = false;
    CLI::App* stick = app.add_subcommand("stick", "Tell what the updater would do with a stick. Reads only.");
    stick->add_option("PATH", stickPath, "the folder that the stick is mounted at")->capture_default_str();
    stick->add_flag("--json", json, "print one JSON object");
    stick->footer("Exit status: 0 fit for an update, 1 not fit, 2 wrong usage or not everything could be read.\n");

    UnitOptions unitOptions;
    CLI::App* unit = app.add_subcommand("unit", "Tell whether this unit is fit for an update. Run it as root.");
    unit->add_flag("--panel", unitOptions.panel, "lamp test instead: all 14 LEDs in every colour");
    unit->add_flag("--sound", unitOptions.sound, "play both sounds instead");
    unit->add_flag("--json", unitOptions.json, "print one JSON object");
    unit->footer("Exit status: 0 fit or test passed, 1 not fit or test failed, 2 wrong usage, test refused or not "
                 "everything could be checked.\n");

    LogOptions logOptions;
    CLI::App* log = app.add_subcommand("log", "Explain the updater's log: what happened, why, and what to do now.");
    CLI::Option* file =
        log->add_option("FILE", logOptions.file, "the log; - for standard input")->capture_default_str();
    log->add_flag("--journal", logOptions.journal, "read the journal of the service harl-updater")->excludes(file);
    CLI::Option* follow = log->add_flag("--follow", logOptions.follow, "show the run that goes on, until it ends");
    log->add_flag("--json", logOptions.json, "print one JSON object; with --follow one for each change");
    log->add_option("--html", logOptions.htmlFile, "also write a page with each run's timeline")
        ->type_name("PAGE")
        ->excludes(follow);
    log->footer("Exit status: 0 the last run went well, 1 it failed or did not finish, 2 wrong usage or no log.\n");

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
        const bool unknown = error.get_name() == "RequiredError" && app.remaining_size() > 0; // no such subcommand
        const int status = unknown ? app.exit(CLI::ExtrasError(app.remaining())) : app.exit(error);
        return status == 0 ? 0 : Report::STATUS_UNCHECKED;
    }
    if (stick->parsed()) {
        return runStick(stickPath, json, std::cout, std::cerr);
    }
    if (log->parsed()) {
        logOptions.terminal = isatty(STDOUT_FILENO) == 1;
        return runLog(logOptions, std::cout, std::cerr);
    }
    return runUnit(unitOptions, thisUnit(), std::cout, std::cerr);
}

} // namespace

int main(int argc, char** argv)
{
    try {
        std::cout.exceptions(std::ios::badbit); // a full disk must not pass for a good answer
        const int status = run(argc, argv);
        std::cout.flush();
        return status;
    } catch (const std::ios_base::failure&) {
        std::fprintf(stderr, "harl-updater-tool: the output cannot be written: %s. Make room or name another file.\n",
                     std::strerror(errno));
    } catch (const std::bad_alloc&) {
        std::fputs("harl-updater-tool: there is not enough memory. End other programs and try again.\n", stderr);
    } catch (const std::exception& error) {
        std::fprintf(stderr, "harl-updater-tool: gave up: %s. Report this line with the command to the maker.\n",
                     error.what());
    }
    return Report::STATUS_UNCHECKED;
}
