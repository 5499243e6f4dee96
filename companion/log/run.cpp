#include "log/run.h"

#include "findings.h"
#include "log/status.h"
#include "procedure.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <utility>

namespace
{

const std::size_t mostSteps = 64;       // of a run; an update has 14
const std::size_t mostActions = 32;     // of a step; an upload has 20 attempts
const std::size_t longestText = 400;    // bytes kept of a text
const std::size_t mostLinesAtEnds = 10; // of other programs: the first and the last

struct KindText
{
    const char* name;
    const char* title;
};

// In the order of StepKind.
const std::array<KindText, stepKinds> kindTexts = {{
    {"start", "Start, darken the panel"},
    {"stop-application", "Stop the application harl"},
    {"refresh-mirrors", "Refresh the package mirrors"},
    {"check-package", "Compare the package's versions"},
    {"install-package", "Install the package"},
    {"check-board", "Compare the board's versions"},
    {"upload-board", "Upload the files to the board"},
    {"run-board-script", "Run the board's install script"},
    {"wait-for-board", "Leave the board 13 minutes"},
    {"check-teamviewer", "Look for the TeamViewer marker"},
    {"install-teamviewer", "Install TeamViewer"},
    {"remove-marker", "Remove the first-boot marker"},
    {"show-outcome", "Play and light the outcome"},
    {"show-to-operator", "Leave 30 s to read the panel"},
    {"give-back", "Release the stick, start harl"},
    {"stop-updater", "Stop the updater"},
}};

bool startsWith(std::string_view text, std::string_view start)
{
    return text.substr(0, start.size()) == start;
}

bool contains(std::string_view text, std::string_view part)
{
    return text.find(part) != std::string_view::npos;
}

/// Printable, and no longer than what is kept of a text.
std::string kept(std::string_view text)
{
    const bool whole = text.size() <= longestText;
    return escaped(text.substr(0, longestText)) + (whole ? "" : "...");
}

/// What a raw wait status says about a step; -1 says nothing.
StepResult resultOf(long status)
{
    if (status == -1) {
        return StepResult::UNTOLD;
    }
    return status == 0 ? StepResult::DONE : StepResult::FAILED;
}

/// A command line without its -o options, whose values are always the same.
std::string withoutOptions(std::string_view command)
{
    std::string text(command.substr(0, 2 * longestText));
    for (std::size_t option = text.find(" -o "); option != std::string::npos; option = text.find(" -o ", option)) {
        const std::size_t end = text.find(' ', option + 4);
        text.erase(option, end == std::string::npos ? std::string::npos : end - option);
    }
    return text;
}

/// The decimal number at the start of `text`, if there is one.
std::optional<long> leadingNumber(std::string_view text)
{
    long value = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
    return error == std::errc() ? std::optional<long>(value) : std::nullopt;
}

/// The decimal number that `text` is, if it is one.
std::optional<long> wholeNumber(std::string_view text)
{
    const std::optional<long> value = leadingNumber(text);
    return value && std::to_string(*value) == text ? value : std::nullopt;
}

/// Splits "A -> B" or "A == B" at `separator`. False, and no change, without it.
bool splitVersions(std::string_view text, std::string_view separator, Versions& versions)
{
    const std::size_t position = text.find(separator);
    if (position == std::string_view::npos) {
        return false;
    }
    versions.installed = kept(text.substr(0, position));
    versions.candidate = kept(text.substr(position + separator.size()));
    return true;
}

} // namespace

void OtherLines::add(std::string_view text)
{
    ++count;
    std::string line = kept(text);
    OtherLine* previous = !last.empty() ? &last.back() : !first.empty() ? &first.back() : nullptr;
    if (previous != nullptr && previous->text == line) {
        ++previous->times;
        return;
    }
    if (first.size() < mostLinesAtEnds) {
        first.push_back({std::move(line)});
        return;
    }
    last.push_back({std::move(line)});
    if (last.size() > mostLinesAtEnds) {
        leftOut += last.front().times;
        last.pop_front();
    }
}

std::vector<std::string> OtherLines::shown() const
{
    std::vector<std::string> lines;
    const auto show = [&](const OtherLine& line) {
        lines.push_back(line.text + (line.times > 1 ? " (" + counted(line.times, "time") + ')' : ""));
    };
    std::for_each(first.begin(), first.end(), show);
    if (leftOut > 0) {
        lines.push_back("... (" + counted(leftOut, "line") + " left out)");
    }
    std::for_each(last.begin(), last.end(), show);
    return lines;
}

