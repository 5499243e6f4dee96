#include "log/run.h"

#include "LedManager.h"
#include "procedure.h"

#include <algorithm>
#include <utility>

namespace
{

const std::size_t mostSteps = 64;       // of a run; an update has 14
const std::size_t mostActions = 32;     // of a step; an upload has 20 attempts
const std::size_t longestText = 400;    // bytes kept of a text
const std::size_t mostLinesAtEnds = 10; // of other programs: the first and the last
const std::int64_t longestGap = 86400;  // s between two records
const std::int64_t mostDelay = 60;      // s by which a wait may end late

/// A version check's result, and what stands between the two versions.
struct VersionEvent
{
    Event event;
    Versions::State state;
    const char* between;
};

const VersionEvent versionEvents[] = {
    {Event::VERSIONS_DIFFER, Versions::State::DIFFER, " -> "},
    {Event::VERSIONS_SAME, Versions::State::SAME, " == "},
    {Event::BOARD_NOT_READ, Versions::State::NOT_READ, " -> "},
    {Event::STICK_NOT_READ, Versions::State::NOT_READ, " -> "},
};
const std::pair<Event, bool Run::*> factEvents[] = {
    {Event::MAIN_INSTALLS, &Run::partsInstalled}, {Event::MARKER_REMOVED, &Run::markerRemoved},
    {Event::RESULT, &Run::resultReported},        {Event::ERROR, &Run::errorReported},
    {Event::SOUND_FAILED, &Run::soundFailed},
};
const std::pair<Event, Outcome> outcomeEvents[] = {
    {Event::MAIN_FINISHED, Outcome::UPDATED},       {Event::MIRRORS_REPORTED, Outcome::MIRRORS_FAILED},
    {Event::CHECK_REPORTED, Outcome::CHECK_FAILED}, {Event::PACKAGE_REPORTED, Outcome::PACKAGE_FAILED},
    {Event::BOARD_REPORTED, Outcome::BOARD_FAILED},
};

const std::pair<StepKind, Outcome> stepFailures[] = {
    {StepKind::REFRESH_MIRRORS, Outcome::MIRRORS_FAILED}, {StepKind::CHECK_PACKAGE, Outcome::CHECK_FAILED},
    {StepKind::CHECK_TEAMVIEWER, Outcome::CHECK_FAILED},  {StepKind::INSTALL_PACKAGE, Outcome::PACKAGE_FAILED},
    {StepKind::UPLOAD_BOARD, Outcome::BOARD_FAILED},
};

/// Printable, and no longer than what is kept of a text.
std::string kept(std::string_view text)
{
    const bool whole = text.size() <= longestText;
    return escaped(text.substr(0, longestText)) + (whole ? "" : "...");
}

/// What a status says about a step; -1 says nothing.
StepResult resultOf(const std::optional<CommandStatus>& status)
{
    if (!status || status->lost()) {
        return StepResult::UNTOLD;
    }
    return status->number == 0 ? StepResult::DONE : StepResult::FAILED;
}

/// Takes "A -> B" or "A == B" apart at `separator`.
void splitVersions(std::string_view text, std::string_view separator, Versions& versions)
{
    const std::size_t position = text.find(separator);
    if (position != std::string_view::npos) {
        versions.installed = kept(text.substr(0, position));
        versions.candidate = kept(text.substr(position + separator.size()));
    }
}

/// True for a panel command that lights an outcome: not off, not the blue of the flashing.
bool lightsOutcome(std::string_view command)
{
    const auto lights = [&](LedManager::Color color) {
        return contains(command, " 0x" + std::to_string(color) + " c");
    };
    return lights(LedManager::COLOR_PASS) || lights(LedManager::COLOR_FAIL);
}

/// True for a step whose result is its one command's exit code.
bool isOneCommand(StepKind kind)
{
    return kind == StepKind::REFRESH_MIRRORS || kind == StepKind::INSTALL_PACKAGE;
}

/// True for a step that comes only when the package or the board is installed.
bool installs(StepKind kind)
{
    return kind == StepKind::INSTALL_PACKAGE || (kind >= StepKind::UPLOAD_BOARD && kind <= StepKind::WAIT_FOR_BOARD);
}

/// How a step came out of whose end there is no record, the next one having begun.
StepResult resultWithoutRecord(Step& step, StepKind next)
{
    if (step.kind == StepKind::UPLOAD_BOARD) {
        return next == StepKind::RUN_BOARD_SCRIPT || next == StepKind::WAIT_FOR_BOARD ? StepResult::DONE
               : step.failedAttempts >= uploadAttempts                                ? StepResult::FAILED
                                                                                      : StepResult::UNTOLD;
    }
    if (step.kind == StepKind::GIVE_BACK) {
        if (step.actions.size() > 2) { // both have ended
            const bool mounted = resultOf(step.actions[0].status) == StepResult::FAILED;
            return mounted ? StepResult::FAILED : resultOf(step.actions[1].status);
        }
        step.actions[0].status.reset(); // one of two numbers, and no telling which
    }
    const bool waited = !step.actions.empty() && *step.actions.back().command == '\0';
    if (waited || step.kind == StepKind::START || step.kind == StepKind::SHOW_OUTCOME) {
        return StepResult::DONE;
    }
    return isOneCommand(step.kind) ? resultOf(step.status) : StepResult::UNTOLD;
}

Outcome mainHeadOutcome(const Run& run)
{
    if (run.partsInstalled) {
        return Outcome::NONE; // until it is reported as finished
    }
    if (run.board.state == Versions::State::NOT_READ) {
        return Outcome::CHECK_FAILED;
    }
    if (!run.markerRemoved) {
        return Outcome::NONE;
    }
    if (run.package.differ() || run.board.differ() || run.teamViewer.value_or(false)) {
        return Outcome::UPDATE_OFFERED;
    }
    return run.package.found() && run.board.found() && run.teamViewer ? Outcome::NO_UPDATE : Outcome::PASSED;
}

Outcome remoteHeadOutcome(const Run& run)
{
    if (run.errorReported) {
        // An unread board ends a run with an error only after an installation.
        return run.board.state == Versions::State::NOT_READ ? Outcome::CHECK_FAILED : Outcome::FAILED;
    }
    if (!run.isDecided()) {
        return Outcome::NONE;
    }
    const bool same = run.package.state == Versions::State::SAME;
    if (run.resultReported) {
        const bool installed =
            std::any_of(run.steps.begin(), run.steps.end(), [](const Step& step) { return installs(step.kind); });
        if (run.package.differ() || run.board.differ() || run.markerRemoved || installed) {
            return Outcome::UPDATED;
        }
        return same && run.board.state != Versions::State::UNKNOWN ? Outcome::NO_UPDATE : Outcome::PASSED;
    }
    // What was reported is not in the log; the checks may decide it.
    if (run.markerRemoved || run.find(StepKind::RUN_BOARD_SCRIPT) != nullptr) {
        return Outcome::UPDATED;
    }
    const Step* install = run.find(StepKind::INSTALL_PACKAGE);
    const bool installed = install != nullptr && install->result == StepResult::DONE;
    if (run.board.state == Versions::State::SAME) {
        return same ? Outcome::NO_UPDATE : installed ? Outcome::UPDATED : Outcome::NONE;
    }
    if (run.board.state == Versions::State::NOT_READ) {
        return same ? Outcome::NO_UPDATE : installed ? Outcome::CHECK_FAILED : Outcome::NONE;
    }
    return Outcome::NONE;
}

Outcome outcomeOf(const Run& run)
{
    if (run.named != Outcome::NONE) {
        return run.named;
    }
    for (auto step = run.steps.rbegin(); step != run.steps.rend(); ++step) {
        if (const Outcome outcome = failureOf(*step); outcome != Outcome::NONE) {
            return outcome;
        }
    }
    return run.mainHead ? mainHeadOutcome(run) : remoteHeadOutcome(run);
}

} // namespace

