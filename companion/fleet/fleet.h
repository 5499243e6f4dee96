#pragma once

#include "log/run.h"

#include <array>
#include <cstdint>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <vector>

/// What a run means for whoever looks after the unit.
enum class UnitState {
    WELL,
    NOT_WELL,    ///< It passed, but the log does not prove that the unit is well.
    NEVER_ENDED, ///< The log shows no end of it.
    FAILED,
    NOT_SEEN, ///< The unit has not run since the date that was asked for.
};
/// A state's name for programs, such as "never-ended", and for people: "Began and never ended".
struct StateName
{
    const char* name;
    const char* title;
};

extern const std::array<StateName, 5> stateNames; ///< in the order of UnitState

inline const StateName& nameOf(UnitState state)
{
    return stateNames.at(static_cast<std::size_t>(state));
}

/// What a fleet keeps of a run. The texts are the Fleet's own.
struct FleetRun
{
    std::int64_t begin = 0;  ///< as ParsedRecord::time
    std::int64_t end = 0;    ///< of its last record
    std::uint64_t boot = 0;  ///< the boot's ID shortened; 0: not known
    std::uint64_t lines = 0; ///< of its log
    bool mainHead = false;
    Outcome outcome = Outcome::NONE;
    UnitState state = UnitState::WELL;
    const std::string* meaning = nullptr;
    const std::string* package = nullptr; ///< version after the run; empty: not known
    const std::string* board = nullptr;   ///< likewise
    const Failure* failure = nullptr;
    std::vector<const Failure*> besides;
};

struct FleetUnit
{
    std::string name;    ///< the host's, or that of the file where the log does not tell
    std::string machine; ///< its ID; empty where the log does not tell
    std::vector<FleetRun> runs;

    UnitState state = UnitState::WELL; ///< of the last run; what follows is set by Fleet::finish()
    const std::string* package = nullptr;
    const std::string* board = nullptr;

    const FleetRun& last() const { return runs.back(); }
};

/// Something that could not be read.
struct Unread
{
    std::string source;
    std::string why;
};

/// Gathers the runs of many units by machine.
class Fleet
{
public:
    /// Adds a run, explained before. Several threads may call it at once.
    ///
    /// @param machine  the machine's ID, or a name that no other unit has
    /// @param boot     the boot's ID, shortened; 0 when it is not known
    void add(const std::string& machine, const std::string& name, const Run& run, std::uint64_t boot);

    /// Counts a line that came before. Several threads may call it at once.
    void addRepeats(std::uint64_t lines);

    /// Brings each unit's runs into the order of its clock, drops those that were read twice, and finds the states.
    ///
    /// @param since  as ParsedRecord::time: runs that began before do not count
    void finish(std::int64_t since);

    const std::map<std::string, FleetUnit>& units() const { return mUnits; }
    std::uint64_t repeatedLines() const { return mRepeatedLines; }
    std::uint64_t repeatedRuns() const { return mRepeatedRuns; }

private:
    const std::string* kept(const std::string& text) { return &*mTexts.insert(text).first; }
    void dropRepeats(std::vector<FleetRun>& runs);

    std::mutex mMutex;
    std::map<std::string, FleetUnit> mUnits;
    std::set<std::string> mTexts;
    std::uint64_t mRepeatedLines = 0;
    std::uint64_t mRepeatedRuns = 0;
};
