#pragma once

#include "log/parser.h"

#include <cstdint>
#include <deque>
#include <functional>
#include <optional>
#include <string>
#include <vector>

/// What the updater does in one run, in its order.
enum class StepKind {
    START,
    STOP_APPLICATION,
    REFRESH_MIRRORS,
    CHECK_PACKAGE,
    INSTALL_PACKAGE,
    CHECK_BOARD,
    UPLOAD_BOARD,
    RUN_BOARD_SCRIPT,
    WAIT_FOR_BOARD,
    CHECK_TEAMVIEWER,   // main head only
    INSTALL_TEAMVIEWER, // main head only
    REMOVE_MARKER,
    SHOW_OUTCOME,
    SHOW_TO_OPERATOR,
    GIVE_BACK,
    STOP_UPDATER,
};
const std::size_t stepKinds = static_cast<std::size_t>(StepKind::STOP_UPDATER) + 1;

enum class StepResult {
    UNFINISHED, ///< The log does not show its end.
    DONE,
    FAILED,
    UNTOLD, ///< It ended, but the record that tells how is missing.
};

/// One command, one attempt of it, or one wait.
struct Action
{
    std::string text;
    std::int64_t start = 0; ///< All times as ParsedRecord::time.
    std::optional<std::int64_t> end;
    std::string status; ///< in plain words; empty when the log holds none
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
    std::deque<OtherLine> last;
    std::uint64_t count = 0;
    std::uint64_t leftOut = 0; ///< between the first and the last

    void add(std::string_view text);

    /// Text for people, a line each: "scp: Connection closed (20 times)".
    std::vector<std::string> shown() const;

    bool contain(const std::string& part) const;
};

struct Step
{
    StepKind kind = StepKind::START;
    std::uint64_t line = 0; ///< where it begins in the log
    std::int64_t start = 0;
    std::optional<std::int64_t> end;
    StepResult result = StepResult::UNFINISHED;
    std::string detail;       ///< the result in a few plain words
    std::string word;         ///< the record's message that told a failure
    std::optional<long> code; ///< exit code, or raw wait status for those steps whose command's raw status is logged
    std::vector<Action> actions;
    int failedAttempts = 0; ///< of the upload
    OtherLines said;
};

/// A version check's result.
struct Versions
{
    std::string installed;
    std::string candidate;
    bool found = false;  ///< both
    bool differ = false; ///< an update is due
};

enum class Outcome {
    NONE, ///< The log does not reach it.
    NO_UPDATE,
    UPDATED,
    UPDATE_OFFERED, ///< main head only: a list for its user
    CHECK_FAILED,
    MIRRORS_FAILED,
    PACKAGE_FAILED,
    BOARD_FAILED,
    TEAMVIEWER_FAILED, ///< main head only
    UNKNOWN_FAILURE,   ///< an error was reported, the record that tells which is missing
};

enum class RunEnd {
    NOT_SEEN,
    BY_SERVICE_MANAGER, ///< at the updater's own last command
    BY_ITSELF,          ///< not run as the service
    EARLY,              ///< The service manager, or what it runs afterwards, says so.
};

/// What went wrong in a run and what to do about it.
struct Problem
{
    std::string name; ///< fixed name in kebab-case, for programs and the documents
    std::size_t step; ///< index of the run's step; see Run::stepOf()
    std::string why;
    std::string remedy;
};

/// One run of the updater, as far as a log tells it.
struct Run
{
    std::uint64_t number = 0; ///< in its log, from 1
    std::uint64_t firstLine = 0;
    std::uint64_t lastLine = 0;
    std::int64_t begin = 0;
    std::int64_t end = 0;
    bool beginningMissing = false;
    bool mainHead = false;
    bool clockSetBack = false;
    std::string version; ///< of the updater
    std::vector<Step> steps;
    std::uint64_t stepsLeftOut = 0;
    Versions package;
    Versions board;
    bool markerReported = false;
    Outcome outcome = Outcome::NONE;
    RunEnd ended = RunEnd::NOT_SEEN;
    bool followedByAnother = false; ///< The log goes on with another run.
    std::uint64_t ledFailures = 0;
    std::uint64_t outcomeLedFailures = 0;
    bool soundFailed = false;
    bool statusesLost = false; ///< Some command's status was -1.
    std::uint64_t tornRecords = 0;
    std::uint64_t firstTornLine = 0;
    std::uint64_t otherLines = 0;
    OtherLines serviceManager;          ///< its lines, and those of what it runs after the updater
    bool failureShownByService = false; ///< LED_FAIL, lit after the updater had ended without an outcome
    std::string mainThread;
    std::string updateThread;

    /// Set by explain().
    std::optional<Problem> failure; ///< what decided a bad outcome
    std::vector<Problem> besides;
    std::vector<std::string> untold; ///< what the log cannot tell

    const Step* find(StepKind kind) const; ///< the last one, or null

    /// The step that `problem` is about; null when the log shows none of this run's steps.
    const Step* stepOf(const Problem& problem) const;
};

/// Name of a step for people, such as "Refresh the package mirrors".
const char* stepTitle(StepKind kind);

/// Name of a step for programs, such as "refresh-mirrors".
const char* stepName(StepKind kind);

/// Name of a result for programs, such as "failed".
const char* resultName(StepResult result);

/// Makes runs of records. Memory is bounded: of each run the first steps and a few lines of other programs are kept.
class RunBuilder : public LogSink
{
public:
    /// @param runComplete  gets each run when the next one begins or the log ends
    explicit RunBuilder(std::function<void(Run&)> runComplete) : mRunComplete(std::move(runComplete)) {}

    void record(const ParsedRecord& record) override;
    void otherLine(std::uint64_t line, std::string_view program, std::string_view text) override;
    void torn(std::uint64_t line) override;

    /// The log has ended.
    void finish();

    /// The run that is not handed over yet, or null.
    const Run* current() const { return mRun ? &*mRun : nullptr; }

    std::uint64_t runs() const { return mRuns; }

private:
    void beginRun(const ParsedRecord& record);
    void endRun(bool followedByAnother);

    void takeEntry(const ParsedRecord& record);
    void takeService(const ParsedRecord& record);
    void takeCheck(const ParsedRecord& record);
    void takeInstallation(const ParsedRecord& record);
    void takeBoard(const ParsedRecord& record);
    void takeCommand(const ParsedRecord& record);
    void takeProcedure(const ParsedRecord& record);
    void takeTeamViewer(const ParsedRecord& record);
    void takeFeedback(const ParsedRecord& record);

    Step& beginStep(StepKind kind, const ParsedRecord& record);
    void endStepWithoutRecord(const ParsedRecord& record);
    void endStep(const ParsedRecord& record, StepResult result, std::string detail);
    void fail(const ParsedRecord& record, std::string detail);
    void beginAction(const ParsedRecord& record, std::string_view text);
    void beginWait(const ParsedRecord& record, std::int64_t seconds);
    void endAction(const ParsedRecord& record, std::string status);
    void noteRawStatus(long status);
    Step* openStep(StepKind kind);

    std::function<void(Run&)> mRunComplete;
    std::optional<Run> mRun;
    std::uint64_t mRuns = 0;
    Outcome mVerdict = Outcome::NONE; // what the procedure said before it reports an error
    std::uint64_t mTornBefore = 0;    // pieces in front of the next run's first record
};
