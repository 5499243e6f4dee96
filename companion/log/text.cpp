#include "log/text.h"

#include "procedure.h"

#include <algorithm>
#include <array>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <iomanip>
#include <sstream>

namespace
{

/// What is shown for an outcome.
struct OutcomeFacts
{
    const char* name;
    const char* meaning;
    std::vector<std::string> leds; ///< empty: the outcome does not tell
};

// In the order of Outcome.
const std::array<OutcomeFacts, 10> outcomeTable = {{
    {"none", "NOT FINISHED, as far as this log goes", {}},
    {"passed", "PASSED; whether anything was updated is not in this log", {}},
    {"no-update", "PASSED: nothing to update", {"REMOTE", "MAIN"}},
    {"updated", "PASSED: updated", {"PASS"}},
    {"update-offered", "an update is offered", {}},
    {"failed", "FAILED: at what is not in this log", {}},
    {"check-failed", "FAILED: a version could not be read", {"REMOTE", "MAIN"}},
    {"mirrors-failed", "FAILED: the package mirrors could not be read", {"REMOTE", "MAIN"}},
    {"package-failed", "FAILED: the package could not be installed", {"FAIL"}},
    {"board-failed", "FAILED: the board could not be updated", {"FAIL"}},
}};

const OutcomeFacts& factsOf(Outcome outcome)
{
    return outcomeTable.at(static_cast<std::size_t>(outcome));
}

std::string formattedTime(std::int64_t time, const char* format)
{
    const auto seconds = static_cast<std::time_t>(time);
    std::tm parts = {};
    gmtime_r(&seconds, &parts); // the log's local time is kept as if it were UTC
    std::array<char, 64> buffer{};
    return {buffer.data(), std::strftime(buffer.data(), buffer.size(), format, &parts)};
}

/// "signal 9 (SIGKILL)"
std::string signalText(int signal)
{
    const char* name = sigabbrev_np(signal);
    std::string text = "signal " + std::to_string(signal);
    return name == nullptr ? text : text + " (SIG" + name + ')';
}

std::string exitCodeText(long code)
{
    const std::string meaning = code == 126   ? "command cannot be run"
                                : code == 127 ? "command not found"
                                : code > 128 && code <= 128 + SIGRTMAX
                                    ? "killed by " + signalText(static_cast<int>(code) - 128)
                                    : "";
    return "exit " + std::to_string(code) + (meaning.empty() ? "" : " (" + meaning + ')');
}

/// A line for each of `lines`, as a quotation.
std::string quoted(const OtherLines& lines)
{
    std::string text;
    for (const std::string& line : shownLines(lines)) {
        text += "    | \t" + line + '\n';
    }
    return text;
}

/// What came out of a step that succeeded.
std::string doneText(const Run& run, const Step& step)
{
    const Versions& versions = step.kind == StepKind::CHECK_PACKAGE ? run.package : run.board;
    switch (step.event) {
    case Event::VERSIONS_DIFFER:
        return "an update: " + versions.installed + " -> " + versions.candidate;
    case Event::VERSIONS_SAME:
        return "up to date" + (versions.installed.empty() ? "" : ": " + versions.installed);
    case Event::TEAMVIEWER_REQUESTED:
        return "an installation is requested";
    case Event::TEAMVIEWER_NOT_REQUESTED:
        return "no installation is requested";
    default:
        break;
    }
    if (step.kind == StepKind::UPLOAD_BOARD && step.failedAttempts > 0) {
        return "done at attempt " + std::to_string(step.failedAttempts + 1) + " of " + std::to_string(uploadAttempts);
    }
    const bool told = step.status && step.kind != StepKind::REFRESH_MIRRORS;
    return told ? statusText(*step.status) : "done";
}

std::string failedText(const Step& step)
{
    if (step.kind == StepKind::GIVE_BACK) {
        std::string text;
        for (const std::size_t command : failedCommands(step)) {
            text += text.empty() ? "" : ", ";
            text += (command == 0 ? "stick: " : "harl: ") + statusText(*step.actions[command].status);
        }
        return text;
    }
    if (step.kind == StepKind::UPLOAD_BOARD) {
        return std::to_string(uploadAttempts) + " attempts failed";
    }
    if (step.event == Event::STICK_NOT_READ) {
        return "the stick could not be read";
    }
    if (step.kind == StepKind::CHECK_TEAMVIEWER) {
        return "the marker could not be looked for";
    }
    if (step.kind == StepKind::CHECK_PACKAGE || step.kind == StepKind::CHECK_BOARD) {
        return "the versions could not be read";
    }
    return step.status ? statusText(*step.status) : "";
}

bool isOver(const Run& run)
{
    return run.isDecided() || run.ended == RunEnd::BY_SERVICE_MANAGER;
}

std::string meaningOf(const Run& run)
{
    const bool failed = isFailure(run.outcome);
    const bool notRun = run.service.has(ServiceEvent::NOT_ALLOWED);
    const Step* marker = run.find(StepKind::CHECK_TEAMVIEWER);
    if (run.mainHead && run.outcome == Outcome::PASSED) {
        return "checked; whether an update is offered is not in this log";
    }
    if (!run.mainHead && run.service.has(ServiceEvent::FAILURE_SHOWN) && !failed && !notRun) {
        return "FAILED: the updater ended before its outcome was known";
    }
    if (run.outcome == Outcome::NONE && isOver(run)) {
        return "not in this log: the records of its outcome are missing";
    }
    if (run.outcome == Outcome::CHECK_FAILED && marker != nullptr && marker->result == StepResult::FAILED) {
        return "FAILED: the TeamViewer marker could not be looked for";
    }
    const std::string meaning =
        notRun ? "NOT RUN: the service did not let the updater begin" : factsOf(run.outcome).meaning;
    return run.service.has(ServiceEvent::UNIT_NOT_WELL) && !failed ? meaning + ", but " + run.service.unit : meaning;
}

/// How far the installation of a part came.
std::string versionsText(const Run& run, const Versions& versions, StepKind check, const std::string& installation)
{
    const Step* step = run.find(check);
    if (versions.state == Versions::State::NOT_READ || (step != nullptr && step->result == StepResult::FAILED)) {
        return "versions not read";
    }
    if (!versions.found()) {
        const bool checked = step == nullptr ? run.beginningMissing : step->took.has_value();
        return checked ? "not in this log" : "not checked";
    }
    if (!versions.differ()) {
        return (versions.installed.empty() ? "" : versions.installed + ", ") + "up to date";
    }
    return versions.installed + " -> " + versions.candidate + ", " + installation;
}

} // namespace

