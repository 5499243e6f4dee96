#pragma once

#include "log/run.h"

#include <atomic>
#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <vector>

/// What a fleet keeps of a run.
struct FleetRun
{
    std::int64_t begin = 0;  ///< as ParsedRecord::time
    std::int64_t end = 0;    ///< of its last record
    std::string boot;        ///< the boot's ID; empty: not known
    std::uint64_t lines = 0; ///< of its log
    std::string state;       ///< "well", "not-well" (though it passed), "never-ended", "failed" or "not-seen"
    std::string outcome;     ///< as outcomeName()
    std::string meaning;
    std::string failure;              ///< the name of what decided a bad outcome; empty for nothing
    std::vector<std::string> besides; ///< names of what else went wrong
    // Until finish(), these two are empty where the log does not tell; then "not known", if no run before told.
    std::string package; ///< with its version after the run
    std::string board;   ///< its version
};

struct FleetUnit
{
    std::string name;           ///< the host's, or that of the file where the log does not tell
    std::string machine;        ///< its ID; empty where the log does not tell
    std::vector<FleetRun> runs; ///< never empty
};

/// Gathers the runs of many units by machine. Several threads may add to it at once.
class Fleet
{
public:
    /// Adds a run, explained before.
    ///
    /// @param machine  the machine's ID; empty for a unit of this name alone
    /// @param boot     the boot's ID; empty when it is not known
    void add(const std::string& machine, const std::string& name, const std::string& boot, const Run& run);

    /// Counts a line that came before.
    void addRepeat() { ++mRepeats; }

    /// Brings each unit's runs into the order of its clock, drops those that were read twice, and fills in the versions
    /// that a run did not read.
    ///
    /// @param since   "2026-11-21": of a unit's runs before only the last one stays, as "not-seen", if none came after;
    ///                empty: all count
    /// @param failed  only the units whose last run met this failure stay; empty: all
    void finish(const std::string& since, const std::string& failed);

    const std::map<std::string, FleetUnit>& units() const { return mUnits; }
    std::uint64_t repeats() const { return mRepeats; } ///< lines that came before

private:
    std::mutex mMutex;
    std::map<std::string, FleetUnit> mUnits;
    std::atomic<std::uint64_t> mRepeats = 0; // lines
};
