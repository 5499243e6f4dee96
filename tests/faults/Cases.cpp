#include "Cases.h"

#include "UnitTest.h"

#include <algorithm>
#include <cctype>

namespace
{

std::vector<Unit> units()
{
    std::vector<Unit> all;
    all.reserve(12);
    for (int bits = 0; bits < 4; ++bits) {
        all.push_back({false, (bits & 1) != 0, (bits & 2) != 0, false});
    }
    for (int bits = 0; bits < 8; ++bits) {
        all.push_back({true, (bits & 1) != 0, (bits & 2) != 0, (bits & 4) != 0});
    }
    return all;
}

} // namespace

std::string Case::name() const
{
    std::string text = unit.mainHead ? "MainHead" : "RemoteHead";
    text += unit.packageDiffers ? "_package" : "";
    text += unit.boardDiffers ? "_board" : "";
    text += unit.teamViewer ? "_TeamViewer" : "";
    for (const Injection& injection : injections) {
        text += "__" + injection.step + "_" + injection.fault->name;
        text += injection.times == 0 ? "" : "_times" + std::to_string(injection.times);
    }
    text.erase(std::remove_if(text.begin(), text.end(), [](char c) { return isalnum(c) == 0 && c != '_'; }),
               text.end());
    return text;
}

platform::Lines ledCommands(const std::vector<std::string>& reports)
{
    platform::Lines commands = darkPanel();
    for (const std::string& report : reports) {
        const platform::Lines lit = outcomePanel(report);
        commands.insert(commands.end(), lit.begin(), lit.end());
    }
    for (const char* led : {ledRemote, ledMain}) { // the flashing
        commands.push_back(ledCommand(led, blue));
    }
    return commands;
}

std::vector<Injection> procedureInjections(const Unit& unit)
{
    std::vector<Injection> all;
    for (const Step& step : stepsOf(unit)) {
        const bool run = step.reads == Reads::Nothing || step.reads == Reads::Status;
        for (const Fault& fault : run ? runFaults() : readFaults()) {
            if (step.name != "upload") {
                all.push_back({step.name, &fault});
                continue;
            }
            for (const int times : {1, 19, 20}) {
                all.push_back({step.name, &fault, times});
            }
        }
    }
    if (!unit.mainHead) {
        for (const Fault& fault : runFaults()) {
            all.push_back({panelStep, &fault});
            all.push_back({soundStep, &fault});
        }
    }
    return all;
}

bool allHappen(const Unit& unit, const std::vector<Injection>& injections)
{
    const platform::Lines calls = follow(unit, injections).calls;
    const std::vector<Step> steps = stepsOf(unit);
    return std::all_of(injections.begin(), injections.end(), [&](const Injection& injection) {
        const auto step =
            std::find_if(steps.begin(), steps.end(), [&](const Step& one) { return one.name == injection.step; });
        return step == steps.end() || // the panel and the sound
               std::any_of(calls.begin(), calls.end(),
                           [&](const std::string& call) { return call.substr(call.find(':') + 1) == step->command; });
    });
}

std::vector<Case> faultsOfTheProcedure()
{
    std::vector<Case> cases;
    for (const Unit& unit : units()) {
        for (const Injection& injection : procedureInjections(unit)) {
            if (allHappen(unit, {injection})) {
                cases.push_back({unit, {injection}});
            }
        }
    }
    return cases;
}

std::vector<Case> everyFault()
{
    std::vector<Case> cases = faultsOfTheProcedure();
    for (const Unit& unit : units()) {
        cases.push_back({unit, {}});
        const std::string report = follow(unit, {}).report;
        for (const std::string& command : unit.mainHead ? platform::Lines{} : ledCommands({report})) {
            for (const Fault& fault : runFaults()) {
                cases.push_back({unit, {{command, &fault}}});
            }
        }
    }
    return cases;
}