bool OtherLines::contain(const std::string& part) const
{
    const auto holds = [&](const OtherLine& line) { return contains(line.text, part); };
    return std::any_of(first.begin(), first.end(), holds) || std::any_of(last.begin(), last.end(), holds);
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

const char* stepTitle(StepKind kind)
{
    return kindTexts.at(static_cast<std::size_t>(kind)).title;
}

const char* stepName(StepKind kind)
{
    return kindTexts.at(static_cast<std::size_t>(kind)).name;
}

const char* resultName(StepResult result)
{
    switch (result) {
    case StepResult::UNFINISHED:
        return "unfinished";
    case StepResult::DONE:
        return "done";
    case StepResult::FAILED:
        return "failed";
    case StepResult::UNTOLD:
        return "untold";
    }
    return "";
}

// Runs

void RunBuilder::record(const ParsedRecord& record)
{
    const bool banner = record.operation == "main" && startsWith(record.message, "TavrenUpdater version: ");
    const bool mainHeadBegins = record.operation == "initMainHead" && record.message.empty();
    if (!mRun || banner || (mainHeadBegins && mRun->find(StepKind::STOP_APPLICATION) != nullptr)) {
        beginRun(record);
        mRun->beginningMissing = !banner && !mainHeadBegins && record.operation != "setCallbacks";
    }
    mRun->lastLine = record.line + 1;
    mRun->clockSetBack = mRun->clockSetBack || record.time < mRun->end;
    mRun->end = record.time;

    if (record.operation == "main") {
        takeEntry(record);
    } else if (record.operation == "runProcess") {
        takeCommand(record);
    } else if (record.operation == "checkUpdate" || record.operation == "checkQuorbUpdate" ||
               record.operation == "updateMirrors") {
        takeCheck(record);
    } else if (record.operation == "installUpdate") {
        takeInstallation(record);
    } else if (record.operation == "uploadQuorbFiles" || record.operation == "installQuorbUpdate") {
        takeBoard(record);
    } else if (record.operation == "stopHARL" || record.operation == "startHARL" || record.operation == "stopUpdater") {
        takeService(record);
    } else if (record.operation == "checkTVUpdate" || record.operation == "installTVUpdate") {
        takeTeamViewer(record);
    } else if (record.operation == "updateRemoteHead" || record.operation == "initMainHead" ||
               record.operation == "updateMainHead" || record.operation == "deinitRemoteHead" ||
               record.operation == "deinit" || record.operation == "processUpdate") {
        takeProcedure(record);
    } else {
        takeFeedback(record);
    }
}

void RunBuilder::otherLine(std::uint64_t line, std::string_view program, std::string_view text)
{
    if (!mRun) {
        return;
    }
    const bool manager = program == "systemd" || startsWith(text, "harl-updater.service: ");
    if (manager && startsWith(text, "Start")) {
        return; // the next run's
    }
    mRun->lastLine = line;
    if (manager || startsWith(text, "give-back: ")) { // see service/give-back
        mRun->serviceManager.add(text);
        mRun->failureShownByService = mRun->failureShownByService || contains(text, "before it showed an outcome");
        if (mRun->ended == RunEnd::NOT_SEEN && (mRun->failureShownByService || contains(text, "Main process exited"))) {
            mRun->ended = RunEnd::EARLY;
        }
        return;
    }
    ++mRun->otherLines;
    if (!mRun->steps.empty()) {
        mRun->steps.back().said.add(text);
    }
}

void RunBuilder::torn(std::uint64_t line)
{
    if (!mRun) {
        ++mTornBefore;
        return;
    }
    if (mRun->tornRecords++ == 0) {
        mRun->firstTornLine = line;
    }
}

void RunBuilder::finish()
{
    endRun(false);
}

void RunBuilder::beginRun(const ParsedRecord& record)
{
    endRun(true);
    mVerdict = Outcome::NONE;
    mRun.emplace();
    mRun->number = ++mRuns;
    mRun->firstLine = record.line;
    mRun->begin = mRun->end = record.time;
    mRun->tornRecords = std::exchange(mTornBefore, 0);
    mRun->firstTornLine = mRun->tornRecords > 0 ? 1 : 0;
}

void RunBuilder::endRun(bool followedByAnother)
{
    if (!mRun) {
        return;
    }
    mRun->followedByAnother = followedByAnother;
    mRunComplete(*mRun);
    mRun.reset();
}

// Records, by the operation that wrote them

void RunBuilder::takeEntry(const ParsedRecord& record)
{
    static const std::string_view banner = "TavrenUpdater version: ";
    if (mRun->mainThread.empty()) {
        mRun->mainThread = kept(record.thread);
    }
    if (startsWith(record.message, banner)) {
        mRun->version = kept(record.message.substr(banner.size()));
        beginStep(StepKind::START, record);
    } else if (record.message == "AFTER UPDATE") {
        mRun->ended = RunEnd::BY_ITSELF;
    }
}

void RunBuilder::takeService(const ParsedRecord& record)
{
    const std::optional<long> status = wholeNumber(record.message);
    if (record.operation == "stopHARL") {
        if (record.message.empty()) {
            beginStep(StepKind::STOP_APPLICATION, record);
            beginAction(record, "systemctl stop harl");
        } else if (Step* step = openStep(StepKind::STOP_APPLICATION); step != nullptr && status) {
            noteRawStatus(*status);
            step->code = status;
            endAction(record, rawStatusText(*status));
            endStep(record, resultOf(*status), rawStatusText(*status));
        }
        return;
    }
    if (record.operation == "stopUpdater") {
        if (record.message.empty()) {
            beginStep(StepKind::STOP_UPDATER, record);
            beginAction(record, "systemctl stop harl-updater");
            mRun->ended = RunEnd::BY_SERVICE_MANAGER;
        } else if (Step* step = openStep(StepKind::STOP_UPDATER); step != nullptr && status) {
            noteRawStatus(*status);
            step->code = status;
            mRun->ended = RunEnd::NOT_SEEN;
            endAction(record, rawStatusText(*status));
            endStep(record, resultOf(*status), rawStatusText(*status));
        }
        return;
    }
    if (record.message.empty()) {
        beginStep(StepKind::GIVE_BACK, record);
        beginAction(record, "umount " + std::string(stickMountPoint) + '/');
        return;
    }
    Step* step = openStep(StepKind::GIVE_BACK);
    if (step == nullptr || !status) {
        return;
    }
    noteRawStatus(*status);
    endAction(record, rawStatusText(*status));
    const bool release = step->actions.size() == 1;
    if (*status != 0) {
        step->code = status;
        step->detail +=
            (step->detail.empty() ? "" : ", ") + std::string(release ? "stick: " : "harl: ") + rawStatusText(*status);
    }
    if (release) {
        beginAction(record, "systemctl start harl");
        return;
    }
    beginWait(record, giveBackWait);
}

void RunBuilder::takeCheck(const ParsedRecord& record)
{
    const std::string_view message = record.message;
    if (record.operation == "updateMirrors") {
        if (message.empty()) {
            beginStep(StepKind::REFRESH_MIRRORS, record);
        } else if (message == "OK") {
            endStep(record, StepResult::DONE, "done");
        } else if (message == "NO_INTERNET_ERROR_CODE" || startsWith(message, "NOT OK")) {
            fail(record, "");
        }
        return;
    }
    if (record.operation == "checkUpdate") {
        static const std::string_view updateFound = "NWM_UM_UPDATE_FOUND: ";
        static const std::string_view noUpdates = "NWM_UM_NO_UPDATES ";
        if (startsWith(message, "apt-cache policy ")) {
            beginStep(StepKind::CHECK_PACKAGE, record);
            mRun->package = {};
        } else if (startsWith(message, updateFound) &&
                   splitVersions(message.substr(updateFound.size()), " -> ", mRun->package)) {
            mRun->package.found = mRun->package.differ = true;
            endStep(record, StepResult::DONE,
                    "an update: " + mRun->package.installed + " -> " + mRun->package.candidate);
        } else if (startsWith(message, noUpdates) &&
                   splitVersions(message.substr(noUpdates.size()), " == ", mRun->package)) {
            mRun->package.found = true;
            endStep(record, StepResult::DONE, "up to date: " + mRun->package.installed);
        } else if (message == "NWM_UM_CHECK_UPDATE_FAILED" || message == "NO_INTERNET_ERROR_CODE") {
            fail(record, "the versions could not be read");
        }
        return;
    }
    static const std::string_view found = "Update found: ";
    if (startsWith(message, found) && splitVersions(message.substr(found.size()), " -> ", mRun->board)) {
        mRun->board.found = mRun->board.differ = true;
        endStep(record, StepResult::DONE, "an update: " + mRun->board.installed + " -> " + mRun->board.candidate);
    } else if (message == "QUORB up to date") {
        mRun->board.found = true;
        endStep(record, StepResult::DONE, "up to date: " + mRun->board.installed);
    } else if (message == "Failed to checkUpdate") {
        fail(record, "the versions could not be read");
    } else if (message == "Failed to check candidate QUORB version") {
        fail(record, "the stick could not be read");
    } else {
        // Of the lines shown, the last one before the verdict is both versions with two blanks between.
        splitVersions(message, "  ", mRun->board);
    }
}

void RunBuilder::takeInstallation(const ParsedRecord& record)
{
    if (record.message.empty()) {
        beginStep(StepKind::INSTALL_PACKAGE, record);
        return;
    }
    if (leadingNumber(record.message)) {
        // The code and the command's output, with nothing between: only the record before tells where the code ends.
        Step* step = openStep(StepKind::INSTALL_PACKAGE);
        if (step != nullptr && step->code && startsWith(record.message, std::to_string(*step->code))) {
            const std::string_view output = record.message.substr(std::to_string(*step->code).size());
            if (!output.empty()) {
                step->said.add(output);
            }
        }
        fail(record, "");
    }
}

void RunBuilder::takeBoard(const ParsedRecord& record)
{
    const std::string_view message = record.message;
    if (record.operation == "uploadQuorbFiles") {
        Step* step = openStep(StepKind::UPLOAD_BOARD);
        if (startsWith(message, "scp ")) {
            beginStep(StepKind::UPLOAD_BOARD, record);
            beginAction(record, "scp: OSUpgrade.zip and unzipUpgrade.sh");
        } else if (step != nullptr && startsWith(message, "Uploading failed")) {
            ++step->failedAttempts;
            endAction(record, "failed");
            if (step->failedAttempts < uploadAttempts) {
                beginAction(record, "scp: OSUpgrade.zip and unzipUpgrade.sh");
            }
        } else if (startsWith(message, "Failed to upload QUORB")) {
            fail(record, std::to_string(uploadAttempts) + " attempts failed");
        }
        return;
    }
    if (startsWith(message, "ssh ")) {
        if (const Step* step = openStep(StepKind::UPLOAD_BOARD); step != nullptr) {
            endAction(record, "exit 0");
            endStep(record, StepResult::DONE,
                    step->failedAttempts == 0 ? "done"
                                              : "done at attempt " + std::to_string(step->failedAttempts + 1) + " of " +
                                                    std::to_string(uploadAttempts));
        }
        beginStep(StepKind::RUN_BOARD_SCRIPT, record);
        beginAction(record, "ssh: /unzipUpgrade.sh");
    } else if (startsWith(message, "Install script ended with code: ")) {
        const std::optional<long> status = wholeNumber(message.substr(32));
        Step* step = openStep(StepKind::RUN_BOARD_SCRIPT);
        if (step != nullptr && status) {
            noteRawStatus(*status);
            step->code = status;
            endAction(record, rawStatusText(*status));
            endStep(record, resultOf(*status), rawStatusText(*status));
        }
    } else if (startsWith(message, "Starts sleeping")) {
        beginStep(StepKind::WAIT_FOR_BOARD, record);
        beginWait(record, boardWait);
    } else if (startsWith(message, "Sleeping for 13mins ended")) {
        endAction(record, "");
        endStep(record, StepResult::DONE, "done");
    }
}

void RunBuilder::takeCommand(const ParsedRecord& record)
{
    static const std::string_view running = "Running command: ";
    static const std::string_view exitCode = "Exit code:";
    if (startsWith(record.message, running)) {
        const std::string_view command = record.message.substr(running.size());
        if (contains(command, "version.txt")) {
            beginStep(StepKind::CHECK_BOARD, record);
            mRun->board = {};
        } else if (contains(command, "/installTV")) {
            beginStep(StepKind::CHECK_TEAMVIEWER, record);
        }
        beginAction(record, command);
        return;
    }
    if (!startsWith(record.message, exitCode)) {
        return;
    }
    const std::optional<long> code = wholeNumber(record.message.substr(exitCode.size()));
    if (!code || mRun->steps.empty()) {
        return;
    }
    endAction(record, exitCodeText(*code));
    Step& step = mRun->steps.back();
    step.code = code;
    if (step.kind == StepKind::INSTALL_PACKAGE && *code == 0) {
        endStep(record, StepResult::DONE, "exit 0");
    }
}

void RunBuilder::takeProcedure(const ParsedRecord& record)
{
    const std::string_view message = record.message;
    if (mRun->updateThread.empty()) {
        mRun->updateThread = kept(record.thread);
    }
    if (record.operation == "initMainHead" || record.operation == "updateMainHead") {
        mRun->mainHead = true;
    }
    if (record.operation == "deinit") {
        if (openStep(StepKind::SHOW_OUTCOME) != nullptr) {
            endStep(record, StepResult::DONE, "");
        }
    } else if (record.operation == "deinitRemoteHead") {
        if (startsWith(message, "Giving users 30 Secs")) {
            beginStep(StepKind::SHOW_TO_OPERATOR, record);
            beginWait(record, outcomeWait);
        }
    } else if (message == "Update mirrors failed:") {
        mVerdict = Outcome::MIRRORS_FAILED;
    } else if (message == "Failed to checkUpdate") {
        mVerdict = Outcome::CHECK_FAILED;
    } else if (message == "update failed") {
        mVerdict = Outcome::PACKAGE_FAILED;
    } else if (message == "update QUORB failed") {
        mVerdict = Outcome::BOARD_FAILED;
    } else if (startsWith(message, "removed")) {
        beginStep(StepKind::REMOVE_MARKER, record);
        beginAction(record, message.substr(7));
        endAction(record, "");
        endStep(record, StepResult::DONE, "");
        mRun->markerReported = true;
        if (mRun->mainHead) {
            const Step* teamViewer = mRun->find(StepKind::CHECK_TEAMVIEWER);
            const bool requested = teamViewer != nullptr && teamViewer->detail == "an installation is requested";
            const bool due = mRun->package.differ || mRun->board.differ || requested;
            mRun->outcome = due ? Outcome::UPDATE_OFFERED : Outcome::NO_UPDATE;
        }
    } else if (message == "update maainhead finished") {
        mRun->outcome = Outcome::UPDATED;
    }
    if (mRun->mainHead && mVerdict != Outcome::NONE) {
        mRun->outcome = mVerdict;
    }
}

void RunBuilder::takeTeamViewer(const ParsedRecord& record)
{
    const std::string_view message = record.message;
    if (record.operation == "checkTVUpdate") {
        if (message == "Failed to check if TV install is needed") {
            fail(record, "the marker could not be looked for");
        } else if (message == "Teamviewer install is required") {
            endStep(record, StepResult::DONE, "an installation is requested");
        } else if (message == "No need to install Teamviewer" || message == "install Teamviewer flag doesnot exist") {
            endStep(record, StepResult::DONE, "no installation is requested");
        }
        return;
    }
    static const std::string_view ended = "Install script ended with code: ";
    if (message.empty()) {
        beginStep(StepKind::INSTALL_TEAMVIEWER, record);
    } else if (!startsWith(message, ended)) {
        beginAction(record, message);
    } else if (const std::optional<long> status = wholeNumber(message.substr(ended.size()))) {
        noteRawStatus(*status);
        endAction(record, rawStatusText(*status));
        if (Step* step = openStep(StepKind::INSTALL_TEAMVIEWER); step != nullptr) {
            step->code = status;
            endStep(record, resultOf(*status), rawStatusText(*status));
        }
    }
}

/// Records of panel, sound and callbacks.
void RunBuilder::takeFeedback(const ParsedRecord& record)
{
    if (record.operation == "resultCallback" || record.operation == "errorCallback") {
        if (mRun->mainHead) {
            return; // a record of its own program: the procedure's records have told the outcome
        }
        beginStep(StepKind::SHOW_OUTCOME, record);
        if (record.operation == "errorCallback") {
            mRun->outcome = mVerdict == Outcome::NONE ? Outcome::UNKNOWN_FAILURE : mVerdict;
            return;
        }
        const bool updated = mRun->package.differ || mRun->board.differ || mRun->markerReported;
        mRun->outcome = updated ? Outcome::UPDATED : Outcome::NO_UPDATE;
        return;
    }
    if (record.operation == "play") {
        mRun->soundFailed = true;
        return;
    }
    static const std::string_view failed = "system returned false: ";
    if (startsWith(record.message, failed)) {
        ++mRun->ledFailures;
        // Turning off ends in 0x0, the blue of the flashing in 0x1.
        const bool lit = !contains(record.message, " 0x0 c") && !contains(record.message, " 0x1 c");
        if (lit && mRun->outcome != Outcome::NONE) {
            ++mRun->outcomeLedFailures;
        }
    }
}

// Steps and their commands

Step& RunBuilder::beginStep(StepKind kind, const ParsedRecord& record)
{
    endStepWithoutRecord(record);
    if (mRun->steps.size() == mostSteps) {
        ++mRun->stepsLeftOut;
        mRun->steps.pop_back();
    }
    Step step;
    step.kind = kind;
    step.line = record.line;
    step.start = record.time;
    mRun->steps.push_back(std::move(step));
    return mRun->steps.back();
}

/// Ends the step that goes on because the next one begins.
void RunBuilder::endStepWithoutRecord(const ParsedRecord& record)
{
    if (mRun->steps.empty() || mRun->steps.back().end) {
        return;
    }
    Step& step = mRun->steps.back();
    const bool waited = !step.actions.empty() && startsWith(step.actions.back().text, "wait ");
    if (!waited && step.kind != StepKind::START) {
        endStep(record, StepResult::UNTOLD, "its end is not told");
        return;
    }
    endAction(record, "");
    endStep(record, resultOf(step.code.value_or(0)), step.detail);
}

void RunBuilder::endStep(const ParsedRecord& record, StepResult result, std::string detail)
{
    if (mRun->steps.empty() || mRun->steps.back().end) {
        return;
    }
    Step& step = mRun->steps.back();
    step.end = record.time;
    step.result = result;
    step.detail = std::move(detail);
}

/// The step has failed; without a `detail` the last command's status is it.
void RunBuilder::fail(const ParsedRecord& record, std::string detail)
{
    if (mRun->steps.empty() || mRun->steps.back().end) {
        return;
    }
    Step& step = mRun->steps.back();
    step.word = kept(record.message);
    if (detail.empty() && step.code) {
        detail = exitCodeText(*step.code);
    }
    endStep(record, StepResult::FAILED, std::move(detail));
    if (mRun->mainHead && step.kind == StepKind::INSTALL_PACKAGE) {
        mRun->outcome = Outcome::PACKAGE_FAILED;
    } else if (mRun->mainHead && step.kind == StepKind::UPLOAD_BOARD) {
        mRun->outcome = Outcome::BOARD_FAILED;
    }
}

void RunBuilder::beginAction(const ParsedRecord& record, std::string_view text)
{
    if (mRun->steps.empty() || mRun->steps.back().actions.size() == mostActions) {
        return;
    }
    Action action;
    action.text = kept(withoutOptions(text));
    action.start = record.time;
    mRun->steps.back().actions.push_back(std::move(action));
}

void RunBuilder::beginWait(const ParsedRecord& record, std::int64_t seconds)
{
    beginAction(record, "wait " + std::to_string(seconds) + " s");
}

void RunBuilder::endAction(const ParsedRecord& record, std::string status)
{
    if (mRun->steps.empty() || mRun->steps.back().actions.empty() || mRun->steps.back().actions.back().end) {
        return;
    }
    Action& action = mRun->steps.back().actions.back();
    action.end = record.time;
    action.status = std::move(status);
}

void RunBuilder::noteRawStatus(long status)
{
    mRun->statusesLost = mRun->statusesLost || status == -1;
}

/// The step that goes on, if it is of this kind.
Step* RunBuilder::openStep(StepKind kind)
{
    if (mRun->steps.empty() || mRun->steps.back().kind != kind || mRun->steps.back().end) {
        return nullptr;
    }
    return &mRun->steps.back();
}
