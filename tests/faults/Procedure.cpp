#include "Procedure.h"

#include "UnitTest.h"

#include <algorithm>
#include <stdexcept>

namespace
{

/// What the updater can distinguish in a command's answer.
enum class Seen {
    Any,
    Success,
    Failure,
    Differ, ///< two versions that differ, or a request
    Same,   ///< two equal versions, or no request
    Unknown ///< a version is missing, or the answer cannot be trusted
};

/// Whether a row holds before or after an installation of the package.
enum class Package { Any, Current, Updated };

struct Row
{
    std::string step;
    Seen seen;
    std::string next; ///< a step, a wait, or what is reported
    Package package = Package::Any;
};

using Rows = std::vector<Row>;

const Rows remoteHead = {
    {"stop harl", Seen::Any, "refresh"},
    {"refresh", Seen::Success, "query"},
    {"refresh", Seen::Failure, "error 1"},
    {"query", Seen::Differ, "install"},
    {"query", Seen::Same, "read board"},
    {"query", Seen::Unknown, "error 0"},
    {"install", Seen::Success, "read board"},
    {"install", Seen::Failure, "error 2"},
    {"read board", Seen::Success, "list stick"},
    {"read board", Seen::Failure, "result 0", Package::Current},
    {"read board", Seen::Failure, "error 0", Package::Updated},
    {"list stick", Seen::Differ, "upload"},
    {"list stick", Seen::Same, "result 0", Package::Current},
    {"list stick", Seen::Same, "remove marker", Package::Updated},
    {"list stick", Seen::Unknown, "result 0", Package::Current},
    {"list stick", Seen::Unknown, "error 0", Package::Updated},
    {"upload", Seen::Success, "board script"},
    {"upload", Seen::Failure, "error 3"},
    {"board script", Seen::Any, "wait 780"},
    {"wait 780", Seen::Any, "remove marker"},
    {"remove marker", Seen::Any, "result 1"},
};

const Rows mainHeadCheck = {
    {"stop harl", Seen::Any, "refresh"},
    {"refresh", Seen::Success, "query"},
    {"refresh", Seen::Failure, "error 1"},
    {"query", Seen::Differ, "read board"},
    {"query", Seen::Same, "read board"},
    {"query", Seen::Unknown, "error 0"},
    {"read board", Seen::Success, "list stick"},
    {"read board", Seen::Failure, "error 0"},
    {"list stick", Seen::Differ, "find TeamViewer"},
    {"list stick", Seen::Same, "find TeamViewer"},
    {"list stick", Seen::Unknown, "error 0"},
    {"find TeamViewer", Seen::Differ, "remove marker"},
    {"find TeamViewer", Seen::Same, "remove marker"},
    {"find TeamViewer", Seen::Unknown, "error 0"},
    {"remove marker", Seen::Any, "offer"},
};

const Rows mainHeadInstall = {
    {"install", Seen::Success, "next"},        {"install", Seen::Failure, "error 2"},
    {"upload", Seen::Success, "board script"}, {"upload", Seen::Failure, "error 3"},
    {"board script", Seen::Any, "wait 780"},   {"wait 780", Seen::Any, "next"},
    {"TeamViewer script", Seen::Any, "next"},
};

/// The main head's components: the check that finds an update of one, its kind and name, and its first install step.
struct Component
{
    std::string check;
    std::string offer;
    std::string install;
};
const std::vector<Component> components = {
    {"query", "{0,Solvik IV}", "install"},
    {"list stick", "{1,QUORB}", "upload"},
    {"find TeamViewer", "{2,TV}", "TeamViewer script"},
};

const int attempts = 20;

/// Closing steps; the remote head first gives the operator 30 s.
const platform::Lines closing = {ran(unmountCommand), ran(startHarlCommand), "sleep:10", ran(stopUpdaterCommand)};

const Fault* faultOf(const std::vector<Injection>& injections, const std::string& step, int attempt = 0)
{
    for (const Injection& injection : injections) {
        if (injection.step == step && (step != "upload" || attempt < injection.times)) {
            return injection.fault;
        }
    }
    return nullptr;
}

/// One walk through the tables.
class Walk
{
public:
    Walk(const Unit& unit, const std::vector<Injection>& injections)
        : mUnit(unit), mInjections(injections), mSteps(stepsOf(unit))
    {
    }

    /// Follows `rows` from `state`; returns the first state without a row.
    std::string go(const Rows& rows, std::string state);