const char* outcomeName(Outcome outcome)
{
    return factsOf(outcome).name;
}

const char* resultName(StepResult result)
{
    static const std::array<const char*, 4> names = {"unfinished", "done", "failed", "untold"};
    return names.at(static_cast<std::size_t>(result));
}

std::string clockText(std::int64_t time)
{
    return formattedTime(time, "%H:%M:%S");
}

std::string dateText(std::int64_t time)
{
    return formattedTime(time, "%d-%m-%Y %H:%M:%S");
}

std::string isoText(std::int64_t time)
{
    return formattedTime(time, "%Y-%m-%dT%H:%M:%S");
}

std::string durationText(std::int64_t seconds)
{
    if (seconds < 60) {
        return std::to_string(seconds) + " s";
    }
    if (seconds < 3600) {
        return std::to_string(seconds / 60) + " min " + std::to_string(seconds % 60) + " s";
    }
    return std::to_string(seconds / 3600) + " h " + std::to_string(seconds % 3600 / 60) + " min";
}

std::string resultText(const Run& run, const Step& step)
{
    switch (step.result) {
    case StepResult::UNFINISHED:
        return step.kind == StepKind::STOP_UPDATER ? "the service ends here" : "NOT FINISHED in this log";
    case StepResult::DONE:
        return doneText(run, step);
    case StepResult::FAILED: {
        const std::string text = failedText(step);
        return text.empty() ? "FAILED" : "FAILED: " + text;
    }
    case StepResult::UNTOLD:
        for (const Action& action : step.actions) {
            if (action.status && action.status->lost()) {
                return statusText(*action.status);
            }
        }
        return "its end is not in this log";
    }
    return "";
}

std::string actionText(const Action& action)
{
    return *action.command == '\0' ? "wait " + std::to_string(action.wait) + " s" : action.command;
}

std::string actionStatusText(const Action& action)
{
    return action.attemptFailed ? "failed" : action.status ? statusText(*action.status) : "";
}

std::vector<std::string> shownLines(const OtherLines& lines)
{
    std::vector<std::string> texts;
    const auto show = [&](const OtherLine& line) {
        texts.push_back(line.text + (line.times > 1 ? " (" + counted(line.times, "time") + ')' : ""));
    };
    std::for_each(lines.first.begin(), lines.first.end(), show);
    if (lines.leftOut > 0) {
        texts.push_back("... (" + counted(lines.leftOut, "line") + " left out)");
    }
    std::for_each(lines.last.begin(), lines.last.end(), show);
    return texts;
}