Outcome failureOf(const Step& step)
{
    const bool refused = isOneCommand(step.kind) && step.status && step.status->number != 0;
    for (const auto& [kind, outcome] : stepFailures) {
        if (kind == step.kind && (refused || step.result == StepResult::FAILED)) {
            return outcome;
        }
    }
    return Outcome::NONE;
}

std::vector<std::size_t> failedCommands(const Step& step)
{
    std::vector<std::size_t> failed;
    for (std::size_t command = 0; command < step.actions.size(); ++command) {
        if (const auto& status = step.actions[command].status; status && status->number != 0) {
            failed.push_back(command);
        }
    }
    return failed;
}

void OtherLines::add(std::string_view text)
{
    ++count;
    OtherLine* previous = !last.empty() ? &last.back() : !first.empty() ? &first.back() : nullptr;
    OtherLine line = {kept(text)};
    if (previous != nullptr && previous->text == line.text) {
        ++previous->times;
        return;
    }
    if (first.size() < mostLinesAtEnds) {
        first.push_back(std::move(line));
        return;
    }
    last.push_back(std::move(line));
    if (last.size() > mostLinesAtEnds) {
        leftOut += last.front().times;
        last.erase(last.begin());
    }
}

const Step* Run::find(StepKind kind) const
{
    const auto found = std::find_if(steps.rbegin(), steps.rend(), [&](const Step& step) { return step.kind == kind; });
    return found == steps.rend() ? nullptr : &*found;
}

