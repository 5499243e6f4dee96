#include "fleet/fleet.h"

#include "log/catalogue.h"
#include "log/text.h"

#include <algorithm>

const std::array<StateName, 5> stateNames = {{
    {"well", "Well"},
    {"not-well", "Passed but not well"},
    {"never-ended", "Began and never ended"},
    {"failed", "Failed"},
    {"not-seen", "Not seen"},
}};

namespace
{

UnitState stateOf(const Run& run)
{
    if (wentWell(run)) {
        return UnitState::WELL;
    }
    if (isFailure(run.outcome) || run.ended == RunEnd::EARLY || run.service.has(ServiceEvent::FAILURE_SHOWN)) {
        return UnitState::FAILED;
    }
    if (run.ended == RunEnd::NOT_SEEN) {
        return UnitState::NEVER_ENDED;
    }
    return run.outcome == Outcome::NONE ? UnitState::FAILED : UnitState::NOT_WELL;
}

/// The version that a run leaves; empty when its log does not tell.
///
/// @param installation  the step that installs it
std::string versionAfter(const Run& run, const Versions& versions, StepKind installation)
{
    const Step* step = run.find(installation);
    const bool installed = versions.differ() && step != nullptr && step->result == StepResult::DONE;
    return !versions.found() ? "" : installed ? versions.candidate : versions.installed;
}

/// True for two readings of one run: a unit has one at a time.
bool isSameRun(const FleetRun& first, const FleetRun& second)
{
    if (first.boot != 0 && second.boot != 0 && first.boot != second.boot) {
        return false;
    }
    return second.begin < first.end || (second.begin == first.begin && second.end == first.end);
}

} // namespace

void Fleet::add(const std::string& machine, const std::string& name, const Run& run, std::uint64_t boot)
{
    FleetRun one;
    one.begin = run.begin;
    one.end = run.end;
    one.boot = boot;
    one.lines = run.lastLine - run.firstLine;
    one.mainHead = run.mainHead;
    one.outcome = run.outcome;
    one.state = stateOf(run);
    one.failure = run.failure ? run.failure->failure : nullptr;
    for (const Problem& problem : run.besides) {
        one.besides.push_back(problem.failure);
    }
    const std::string meaning = operatorView(run).meaning;
    const std::string package = versionAfter(run, run.package, StepKind::INSTALL_PACKAGE);
    const std::string board = versionAfter(run, run.board, StepKind::RUN_BOARD_SCRIPT);

    const std::lock_guard lock(mMutex);
    one.meaning = kept(meaning);
    one.package = kept(package);
    one.board = kept(board);
    FleetUnit& unit = mUnits[machine];
    unit.name = name;
    unit.machine = machine == name ? "" : machine;
    unit.runs.push_back(std::move(one));
}

void Fleet::addRepeats(std::uint64_t lines)
{
    const std::lock_guard lock(mMutex);
    mRepeatedLines += lines;
}

void Fleet::finish(std::int64_t since)
{
    for (auto& [machine, unit] : mUnits) {
        dropRepeats(unit.runs);
        unit.package = unit.board = kept("");
        for (const FleetRun& run : unit.runs) { // a run that read no version left the one before
            unit.package = run.package->empty() ? unit.package : run.package;
            unit.board = run.board->empty() ? unit.board : run.board;
        }
        unit.state = unit.last().begin < since ? UnitState::NOT_SEEN : unit.last().state;
        const auto old = std::find_if(unit.runs.begin(), unit.runs.end() - 1,
                                      [&](const FleetRun& run) { return run.begin >= since; });
        unit.runs.erase(unit.runs.begin(), old);
    }
}

void Fleet::dropRepeats(std::vector<FleetRun>& runs)
{
    std::stable_sort(runs.begin(), runs.end(), [](const FleetRun& first, const FleetRun& second) {
        return std::pair(first.begin, first.end) < std::pair(second.begin, second.end);
    });
    std::vector<FleetRun> single;
    for (FleetRun& run : runs) {
        if (single.empty() || !isSameRun(single.back(), run)) {
            single.push_back(std::move(run));
            continue;
        }
        ++mRepeatedRuns;
        if (run.lines > single.back().lines) {
            single.back() = std::move(run);
        }
    }
    runs = std::move(single);
}
