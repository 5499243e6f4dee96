#pragma once

#include "log/catalogue.h"
#include "log/parser.h"

#include <bitset>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

enum class StepResult {
    UNFINISHED, ///< The log does not show its end.
    DONE,
    FAILED,
    UNTOLD, ///< It ended, but the record that tells how is missing.
};

/// How a command ended, as the updater logs it.
struct CommandStatus
{
    long number = 0;
    bool raw = false; ///< a wait status, -1 when it could not be had; else an exit code

    bool lost() const { return raw && number == -1; }
};

/// One command, one attempt of it, or one wait.
struct Action
{
    const char* command = "";                        ///< empty: a wait
    std::int64_t wait = 0;                           ///< s
    std::int64_t start = 0;                          ///< as ParsedRecord::time
    std::int64_t began = 0;                          ///< as Run::elapsed
    std::optional<std::int64_t> took = std::nullopt; ///< s
    std::optional<CommandStatus> status = std::nullopt;
    bool attemptFailed = false; ///< one of several; its status is not logged
};

/// A line of another program, and how often it came in succession.
struct OtherLine
{
    std::string text; ///< cut to a few hundred bytes, printable
    std::uint64_t times = 1;
};

/// Lines of other programs: the first and the last few.
struct OtherLines
{
    std::vector<OtherLine> first;
    std::vector<OtherLine> last;
    std::uint64_t count = 0;
    std::uint64_t leftOut = 0; ///< between the first and the last

    void add(std::string_view text);
};

struct Step
{
    StepKind kind = StepKind::START;
    std::uint64_t line = 0;           ///< where it begins in the log
    std::int64_t start = 0;           ///< as ParsedRecord::time
    std::int64_t began = 0;           ///< as Run::elapsed
    std::optional<std::int64_t> took; ///< s, without jumps of the clock
    StepResult result = StepResult::UNFINISHED;
    Event event = Event::NONE; ///< that ended it
    std::string word;          ///< the record's message that reported a failure
    std::optional<CommandStatus> status;
    std::vector<Action> actions;
    int failedAttempts = 0;  ///< of the upload
    bool timeUsedUp = false; ///< The service ended a command of it.
    OtherLines said;
    const Failure* pointsTo = nullptr; ///< the entry that a tool's words point to
};

/// A version check's result.
struct Versions
{
    enum class State { UNKNOWN, NOT_READ, SAME, DIFFER };

    State state = State::UNKNOWN;
    std::string installed;
    std::string candidate;

    bool unclear = false; ///< Both were shown, but not which is which.

    bool differ() const { return state == State::DIFFER; }
    bool found() const { return state == State::SAME || state == State::DIFFER; }
};

enum class Outcome {
    NONE,   ///< The log does not tell.
    PASSED, ///< but the log does not tell whether anything was updated, on a main head whether it is offered
    NO_UPDATE,
    UPDATED,
    UPDATE_OFFERED, ///< main head only: a list for its user
    FAILED,         ///< but the record that tells at what is missing
    CHECK_FAILED,
    MIRRORS_FAILED,
    PACKAGE_FAILED,
    BOARD_FAILED,
};

enum class RunEnd {
    NOT_SEEN,
    BY_SERVICE_MANAGER, ///< at the updater's own last command
    BY_ITSELF,          ///< not run as the service
    EARLY,              ///< The service manager, or what it runs afterwards, says so.
};

/// What the service around the updater says.
struct ServiceFacts
{
    std::bitset<serviceEvents> events;
    std::string unit; ///< the words on the unit after the run, when it is not well
    OtherLines lines; ///< of the service manager and of what it runs around the updater

    bool has(ServiceEvent event) const { return events.test(static_cast<std::size_t>(event)); }
};

/// Records that are not whole.
struct Torn
{
    std::uint64_t records = 0;
    std::uint64_t firstLine = 0;
};

/// What went wrong in a run.
struct Problem
{
    const Failure* failure;
    std::size_t step;       ///< index of the run's step; see Run::stepOf()
    bool tolerated = false; ///< The run counts as passed all the same.
};