const Step* Run::stepOf(const Problem& problem) const
{
    return problem.step < steps.size() ? &steps[problem.step] : nullptr;
}

bool Run::isDecided() const
{
    return ended == RunEnd::BY_ITSELF || (!steps.empty() && steps.back().kind >= StepKind::SHOW_OUTCOME);
}

bool isFailure(Outcome outcome)
{
    return outcome >= Outcome::FAILED;
}

// Runs

void RunBuilder::record(const ParsedRecord& record)
{
    Meaning meaning = meaningOf(record.operation, record.message);
    const bool number = meaning.number && meaning.rest.empty();
    if (record.cut && (number || (record.message && record.message->empty()))) { // digits, or all, may be missing
        meaning = {};
    }
    const bool otherSource = std::exchange(mSourceEnded, false) && mThread != record.thread;
    mThread = record.thread;
    if (!mRun || otherSource || beginsRun(meaning, record.message.has_value())) {
        beginRun(record.line, record.time);
        mRun->beginningMissing = meaning.event != Event::VERSION && meaning.event != Event::MAIN_CHECKS &&
                                 record.operation != "setCallbacks";
    }
    mRun->lastLine = record.line + 1;
    noteTime(record, meaning);
    mRun->mainHead = mRun->mainHead || record.operation == "initMainHead" || record.operation == "updateMainHead";
    if (meaning.event == Event::NONE ||
        (mRun->mainHead && meaning.step == StepKind::SHOW_OUTCOME)) { // the main head's program has callbacks too
        return;
    }
    takeRunEvent(record, meaning);
    if (meaning.step) {
        takeStepEvent(stepFor(*meaning.step, record), record, meaning);
    } else if (!mRun->steps.empty()) {
        takeStepEvent(mRun->steps.back(), record, meaning);
    }
    mRun->outcome = outcomeOf(*mRun);
}

/// True for a record that cannot belong to the run that goes on: the procedure only goes forward.
///
/// @param whole  the record has its message
bool RunBuilder::beginsRun(const Meaning& meaning, bool whole) const
{
    if (meaning.event == Event::VERSION || (mRun->ended == RunEnd::EARLY && meaning.event != Event::NONE && whole)) {
        return true;
    }
    if (mRun->steps.empty()) {
        return false;
    }
    const StepKind last = mRun->steps.back().kind;
    if (meaning.event == Event::RUN_BEGINS) {
        return last > StepKind::START;
    }
    if (meaning.event == Event::MAIN_CHECKS) {
        return last >= StepKind::GIVE_BACK;
    }
    if (!meaning.step || *meaning.step >= last) {
        return false;
    }
    const bool part = installs(*meaning.step) || *meaning.step == StepKind::INSTALL_TEAMVIEWER;
    return !(mRun->mainHead && part && last < StepKind::GIVE_BACK);
}