std::string packageText(const Run& run)
{
    const Step* install = run.find(StepKind::INSTALL_PACKAGE);
    return versionsText(run, run.package, StepKind::CHECK_PACKAGE,
                        install == nullptr                      ? "not installed"
                        : install->result == StepResult::FAILED ? "installation FAILED"
                        : install->result == StepResult::DONE   ? "installed"
                                                                : "its installation's end is not in this log");
}

std::string boardText(const Run& run)
{
    const Step* upload = run.find(StepKind::UPLOAD_BOARD);
    const Step* script = run.find(StepKind::RUN_BOARD_SCRIPT);
    std::string text = "not installed";
    if (script != nullptr) {
        text = script->result == StepResult::DONE     ? "uploaded and its install script run"
               : script->result == StepResult::FAILED ? "uploaded, but its install script FAILED"
                                                      : "uploaded; its install script's end is not in this log";
    } else if (upload != nullptr) {
        text = upload->result == StepResult::FAILED ? "upload FAILED" : "its upload's end is not in this log";
    }
    return versionsText(run, run.board, StepKind::CHECK_BOARD, text);
}

std::string headingOf(const Run& run, const Problem& problem)
{
    const bool decisive = run.failure && &problem == &*run.failure;
    if (run.service.has(ServiceEvent::NOT_ALLOWED) && decisive) {
        return "Not run [" + problem.failure->name + ']';
    }
    const Step* step = run.stepOf(problem);
    std::string text = !decisive ? "Also: " : isFailure(run.outcome) ? "Failed: " : "Ended in: ";
    text += step == nullptr && run.service.lines.count > 0 ? "The service, before or after the run"
            : step == nullptr                              ? "a step that is not in this log"
                              : factsOf(step->kind).title + (" (line " + std::to_string(step->line) + ')');
    return text + " [" + problem.failure->name + ']';
}

std::string causeOf(const Run& run, const Problem& problem)
{
    const std::string& name = problem.failure->name;
    return filled(problem.failure->cause, valuesOf(run, run.stepOf(problem), name)) +
           (problem.tolerated ? ' ' + sharedText("tolerated") : "");
}

std::string remedyOf(const Run& run, const Problem& problem)
{
    return filled(problem.failure->remedy, valuesOf(run, run.stepOf(problem), problem.failure->name));
}

Values valuesOf(const Run& run, const Step* step, std::string_view failure)
{
    std::optional<CommandStatus> status;
    if (step != nullptr) {
        const std::size_t action = failure == "stick-not-released" ? 0 : failure == "application-not-started" ? 1 : 2;
        status = action < 2 && action < step->actions.size() ? step->actions[action].status : step->status;
    }
    const bool waits = step != nullptr && step->kind == StepKind::WAIT_FOR_BOARD;
    const Step* upload = run.find(StepKind::UPLOAD_BOARD);
    const auto attempts = static_cast<std::uint64_t>(upload == nullptr ? 0 : upload->failedAttempts);
    return {
        {"package", packageOf(run.mainHead)},
        {"status", status ? statusText(*status) : "its status"},
        {"afterwards", step == nullptr ? "run the update again." : factsOf(step->kind).afterwards},
        {"silence", waits ? sharedText("silent-wait") : ""},
        {"panel", sharedText(run.mainHead ? "if-it-stays" : "if-it-flashes")},
        {"service", run.service.has(ServiceEvent::FAILURE_SHOWN) ? sharedText("service-lit-fail") : ""},
        {"unit", run.service.unit.empty() ? "what was found is in brackets" : run.service.unit},
        {"panel-failures", run.ledFailures == 0 ? "Commands" : counted(run.ledFailures, "command")},
        {"outcome-dark", run.outcomeLedFailed ? ": the outcome was not, or not wholly, lit." : "."},
        {"torn-records", counted(run.torn.records, "torn record")},
        {"first-torn-line", std::to_string(run.torn.firstLine)},
        {"steps-left-out", counted(run.stepsLeftOut, "step")},
        {"clock-jumps", counted(run.clockJumps, "time")},
        {"failed-attempts", counted(attempts, "upload attempt")},
        {"beyond-scp", upload != nullptr && upload->said.count > 0 ? ", beyond what scp said" : ""},
    };
}

std::vector<std::string> gapTexts(const Run& run)
{
    std::vector<std::string> texts;
    const Values values = run.gaps.empty() ? Values() : valuesOf(run, nullptr, {});
    for (const std::string& gap : run.gaps) {
        texts.push_back(sharedText(gap, values, "gaps"));
    }
    return texts;
}

