#pragma once

#include <iosfwd>
#include <string>

struct LogOptions
{
    std::string file = "-"; ///< "-": standard input
    bool journal = false;   ///< the service's journal instead of a file
    bool follow = false;    ///< show the run that goes on instead of explaining those that were
    bool json = false;      ///< for programs: one object; with `follow` one for each change
    bool terminal = false;  ///< the output is one
    std::string htmlFile;   ///< also write a page with the timelines there; empty for none
};

/// Exit status of `harl-updater-tool log`.
enum LogStatus {
    LOG_WENT_WELL = 0,
    LOG_WENT_WRONG = 1, ///< The last run failed, did not finish, or did not start the application again.
    LOG_UNREADABLE = 2, ///< Wrong usage, unreadable input, or no record in it.
};

/// Explains the runs in a log of the updater, or follows the one that goes on: harl-updater-tool log.
///
/// @return a LogStatus; all that could be read is explained even if reading fails in the middle
int runLog(const LogOptions& options, std::ostream& out, std::ostream& err);