void RunBuilder::otherLine(std::uint64_t line, std::string_view program, std::string_view text)
{
    const std::optional<ServiceEvent> event = serviceEventOf(text);
    if (event && startsWith(text, "prepare: ")) { // the next run's
        mBefore.events.set(static_cast<std::size_t>(*event));
        mBefore.lines.add(text);
        if (event == ServiceEvent::NOT_ALLOWED) {
            beginRun(line, mRun ? mRun->end : 0);
            mRun->ended = RunEnd::EARLY;
        }
        return;
    }
    if (!mRun) {
        return;
    }
    const bool manager = program == "systemd" || startsWith(text, "harl-updater.service: ");
    if (manager && startsWith(text, "Start")) {
        return; // the next run's
    }
    mRun->lastLine = line;
    if (manager || event) {
        mRun->service.lines.add(text);
        takeServiceLine(event.value_or(ServiceEvent::NONE), text);
        return;
    }
    ++mRun->otherLines;
    if (!mRun->steps.empty()) {
        Step& step = mRun->steps.back();
        step.said.add(text);
        const Failure* said = failureSaid(text, step.kind);
        step.pointsTo = said != nullptr && (step.pointsTo == nullptr || said < step.pointsTo) ? said : step.pointsTo;
    }
}

void RunBuilder::takeServiceLine(ServiceEvent event, std::string_view text)
{
    ServiceFacts& service = mRun->service;
    service.events.set(static_cast<std::size_t>(event));
    if (event == ServiceEvent::UNIT_NOT_WELL || event == ServiceEvent::UNIT_OPEN) {
        service.unit = kept(text.substr(text.find(": ") + 2));
    }
    if (event == ServiceEvent::TIME_USED_UP && !mRun->steps.empty()) {
        mRun->steps.back().timeUsedUp = true;
    }
    if (mRun->ended == RunEnd::NOT_SEEN &&
        (event == ServiceEvent::FAILURE_SHOWN || contains(text, "Main process exited"))) {
        mRun->ended = RunEnd::EARLY;
    }
}

void RunBuilder::torn(std::uint64_t line)
{
    Torn& torn = mRun ? mRun->torn : mTornBefore;
    if (torn.records++ == 0) {
        torn.firstLine = line;
    }
}

void RunBuilder::beginRun(std::uint64_t line, std::int64_t time)
{
    endRun(true);
    mRun.emplace();
    mRun->number = ++mRuns;
    mRun->firstLine = mRun->lastLine = line;
    mRun->begin = mRun->end = time;
    mRun->service = std::exchange(mBefore, {});
    mRun->torn = std::exchange(mTornBefore, {});
}

void RunBuilder::endRun(bool followedByAnother)
{
    if (mRun) {
        mRun->followedByAnother = followedByAnother;
        mRunComplete(*mRun);
        mRun.reset();
    }
}

/// Counts the time since the record before, unless the clock jumped.
void RunBuilder::noteTime(const ParsedRecord& record, const Meaning& meaning)
{
    std::int64_t gap = record.time - mRun->end;
    mRun->end = record.time;
    if (meaning.event == Event::SUCCEEDED && !mRun->steps.empty() && !mRun->steps.back().actions.empty()) {
        const Action& wait = mRun->steps.back().actions.back();
        const std::int64_t before = mRun->elapsed - wait.began;
        const std::int64_t late = before + gap - wait.wait;
        if (wait.wait != 0 && (late < -1 || late > mostDelay)) {
            ++mRun->clockJumps;
            mRun->elapsed += std::max<std::int64_t>(wait.wait - before, 0);
            return;
        }
    }
    if (gap < 0 || gap > longestGap) {
        ++mRun->clockJumps;
        gap = 0;
    }
    mRun->elapsed += gap;
}

