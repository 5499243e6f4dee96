#include "log/follow.h"

#include "log/json.h"
#include "log/text.h"
#include "procedure.h"

#include <algorithm>
#include <ctime>
#include <map>
#include <sstream>
#include <utility>

#include <nlohmann/json.hpp>

namespace
{

using Json = nlohmann::ordered_json;

const std::size_t barLength = 30;    // columns
const char clearLine[] = "\r\x1b[K"; // from its start

bool isOver(const Run& run)
{
    return run.ended != RunEnd::NOT_SEEN;
}

/// True when nothing has come for longer than the step can take.
bool isOverdue(const Run& run, std::int64_t now)
{
    const Step& step = run.steps.back();
    return now - std::max(run.end, step.start) > factsOf(step.kind).longest;
}

std::string attemptText(const Step& step)
{
    if (step.kind != StepKind::UPLOAD_BOARD || step.failedAttempts == 0) {
        return "";
    }
    return ", attempt " + std::to_string(std::min(step.failedAttempts + 1, uploadAttempts)) + " of " +
           std::to_string(uploadAttempts);
}

/// True when the next step comes only if the check that goes on finds an update.
bool nextDependsOnCheck(const Run& run)
{
    const Step& step = run.steps.back();
    return !step.took && !run.mainHead && (step.kind == StepKind::CHECK_PACKAGE || step.kind == StepKind::CHECK_BOARD);
}

/// The steps that come after the one that goes on. While versions are compared: also the installation that comes if
/// they differ.
std::vector<StepKind> stepsToCome(const Run& run)
{
    const StepKind last = run.steps.empty() ? StepKind::START : run.steps.back().kind;
    const bool failed = !run.steps.empty() && run.steps.back().result == StepResult::FAILED;
    const bool ends = failed && last != StepKind::STOP_APPLICATION && last != StepKind::RUN_BOARD_SCRIPT;
    const auto mayDiffer = [&](const Versions& versions, StepKind check) {
        const Step* step = run.find(check);
        return !run.mainHead && !ends && (versions.differ() || step == nullptr || !step->took);
    };
    const bool package = mayDiffer(run.package, StepKind::CHECK_PACKAGE);
    const bool board = mayDiffer(run.board, StepKind::CHECK_BOARD);
    // All others come in any case, or unless the run ends before its outcome.
    const std::map<StepKind, bool> comes = {
        {StepKind::INSTALL_PACKAGE, package},
        {StepKind::UPLOAD_BOARD, board},
        {StepKind::RUN_BOARD_SCRIPT, board},
        {StepKind::WAIT_FOR_BOARD, board},
        {StepKind::CHECK_TEAMVIEWER, run.mainHead && (!ends || last == StepKind::CHECK_BOARD)},
        {StepKind::INSTALL_TEAMVIEWER, false}, // its user decides
        {StepKind::REMOVE_MARKER, run.mainHead ? !ends && last != StepKind::INSTALL_TEAMVIEWER : package || board},
    };
    std::vector<StepKind> kinds;
    for (std::size_t index = static_cast<std::size_t>(last) + 1; index < stepKinds; ++index) {
        const auto kind = static_cast<StepKind>(index);
        const auto known = comes.find(kind);
        if (known != comes.end() ? known->second : kind >= StepKind::SHOW_OUTCOME || !ends) {
            kinds.push_back(kind);
        }
    }
    return kinds;
}

} // namespace

void Follower::runComplete(const Run& run)
{
    for (const Step& step : run.steps) {
        if (step.took) {
            mLast.at(static_cast<std::size_t>(step.kind)) = *step.took;
        }
    }
}

/// How long a step takes: the updater's own wait, else as long as it took last time in the same log (s).
std::optional<std::int64_t> Follower::expected(StepKind kind) const
{
    const std::int64_t wait = factsOf(kind).wait;
    return wait > 0 ? wait : mLast.at(static_cast<std::size_t>(kind));
}

/// How long the run goes on at least, as far as its steps' lengths are known (s).
std::int64_t Follower::remaining(const Run& run, std::int64_t now) const
{
    const Step& step = run.steps.back();
    const std::int64_t rest = step.took ? 0 : expected(step.kind).value_or(0) - (now - step.start);
    std::int64_t sum = std::max<std::int64_t>(rest, 0);
    for (const StepKind kind : stepsToCome(run)) {
        sum += expected(kind).value_or(0);
    }
    return sum;
}

void Follower::show(const Run* run, std::int64_t now)
{
    const bool over = run != nullptr && isOver(*run);
    const bool known = run != nullptr && !run->steps.empty();
    const bool running = known && !over;
    const bool overdue = running && isOverdue(*run, now);
    const std::uint64_t number = run == nullptr ? 0 : run->number;
    mFirstNumber = mFirstNumber.value_or(number);
    mEnded = mEnded || ((mRunning || number > *mFirstNumber) && over);
    mRunning = mRunning || running;

    std::ostringstream state; // "" is that of the first call
    state << "shown ";
    if (known) {
        const Step& step = run->steps.back();
        state << number << ' ' << run->steps.size() << ' ' << step.failedAttempts << ' '
              << static_cast<int>(step.result) << ' ' << static_cast<int>(run->ended) << ' ' << overdue;
    }
    if (std::exchange(mShown, state.str()) != state.str()) {
        showChange(run, now);
    }
    if (running && mTerminal && !mJson && !overdue) {
        showBar(*run, now);
    }
    mOut.flush();
}

