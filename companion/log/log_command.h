#pragma once

#include <cstdint>
#include <iosfwd>
#include <string>
#include <vector>

struct LogOptions
{
    std::vector<std::string> files; ///< in their order; "-" or none: standard input
    bool journal = false;           ///< the service's journal instead of files
    bool follow = false;            ///< show the run that goes on instead of explaining those that were
    bool list = false;              ///< one line for each run
    std::uint64_t run = 0;          ///< only the run with this number; 0: all
    bool last = false;              ///< only the last run
    bool strict = false;            ///< a run with a warning did not go well
    bool json = false;              ///< for programs: one object; with `follow` one for each change
    bool terminal = false;          ///< the output is one
    std::string htmlFile;           ///< also write a page with the timelines there; empty for none
};

/// What does not go together in `options`, in words; empty for nothing.
std::string conflictIn(const LogOptions& options);

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