// Events

/// What an event says about the run as a whole.
void RunBuilder::takeRunEvent(const ParsedRecord& record, const Meaning& meaning)
{
    Run& run = *mRun;
    Versions& versions = meaning.step == StepKind::CHECK_PACKAGE ? run.package : run.board;
    for (const auto& [event, state, between] : versionEvents) {
        if (event == meaning.event) {
            versions.state = state;
            splitVersions(meaning.rest, between, versions);
        }
    }
    for (const auto& [event, fact] : factEvents) {
        run.*fact = run.*fact || event == meaning.event;
    }
    for (const auto& [event, outcome] : outcomeEvents) {
        run.named = event == meaning.event ? outcome : run.named;
    }
    switch (meaning.event) {
    case Event::VERSION:
        run.version = kept(meaning.rest);
        break;
    case Event::ENDED_BY_ITSELF:
        run.ended = RunEnd::BY_ITSELF;
        break;
    case Event::STOPS_UPDATER:
        run.ended = RunEnd::BY_SERVICE_MANAGER;
        break;
    case Event::BOARD_VERSIONS: // of the lines shown, the last one before the verdict
        splitVersions(meaning.rest, "  ", run.board);
        run.board.unclear = !meaning.rest.empty() && !contains(meaning.rest, "  "); // the blanks between are gone
        break;
    case Event::TEAMVIEWER_REQUESTED:
    case Event::TEAMVIEWER_NOT_REQUESTED:
        run.mainHead = true;
        run.teamViewer = meaning.event == Event::TEAMVIEWER_REQUESTED;
        break;
    case Event::PANEL_FAILED:
        ++run.ledFailures;
        run.outcomeLedFailed = run.outcomeLedFailed || lightsOutcome(meaning.rest);
        break;
    default:
        break;
    }
    const bool command = meaning.event == Event::NOTED || meaning.event == Event::COMMAND;
    run.mainHead = run.mainHead || (command && contains(record.message.value_or(""), packageOf(true)));
}

/// What an event says about its step, or about the last one.
void RunBuilder::takeStepEvent(Step& step, const ParsedRecord& record, const Meaning& meaning)
{
    switch (meaning.event) {
    case Event::NOTED:
    case Event::STOPS_UPDATER: {
        const bool waits = *meaning.command == '\0';
        const std::int64_t wait = waits ? factsOf(step.kind).wait : 0;
        if (step.actions.empty() && (!waits || wait != 0)) {
            beginAction(step, meaning.command, wait);
        }
        break;
    }
    case Event::COMMAND:
    case Event::ATTEMPT:
        beginAction(step, meaning.command);
        break;
    case Event::EXIT_CODE:
        if (step.kind == StepKind::GIVE_BACK) { // its commands have wait statuses: another step's, not in the log
            break;
        }
        if (!step.took && !step.actions.empty() && !step.actions.back().took) {
            step.status = CommandStatus{*meaning.number, false};
            endAction(step, step.status);
            if (step.kind == StepKind::INSTALL_PACKAGE && *meaning.number == 0) {
                endStep(step, StepResult::DONE, meaning.event);
            }
        }
        break;
    case Event::ATTEMPT_FAILED:
        ++step.failedAttempts;
        if (step.actions.empty()) {
            break;
        }
        step.actions.back().attemptFailed = true;
        endAction(step, std::nullopt);
        if (step.failedAttempts < uploadAttempts) {
            beginAction(step, step.actions.back().command);
        }
        break;
    case Event::RAW_STATUS:
        takeStatus(step, *meaning.number);
        break;
    case Event::MARKER_REMOVED:
        beginAction(step, meaning.command);
        [[fallthrough]];
    case Event::SUCCEEDED:
    case Event::VERSIONS_DIFFER:
    case Event::VERSIONS_SAME:
    case Event::TEAMVIEWER_REQUESTED:
    case Event::TEAMVIEWER_NOT_REQUESTED:
        endAction(step, std::nullopt);
        endStep(step, StepResult::DONE, meaning.event);
        break;
    case Event::FAILED:
    case Event::BOARD_NOT_READ:
    case Event::STICK_NOT_READ:
        if (step.word.empty()) {
            step.word = kept(record.message.value_or(""));
        }
        if (meaning.number && step.kind == StepKind::REFRESH_MIRRORS && !step.status) {
            step.status = CommandStatus{*meaning.number, false};
        }
        if (step.kind == StepKind::INSTALL_PACKAGE && !step.took && !meaning.rest.empty()) {
            // The code and the command's output, with nothing between: only the record before tells where it ends.
            const std::string code = step.status ? std::to_string(step.status->number) : "";
            if (startsWith(*record.message, code)) {
                step.said.add(record.message->substr(code.size()));
            }
        }
        endStep(step, StepResult::FAILED, meaning.event);
        break;
    case Event::OUTCOME_SHOWN:
        if (step.kind == StepKind::SHOW_OUTCOME) {
            endStep(step, StepResult::DONE, meaning.event);
        }
        break;
    default:
        break;
    }
}