/// One run of the updater, as far as a log tells it.
struct Run
{
    std::uint64_t number = 0; ///< in its log, from 1
    std::uint64_t firstLine = 0;
    std::uint64_t lastLine = 0;
    std::int64_t begin = 0;
    std::int64_t end = 0;
    std::int64_t elapsed = 0; ///< s, without jumps of the clock
    std::uint64_t clockJumps = 0;
    bool beginningMissing = false;
    bool mainHead = false;
    std::string version; ///< of the updater
    std::vector<Step> steps;
    std::uint64_t stepsLeftOut = 0;
    Versions package;
    Versions board;
    std::optional<bool> teamViewer; ///< requested; main head only
    bool markerRemoved = false;
    bool partsInstalled = false; ///< main head only: an installation began
    bool resultReported = false;
    bool errorReported = false;
    Outcome named = Outcome::NONE;   ///< by the procedure's own word
    Outcome outcome = Outcome::NONE; ///< what follows from all of that
    RunEnd ended = RunEnd::NOT_SEEN;
    std::optional<bool> applicationStarted;
    bool followedByAnother = false; ///< The log goes on with another run.
    std::uint64_t ledFailures = 0;
    bool outcomeLedFailed = false;
    bool soundFailed = false;
    bool statusesLost = false; ///< Some command's status was -1.
    Torn torn;
    std::uint64_t otherLines = 0;
    ServiceFacts service;

    /// Set by explain().
    std::optional<Problem> failure; ///< what decided a bad outcome
    std::vector<Problem> besides;
    std::vector<std::string> gaps; ///< what its log leaves open, as names of the catalogue's gaps

    const Step* find(StepKind kind) const; ///< the last one, or null

    /// The step that `problem` is about; null when the log shows none of this run's steps.
    const Step* stepOf(const Problem& problem) const;

    /// True when the outcome was shown, or had been: all that decides it had happened.
    bool isDecided() const;
};

bool isFailure(Outcome outcome);

/// The failure that a step's own end decides; NONE for none.
Outcome failureOf(const Step& step);

/// The places of a step's commands whose status tells that they failed.
std::vector<std::size_t> failedCommands(const Step& step);

/// Gathers records into runs and steps. Memory stays bounded for a log of any size: each run is handed over when it is
/// complete, and of a run only so many steps, actions and lines are kept.
class RunBuilder : public LogSink
{
public:
    /// @param runComplete  called with each run, in order; it may change it
    explicit RunBuilder(std::function<void(Run&)> runComplete) : mRunComplete(std::move(runComplete)) {}

    void record(const ParsedRecord& record) override;
    void otherLine(std::uint64_t line, std::string_view program, std::string_view text) override;
    void torn(std::uint64_t line) override;

    /// A file has ended. A run goes on in the next one only if its records are of the same thread.
    void sourceEnds() { mSourceEnded = true; }

    /// The log has ended: hands over the last run.
    void finish() { endRun(false); }

    /// The run that goes on, or null.
    const Run* current() const { return mRun ? &*mRun : nullptr; }

private:
    bool beginsRun(const Meaning& meaning, bool whole) const;
    void beginRun(std::uint64_t line, std::int64_t time);
    void endRun(bool followedByAnother);
    void takeServiceLine(ServiceEvent event, std::string_view text);
    void noteTime(const ParsedRecord& record, const Meaning& meaning);
    void takeRunEvent(const ParsedRecord& record, const Meaning& meaning);
    void takeStepEvent(Step& step, const ParsedRecord& record, const Meaning& meaning);
    void takeStatus(Step& step, long number);

    Step& stepFor(StepKind kind, const ParsedRecord& record);
    void endStep(Step& step, StepResult result, Event event);
    void beginAction(Step& step, const char* command, std::int64_t wait = 0);
    void endAction(Step& step, std::optional<CommandStatus> status);

    std::function<void(Run&)> mRunComplete;
    std::optional<Run> mRun;
    std::uint64_t mRuns = 0;
    ServiceFacts mBefore; // of the service, before the next run
    std::string mThread;  // of the last record
    bool mSourceEnded = false;
    Torn mTornBefore; // in front of the first run
};