void Follower::showChange(const Run* run, std::int64_t now)
{
    const bool known = run != nullptr && !run->steps.empty();
    const bool over = known && isOver(*run);
    const bool overdue = known && !over && isOverdue(*run, now);
    const char* state = over && mEnded ? "ended" : overdue ? "overdue" : known && !over ? "running" : "waiting";
    if (mJson) {
        Json object = {{"state", state}, {"time", isoText(now)}};
        if (known) {
            const Step& step = run->steps.back();
            const std::optional<std::int64_t> length = expected(step.kind);
            const std::vector<StepKind> next = stepsToCome(*run);
            Run explained = *run;
            explain(explained);
            object["run"] = run->number;
            object["step"] = factsOf(step.kind).name;
            object["title"] = factsOf(step.kind).title;
            object["since"] = isoText(step.start);
            object["elapsed_s"] = step.took.value_or(std::max<std::int64_t>(now - step.start, 0));
            object["expected_s"] = length ? Json(*length) : Json();
            object["result"] = step.took ? resultText(*run, step) : "";
            object["failed_attempts"] = step.failedAttempts;
            object["remaining_s"] = over || overdue ? 0 : remaining(*run, now);
            object["next"] = next.empty() ? Json() : Json(factsOf(next[0]).name);
            object["next_if_versions_differ"] = nextDependsOnCheck(*run);
            object["outcome"] = outcomeName(run->outcome);
            object["failure"] = over && explained.failure ? problemToJson(explained, *explained.failure) : Json();
        }
        mOut << object.dump(-1, ' ', false, Json::error_handler_t::replace) << '\n';
        return;
    }
    if (mBar) {
        mOut << clearLine;
        mBar = false;
    }
    const std::string text = known ? changeText(*run, over, overdue, now) : "No update is going on. Waiting for one.\n";
    if (mTerminal) {
        printText(text, mOut);
    } else {
        mOut << text; // a line for each change
    }
    if (over && mEnded) {
        Run ended = *run;
        explain(ended);
        printText(ended.failure ? problemText(ended, *ended.failure) : "", mOut);
    }
}

std::string Follower::changeText(const Run& run, bool over, bool overdue, std::int64_t now) const
{
    if (over) {
        const OperatorView view = operatorView(run);
        return (mEnded ? "Ended at " + clockText(run.end)
                       : "No update is going on. The last one ended at " + dateText(run.end)) +
               ": " + view.meaning + " (" + view.seen + (mEnded ? ").\n" : "). Waiting for the next.\n");
    }
    const Step& step = run.steps.back();
    std::string text = clockText(step.start) + "  " + factsOf(step.kind).title + attemptText(step);
    if (step.took) {
        text += ": " + resultText(run, step);
    } else if (const std::optional<std::int64_t> length = expected(step.kind)) {
        text += ", " + durationText(*length) + " expected";
    }
    if (overdue) {
        return text + "; no record for " + durationText(now - run.end) +
               ", longer than this step takes: the updater has most likely ended. Do now: " +
               factsOf(step.kind).afterwards + '\n';
    }
    if (const std::vector<StepKind> next = stepsToCome(run); !next.empty()) {
        text += std::string("; then: ") + factsOf(next[0]).title + (nextDependsOnCheck(run) ? ", if they differ" : "") +
                "; in all at least " + std::to_string((remaining(run, now) + 59) / 60) + " min more";
    }
    return text + '\n';
}

/// Shows "3 min 2 s of 13 min 0 s" with a bar in front, or "5 s, no fixed length".
void Follower::showBar(const Run& run, std::int64_t now)
{
    const Step& step = run.steps.back();
    const std::int64_t elapsed = std::max<std::int64_t>(now - step.start, 0);
    mOut << clearLine << "  ";
    if (const std::optional<std::int64_t> length = expected(step.kind)) {
        const auto whole = static_cast<std::size_t>(std::max<std::int64_t>(*length, 1));
        const std::size_t filled = std::min(barLength * static_cast<std::size_t>(elapsed) / whole, barLength);
        mOut << '[' << std::string(filled, '#') << std::string(barLength - filled, '-') << "] " << durationText(elapsed)
             << " of " << durationText(*length);
    } else {
        mOut << durationText(elapsed) << ", no fixed length";
    }
    mBar = true;
}

std::int64_t localNow()
{
    const std::time_t now = std::time(nullptr);
    std::tm local = {};
    return now + localtime_r(&now, &local)->tm_gmtoff;
}