OperatorView operatorView(const Run& run)
{
    const OutcomeFacts& facts = factsOf(run.outcome);
    const std::string meaning = meaningOf(run);
    if (run.mainHead) {
        return {{}, "", "shown by the main head's own program", meaning};
    }
    if (run.service.has(ServiceEvent::FAILURE_SHOWN)) {
        return {{{"FAIL", "fail"}}, "", "FAIL lit in fail colour; no sound", meaning};
    }
    if (run.outcome == Outcome::NONE && isOver(run)) {
        return {{}, "", "not in this log", meaning};
    }
    if (run.outcome == Outcome::NONE && run.ledFailures > 0) {
        return {{}, "", "a panel that fails; no sound", meaning};
    }
    if (run.outcome == Outcome::NONE) {
        return {{{"any", "blue"}}, "", "REMOTE and MAIN flashing blue in turn while it went on; no sound", meaning};
    }
    const std::string color = isFailure(run.outcome) ? "fail" : "pass";
    OperatorView view = {{}, "", "", meaning};
    for (const std::string& led : facts.leds) {
        view.leds.emplace_back(led, color);
        view.seen += (view.seen.empty() ? "" : " and ") + led;
    }
    view.seen = facts.leds.empty() ? "REMOTE and MAIN, or " + std::string(color == "pass" ? "PASS" : "FAIL") + ", in "
                                   : view.seen + " lit in ";
    view.seen += color + " colour";
    if (run.outcomeLedFailed && !run.statusesLost) {
        view.leds.clear();
        view.seen = "a dark or incomplete panel (meant: " + view.seen + ")";
    }
    const bool silent = run.soundFailed && !run.statusesLost;
    view.sound = silent ? "" : color;
    view.seen += silent ? "; no sound (meant: " + color + " sound)" : "; " + color + " sound";
    return view;
}

std::string problemText(const Run& run, const Problem& problem)
{
    return headingOf(run, problem) + "\n  Why:     \t" + causeOf(run, problem) + "\n  Do now:  \t" +
           remedyOf(run, problem) + '\n';
}

void printRun(const Run& run, const std::string& source, std::ostream& out)
{
    const OperatorView view = operatorView(run);
    std::ostringstream text;
    text << "Run " << run.number << " of " << source << ", lines " << run.firstLine << " to " << run.lastLine << "\n\n";
    if (!run.steps.empty()) {
        text << "Began:    \t" << dateText(run.begin) << (run.version.empty() ? "" : ", updater ") << run.version
             << ", took " << durationText(run.elapsed)
             << (run.clockJumps > 0 ? " (without what the clock was set by)\n" : "\n");
    }
    text << "Outcome:  \t" << view.meaning << "\nOperator: \t" << view.seen << "\nPackage:  \t" << packageText(run)
         << "\nBoard:    \t" << boardText(run) << '\n';
    if (!run.steps.empty()) {
        text << "\nStart     Took          Step                              Result\n" << std::left;
    }
    for (const Step& step : run.steps) {
        text << clockText(step.start) << "  " << std::setw(14) << (step.took ? durationText(*step.took) : "") << '\t'
             << std::setw(34) << factsOf(step.kind).title << resultText(run, step) << '\n';
    }
    const auto tell = [&](const Problem& problem) {
        const Step* step = run.stepOf(problem);
        text << '\n' << problemText(run, problem);
        if (step != nullptr && step->said.count > 0) {
            text << "  The tools said:\n" << quoted(step->said);
        }
    };
    if (run.failure) {
        tell(*run.failure);
    }
    std::for_each(run.besides.begin(), run.besides.end(), tell);
    if (run.service.lines.count > 0) {
        text << "\nThe service manager said:\n" << quoted(run.service.lines);
    }
    text << (run.gaps.empty() ? "" : "\nThis log cannot show:\n");
    for (const std::string& gap : gapTexts(run)) {
        text << "  - \t" << gap << '\n';
    }
    printText(text.str(), out);
}

std::string statusText(const CommandStatus& status)
{
    if (!status.raw) {
        return exitCodeText(status.number);
    }
    if (status.lost()) {
        return "its status is not available";
    }
    if (status.number < 0 || status.number > 0xFFFF) {
        return std::to_string(status.number) + " (no wait status)";
    }
    const int signal = static_cast<int>(status.number & 0x7F);
    return signal != 0 ? "killed by " + signalText(signal) : exitCodeText(status.number >> 8);
}
