#include "fleet/fleet.h"

#include "log/catalogue.h"
#include "log/text.h"
#include "procedure.h"

#include <algorithm>
#include <utility>

namespace
{

const char* stateOf(const Run& run)
{
    const bool unfinished = run.ended == RunEnd::NOT_SEEN;
    const bool failed = isFailure(run.outcome) || run.ended == RunEnd::EARLY ||
                        run.service.has(ServiceEvent::FAILURE_SHOWN) || (!unfinished && run.outcome == Outcome::NONE);
    return wentWell(run) ? "well" : failed ? "failed" : unfinished ? "never-ended" : "not-well";
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
    const bool sameBoot = first.boot.empty() || second.boot.empty() || first.boot == second.boot;
    return sameBoot && (second.begin < first.end || (second.begin == first.begin && second.end == first.end));
}

/// Brings a unit's runs into order and leaves the longer one of two readings. Returns how many lines were dropped.
std::uint64_t dropRepeats(std::vector<FleetRun>& runs)
{
    std::stable_sort(runs.begin(), runs.end(), [](const FleetRun& first, const FleetRun& second) {
        return std::pair(first.begin, first.end) < std::pair(second.begin, second.end);
    });
    std::uint64_t dropped = 0;
    std::vector<FleetRun> single;
    for (FleetRun& run : runs) {
        if (single.empty() || !isSameRun(single.back(), run)) {
            single.push_back(std::move(run));
            continue;
        }
        if (run.lines > single.back().lines) {
            std::swap(run, single.back());
        }
        dropped += run.lines;
    }
    runs = std::move(single);
    return dropped;
}

} // namespace

void Fleet::add(const std::string& machine, const std::string& name, const std::string& boot, const Run& run)
{
    FleetRun one;
    one.begin = run.begin;
    one.end = run.end;
    one.boot = boot;
    one.lines = run.lastLine - run.firstLine + 1;
    one.state = stateOf(run);
    one.outcome = outcomeName(run.outcome);
    one.meaning = operatorView(run).meaning;
    one.failure = run.failure ? run.failure->failure->name : "";
    for (const Problem& problem : run.besides) {
        one.besides.push_back(problem.failure->name);
    }
    const std::string package = versionAfter(run, run.package, StepKind::INSTALL_PACKAGE);
    one.package = package.empty() ? "" : packageOf(run.mainHead) + ' ' + package;
    one.board = versionAfter(run, run.board, StepKind::RUN_BOARD_SCRIPT);

    const std::lock_guard lock(mMutex);
    FleetUnit& unit = mUnits[machine.empty() ? name : machine];
    unit.name = name;
    unit.machine = machine;
    unit.runs.push_back(std::move(one));
}

void Fleet::finish(const std::string& since, const std::string& failed)
{
    for (auto next = mUnits.begin(); next != mUnits.end();) {
        const auto unit = next++;
        std::vector<FleetRun>& runs = unit->second.runs;
        mRepeats += dropRepeats(runs);
        std::string package = "not known";
        std::string board = "not known";
        for (FleetRun& run : runs) { // one that read no version left the one before
            run.package = package = run.package.empty() ? package : run.package;
            run.board = board = run.board.empty() ? board : run.board;
        }
        const auto isOld = [&](const FleetRun& run) { return isoText(run.begin) < since; };
        runs.back().state = isOld(runs.back()) ? "not-seen" : runs.back().state;
        runs.erase(std::remove_if(runs.begin(), runs.end() - 1, isOld), runs.end() - 1);
        const std::vector<std::string>& besides = runs.back().besides;
        if (!failed.empty() && runs.back().failure != failed &&
            std::count(besides.begin(), besides.end(), failed) == 0) {
            mUnits.erase(unit);
        }
    }
}
