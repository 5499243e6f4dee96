#pragma once

#include "log/run.h"

#include <array>
#include <cstdint>
#include <iosfwd>
#include <optional>
#include <string>

/// Shows the run that goes on while its log grows: a line for each change, on a terminal with a progress bar below it,
/// or one JSON object for each change.
class Follower
{
public:
    Follower(bool json, bool terminal, std::ostream& out) : mJson(json), mTerminal(terminal), mOut(out) {}

    /// A run has come to its end in the log: its steps tell how long they take.
    void runComplete(const Run& run);

    /// Shows what has changed since the last call, and how the step gets on.
    ///
    /// @param run  the last one of the log, or null
    /// @param now  as ParsedRecord::time
    void show(const Run* run, std::int64_t now);

    /// True once a run has ended that was not over at the first call of show().
    bool ended() const { return mEnded; }

private:
    std::optional<std::int64_t> expected(StepKind kind) const;
    void showChange(const Run* run, std::int64_t now);
    std::string changeText(const Run& run, bool over, bool overdue, std::int64_t now) const;
    void showBar(const Run& run, std::int64_t now);
    std::int64_t remaining(const Run& run, std::int64_t now) const;

    bool mJson;
    bool mTerminal;
    std::ostream& mOut;
    std::array<std::optional<std::int64_t>, stepKinds> mLast; // how long each step took (s)
    std::string mShown;                                       // what a change is told by
    std::optional<std::uint64_t> mFirstNumber;                // of the run at the first call of show()
    bool mRunning = false;
    bool mEnded = false;
    bool mBar = false; // a bar stands on the last line
};

/// The clock's time as ParsedRecord::time.
std::int64_t localNow();