/// Takes the wait status of the command that goes on.
void RunBuilder::takeStatus(Step& step, long number)
{
    const CommandStatus status = {number, true};
    mRun->statusesLost = mRun->statusesLost || status.lost();
    if (step.kind == StepKind::GIVE_BACK) {
        if (step.actions.empty()) {
            beginAction(step, "umount /root/USB_MOUNT/");
        }
        const std::size_t command = step.actions.size();
        if (command > 2) {
            return;
        }
        endAction(step, status);
        if (command == 1) {
            beginAction(step, "systemctl start harl");
            return;
        }
        if (!status.lost()) {
            mRun->applicationStarted = number == 0;
        }
        beginAction(step, "", giveBackWait);
        return;
    }
    if (step.took) {
        return;
    }
    if (step.kind == StepKind::STOP_UPDATER) {
        mRun->ended = RunEnd::BY_ITSELF;
    }
    step.status = status;
    endAction(step, status);
    endStep(step, resultOf(status), Event::RAW_STATUS);
}

// Steps and their commands

/// The last step if it is of this kind, else a new one.
Step& RunBuilder::stepFor(StepKind kind, const ParsedRecord& record)
{
    std::vector<Step>& steps = mRun->steps;
    if (!steps.empty() && steps.back().kind == kind) {
        return steps.back();
    }
    if (!steps.empty() && !steps.back().took) {
        Step& last = steps.back();
        const StepResult result = resultWithoutRecord(last, kind);
        const bool uploaded = last.kind == StepKind::UPLOAD_BOARD && result == StepResult::DONE;
        endAction(last, uploaded ? std::optional(CommandStatus()) : std::nullopt);
        endStep(last, result, Event::NONE);
    }
    if (steps.size() == mostSteps) {
        ++mRun->stepsLeftOut;
        steps.pop_back();
    }
    Step& step = steps.emplace_back();
    step.kind = kind;
    step.line = record.line;
    step.start = record.time;
    step.began = mRun->elapsed;
    return step;
}

void RunBuilder::endStep(Step& step, StepResult result, Event event)
{
    if (!step.took) {
        step.took = mRun->elapsed - step.began;
        step.result = result;
        step.event = event;
    }
}

/// @param command  empty: a wait
/// @param wait     its length (s)
void RunBuilder::beginAction(Step& step, const char* command, std::int64_t wait)
{
    if (step.actions.size() < mostActions) {
        step.actions.push_back({command, wait, mRun->end, mRun->elapsed});
    }
}

void RunBuilder::endAction(Step& step, std::optional<CommandStatus> status)
{
    if (!step.actions.empty() && !step.actions.back().took) {
        Action& action = step.actions.back();
        action.took = mRun->elapsed - action.began;
        action.status = status;
    }
}