    platform::Lines mCalls;
    platform::Lines mFound; ///< checks that found an update

private:
    Seen take(const std::string& state);
    Seen takeUpload(const Step& step);
    Seen answer(const Step& step);
    Seen healthy(const std::string& step) const;

    const Unit& mUnit;
    const std::vector<Injection>& mInjections;
    const std::vector<Step> mSteps;
    bool mBoardRead = true;
    bool mInstalled = false;
};

std::string Walk::go(const Rows& rows, std::string state)
{
    for (;;) {
        const bool known = std::any_of(rows.begin(), rows.end(), [&](const Row& row) { return row.step == state; });
        if (!known) {
            return state;
        }
        const Seen seen = take(state);
        const Package package = mInstalled ? Package::Updated : Package::Current;
        const auto row = std::find_if(rows.begin(), rows.end(), [&](const Row& candidate) {
            return candidate.step == state && candidate.seen == seen &&
                   (candidate.package == Package::Any || candidate.package == package);
        });
        if (row == rows.end()) {
            throw std::logic_error("no row for " + state);
        }
        if (seen == Seen::Differ) {
            mFound.push_back(state);
        }
        mInstalled = mInstalled || state == "install";
        state = row->next;
    }
}

Seen Walk::take(const std::string& state)
{
    if (state == "wait 780") {
        mCalls.push_back("sleep:780");
        return Seen::Any;
    }
    const auto step =
        std::find_if(mSteps.begin(), mSteps.end(), [&](const Step& candidate) { return candidate.name == state; });
    if (step == mSteps.end()) {
        throw std::logic_error("no step " + state);
    }
    if (state == "upload") {
        return takeUpload(*step);
    }
    const bool run = step->reads == Reads::Nothing || step->reads == Reads::Status;
    mCalls.push_back(run ? ran(step->command) : opened(step->command));
    return answer(*step);
}

Seen Walk::takeUpload(const Step& step)
{
    for (int attempt = 0; attempt < attempts; ++attempt) {
        mCalls.push_back(ran(step.command));
        const Fault* fault = faultOf(mInjections, "upload", attempt);
        if (fault == nullptr || fault->status == 0) {
            return Seen::Success;
        }
    }
    return Seen::Failure;
}

Seen Walk::answer(const Step& step)
{
    const Fault* fault = faultOf(mInjections, step.name);
    const int code = fault == nullptr ? healthyCode(mUnit, step.name) : fault->code();
    const Text text = fault == nullptr ? Text::Kept : fault->text;

    switch (step.reads) {
    case Reads::Nothing:
    case Reads::Status:
        return Seen::Any;
    case Reads::Code:
        return code == 0 ? Seen::Success : Seen::Failure;
    case Reads::Policy:
        return text == Text::None ? Seen::Unknown : healthy(step.name);
    case Reads::Board:
        mBoardRead = text != Text::None;
        return code == 0 ? Seen::Success : Seen::Failure;
    case Reads::Listing:
        if (code != 0 || text == Text::None || !mBoardRead) {
            return Seen::Unknown;
        }
        return text == Text::Kept ? healthy(step.name) : Seen::Differ;
    case Reads::Marker:
        if (code != 0) {
            return code == 2 ? Seen::Same : Seen::Unknown;
        }
        return text == Text::Kept ? healthy(step.name) : Seen::Same;
    }
    throw std::logic_error("no such way to read");
}

Seen Walk::healthy(const std::string& step) const
{
    const bool differs = step == "query"        ? mUnit.packageDiffers
                         : step == "list stick" ? mUnit.boardDiffers
                                                : mUnit.teamViewer;
    return differs ? Seen::Differ : Seen::Same;
}

Expected followRemoteHead(Walk& walk)
{
    Expected expected;
    expected.report = walk.go(remoteHead, "stop harl");
    expected.calls = joined({walk.mCalls,
                             ran(darkPanel()),
                             {ran(outcomeSound(expected.report))},
                             ran(outcomePanel(expected.report)),
                             {"sleep:30"}});
    return expected;
}

/// As the journal's notes spell it: "error 1" becomes "error:1".
std::string note(std::string report)
{
    return report.replace(report.find(' '), 1, ":");
}

Expected followMainHead(Walk& walk)
{
    Expected expected;
    expected.report = walk.go(mainHeadCheck, "stop harl");
    if (expected.report != "offer") {
        walk.mCalls.push_back(note(expected.report));
    } else if (walk.mFound.empty()) {
        expected.report = "result 0";
        walk.mCalls.push_back("result:0");
    } else {
        const platform::Lines found = walk.mFound;
        const auto isFound = [&](const Component& component) {
            return std::find(found.begin(), found.end(), component.check) != found.end();
        };
        std::string offer = "found:";
        for (const Component& component : components) {
            offer += isFound(component) ? component.offer : "";
        }
        walk.mCalls.push_back(offer);
        expected.report = "next";
        for (const Component& component : components) {
            if (expected.report == "next" && isFound(component)) {
                expected.report = walk.go(mainHeadInstall, component.install);
            }
        }
        expected.report = expected.report == "next" ? "result 1" : expected.report;
        walk.mCalls.push_back(note(expected.report));
    }
    expected.calls = walk.mCalls;
    return expected;
}

/// The last record before a report, if it does not depend on a tool's output.
std::string lastMessage(bool mainHead, const std::string& report, const std::vector<Injection>& injections)
{
    if (report == "error 0") {
        return "Failed to checkUpdate";
    }
    if (report == "error 1") {
        return "Update mirrors failed:";
    }
    if (report == "result 1" && mainHead) {
        return "update maainhead finished";
    }
    const Fault* removal = faultOf(injections, "remove marker");
    if (report == "result 1" && (removal == nullptr || removal->status >= 0)) {
        return std::string("removed") + markerCommand;
    }
    if (report == "error 2" && !mainHead) {
        return "update failed";
    }
    if (report == "error 3") {
        return mainHead ? "Failed inside uploadQuorbFiles" : "update QUORB failed";
    }
    return "";
}

} // namespace

std::vector<Step> stepsOf(const Unit& unit)
{
    const std::string package = unit.mainHead ? "solvik4-dh" : "solvik4-rh";
    std::vector<Step> steps = {
        {"stop harl", stopHarlCommand, Reads::Nothing},
        {"refresh", mirrorsCommand, Reads::Code},
        {"query", "apt-cache policy " + package, Reads::Policy},
        {"install", "apt --assume-yes install " + package, Reads::Code},
        {"read board", boardVersionCommand, Reads::Board},
        {"list stick", stickVersionCommand, Reads::Listing},
        {"upload", uploadCommand, Reads::Status},
        {"board script", boardScriptCommand, Reads::Nothing},
        {"remove marker", markerCommand, Reads::Nothing},
        {"release stick", unmountCommand, Reads::Nothing},
        {"start harl", startHarlCommand, Reads::Nothing},
        {"stop updater", stopUpdaterCommand, Reads::Nothing},
    };
    if (unit.mainHead) {
        steps.push_back({"find TeamViewer", teamViewerCheckCommand, Reads::Marker});
        steps.push_back({"TeamViewer script", teamViewerScriptCommand, Reads::Nothing});
    }
    return steps;
}

std::string healthyOutput(const Unit& unit, const std::string& step)
{
    if (step == "query") {
        return policy("1.2.0", unit.packageDiffers ? "1.3.0" : "1.2.0");
    }
    if (step == "read board") {
        return "Brimvale\t2.1.0\r\n";
    }
    if (step == "list stick") {
        return unit.boardDiffers ? "quorb2.2.0\n" : "quorb2.1.0\n";
    }
    if (step == "find TeamViewer") {
        return unit.teamViewer ? std::string(teamViewerMarker) + "\n" : "";
    }
    return step == "refresh" || step == "install" ? "Reading package lists...\n" : "";
}

int healthyCode(const Unit& unit, const std::string& step)
{
    return step == "find TeamViewer" && !unit.teamViewer ? 2 : 0;
}

platform::Lines darkPanel()
{
    return allLeds(dark);
}

platform::Lines outcomePanel(const std::string& report)
{
    const char* color = report[0] == 'r' ? passColor : failColor;
    if (report == "result 1") {
        return {ledCommand(ledPass, color)};
    }
    if (report == "error 2" || report == "error 3") {
        return {ledCommand(ledFail, color)};
    }
    return {ledCommand(ledRemote, color), ledCommand(ledMain, color)};
}

std::string outcomeSound(const std::string& report)
{
    return report[0] == 'r' ? passSoundCommand : failSoundCommand;
}

Expected follow(const Unit& unit, const std::vector<Injection>& injections)
{
    Walk walk(unit, injections);
    Expected expected = unit.mainHead ? followMainHead(walk) : followRemoteHead(walk);
    expected.calls.insert(expected.calls.end(), closing.begin(), closing.end());
    expected.message = lastMessage(unit.mainHead, expected.report, injections);
    return expected;
}
