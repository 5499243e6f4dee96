/// Every command of every path of both heads, with every fault, and with every pair of faults. Each case is a process
/// of its own that runs the program's main(), or one update of the main head, on the stand-in platform.

#include "AppLock.h"
#include "Cases.h"
#include "Procedure.h"
#include "UnitTest.h"

#include <algorithm>
#include <map>
#include <set>
#include <unistd.h>

int updaterMain(int, char**); // main() of the remote head's program, renamed for this test program

namespace
{

// The stand-in platform of one case

std::thread::id updateThread;
std::set<std::string> failingCommands;

void scriptCommand(const std::string& command, int healthyStatus, const std::string& healthy,
                   const Injection* injection)
{
    const bool opens = command == stopHarlCommand;
    const auto before = [opens](int delay) {
        if (opens) {
            updateThread = std::this_thread::get_id();
            platform::waitFor([] { return applicationLockWaited.load(); });
        }
        platform::delay(delay);
    };
    const platform::Answer well = {healthyStatus, healthy, true, [before] { before(0); }};
    if (injection == nullptr) {
        script(command, {well});
        return;
    }
    const Fault& fault = *injection->fault;
    if (fault.status != 0) {
        failingCommands.insert(command);
    }
    std::vector<platform::Answer> answers(
        static_cast<std::size_t>(std::max(1, injection->times)),
        {fault.status, fault.output(healthy), fault.starts, [before, &fault] { before(fault.delay); }});
    if (injection->times != 0) {
        answers.push_back(well);
    }
    script(command, answers);
}

void scriptUnit(const Case& what)
{
    platform::reset();
    for (const Step& step : stepsOf(what.unit)) {
        const auto injection = std::find_if(what.injections.begin(), what.injections.end(),
                                            [&](const Injection& candidate) { return candidate.step == step.name; });
        scriptCommand(step.command, healthyCode(what.unit, step.name) * 256, healthyOutput(what.unit, step.name),
                      injection == what.injections.end() ? nullptr : &*injection);
    }
    for (const Injection& injection : what.injections) {
        for (const std::string& command : ledCommands()) {
            if (injection.step == panelStep || injection.step == command) {
                scriptCommand(command, 0, "", &injection);
            }
        }
        for (const char* report : {"result 0", "error 0"}) {
            if (injection.step == soundStep) {
                scriptCommand(outcomeSound(report), 0, "", &injection);
            }
        }
    }
    platform::scriptSleep([](const timespec* duration, timespec*) {
        if (duration->tv_sec == 1) { // of the flashing thread: not instant, or it would do nothing but flash
            usleep(300);
        }
        return 0;
    });
}

/// Commands, pauses and reports without the log.
platform::Lines callsIn(const platform::Lines& journal)
{
    platform::Lines calls;
    std::copy_if(journal.begin(), journal.end(), std::back_inserter(calls),
                 [](const std::string& entry) { return entry.compare(0, 4, "log:") != 0; });
    return calls;
}

// What must hold in every case

void expectWholeRecords()
{
    for (const platform::Record& record : platform::records()) { // fails by itself on any that is not well-formed
        EXPECT_TRUE(record.flushed);
    }
}

/// Every failing LED command and sound is logged, and no other.
void expectFailuresLogged()
{
    platform::Lines failed;
    std::size_t failedSounds = 0;
    for (const std::string& command : entries("system:")) {
        const bool fails = failingCommands.count(command) != 0;
        if (fails && command.compare(0, 7, "i2cset ") == 0) {
            failed.push_back(command);
        }
        if (fails && command.compare(0, 6, "aplay ") == 0) {
            ++failedSounds;
        }
    }
    platform::Lines logged = entries("log:system returned false: ");
    for (platform::Lines* lines : {&failed, &logged}) { // two threads send LED commands
        std::sort(lines->begin(), lines->end());
    }
    EXPECT_EQ(logged, failed);
    EXPECT_EQ(entries("log:Failed to play a sound").size(), failedSounds);
}

/// The panel is dark before the sound, and afterwards shows the outcome and nothing else.
void expectPanelShows(const std::string& report)
{
    const platform::Lines calls = entries("system:");
    const auto sound = std::find(calls.begin(), calls.end(), outcomeSound(report));
    ASSERT_GE(sound - calls.begin(), 14);
    EXPECT_EQ(platform::Lines(sound - 14, sound), darkPanel());
    platform::Lines lit;
    std::copy_if(sound + 1, calls.end(), std::back_inserter(lit),
                 [](const std::string& command) { return command.compare(0, 7, "i2cset ") == 0; });
    EXPECT_EQ(lit, outcomePanel(report));
    EXPECT_EQ(std::count_if(calls.begin(), calls.end(),
                            [](const std::string& command) { return command.compare(0, 6, "aplay ") == 0; }),
              1);
}

/// The one report of the remote head comes from `callback`, after a record with the outcome's `message`.
void expectOneReport(const std::string& report, const std::string& message)
{
    const std::string callback = report[0] == 'r' ? "resultCallback" : "errorCallback";
    const std::vector<platform::Record> records = platform::records();
    std::string last;
    int reports = 0;
    for (const platform::Record& record : records) {
        if (record.function.find("Callback(UpdateManager::") != std::string::npos && record.message.empty()) {
            ++reports;
            EXPECT_THAT(record.function, testing::HasSubstr(callback));
            EXPECT_TRUE(message.empty() || last == message) << last;
        }
        if (record.function.find("UpdateManager::") != std::string::npos) {
            last = record.message;
        }
    }
    EXPECT_EQ(reports, 1);
}

/// The main thread logs its start, darkens the panel before anything else happens, and waits for the update.
void expectMainThread(const platform::Lines& own)
{
    const platform::Lines expected =
        joined({{logged("TavrenUpdater version: 1.0.0")},
                ran(darkPanel()),
                {logged("BEFORE UPDATE"), logged(""), logged(""), logged(""), logged("1"), logged("AFTER UPDATE")}});
    platform::Lines seen;
    std::copy_if(own.begin(), own.end(), std::back_inserter(seen),
                 [](const std::string& entry) { return entry.compare(0, 27, "log:system returned false: ") != 0; });
    EXPECT_EQ(seen, expected);
}

/// Up to "BEFORE UPDATE" only the main thread has logged.
void expectOpeningBeforeTheUpdate()
{
    const std::vector<platform::Record> records = platform::records();
    const auto opened = std::find_if(records.begin(), records.end(),
                                     [](const platform::Record& record) { return record.message == "BEFORE UPDATE"; });
    ASSERT_NE(opened, records.end());
    for (auto record = records.begin(); record != opened; ++record) {
        EXPECT_EQ(record->thread, opened->thread);
    }
}

// Runs

void runRemoteHead(const Case& what)
{
    const Expected expected = follow(what.unit, what.injections);
    scriptUnit(what);
    EXPECT_EQ(updaterMain(0, nullptr), 0);
    EXPECT_EQ(callsIn(journal(updateThread)), expected.calls);
    expectMainThread(journal(std::this_thread::get_id()));
    expectOpeningBeforeTheUpdate();
    expectWholeRecords();
    expectFailuresLogged();
    expectPanelShows(expected.report);
    expectOneReport(expected.report, expected.message);
}

std::atomic<int> mainHeadReports{0};
std::vector<UpdateManager::UpdateComponent> offered;

void noteReport(const std::string& text)
{
    platform::note(text);
    ++mainHeadReports;
}

void runMainHead(const Case& what)
{
    const Expected expected = follow(what.unit, what.injections);
    applicationLockWaited = true; // nobody waits there on the main head
    scriptUnit(what);
    UpdateManager* manager = UpdateManager::instance();
    manager->setCallbacks([](UpdateManager::Result result) { noteReport("result:" + std::to_string(result)); },
                          [](UpdateManager::Error error) { noteReport("error:" + std::to_string(error)); },
                          [](std::vector<UpdateManager::UpdateComponent> components) {
                              offered = std::move(components);
                              std::string text = "found:";
                              for (const UpdateManager::UpdateComponent& component : offered) {
                                  text += "{" + std::to_string(component.kind) + "," + component.name + "}";
                              }
                              noteReport(text);
                          });
    manager->init(false);
    platform::waitFor([] { return mainHeadReports == 1; });
    if (!offered.empty()) {
        manager->update(offered, false);
        platform::waitFor([] { return mainHeadReports == 2; });
    }
    std::string last;
    for (const std::string& entry : journal()) {
        last = entry.compare(0, 4, "log:") == 0 ? entry.substr(4) : last;
    }
    EXPECT_TRUE(expected.message.empty() || last == expected.message) << last;
    manager->deinit(false);
    platform::waitFor([] { // the last command and the record of its status
        return !entries(ran(stopUpdaterCommand)).empty() && journal().back().compare(0, 4, "log:") == 0 &&
               platform::records().back().flushed;
    });
    EXPECT_EQ(callsIn(journal()), expected.calls);
    expectWholeRecords();
}

/// Runs the case and ends the process.
[[noreturn]] void runAlone(const Case& what)
{
    const int before = resultsSoFar();
    alarm(60);
    if (what.unit.mainHead) {
        runMainHead(what);
    } else {
        runRemoteHead(what);
    }
    endCase(before);
}

int casesRun = 0;

void expectHolds(const Case& what)
{
    ++casesRun;
    SCOPED_TRACE(what.name());
    EXPECT_EXIT(runAlone(what), testing::ExitedWithCode(0), "");
}

/// Prints the number of cases: a test of two faults runs many.
class Count : public testing::Environment
{
    void TearDown() override { std::printf("%d cases\n", casesRun); }
};
const testing::Environment* const count = testing::AddGlobalTestEnvironment(new Count);

class OneFault : public testing::TestWithParam<Case>
{
};

TEST_P(OneFault, EndsAsTheProcedureSays)
{
    expectHolds(GetParam());
}

/// The parameter's fault, together with each fault of each later step.
class TwoFaults : public testing::TestWithParam<Case>
{
};

TEST_P(TwoFaults, EndAsTheProcedureSays)
{
    const Unit& unit = GetParam().unit;
    const Injection& first = GetParam().injections.at(0);
    bool later = false;
    for (const Injection& second : procedureInjections(unit)) {
        if (later && second.step != first.step && allHappen(unit, {first, second})) {
            expectHolds({unit, {first, second}});
        }
        later = later || (second.step == first.step && second.fault == first.fault && second.times == first.times);
    }
}

std::string nameOf(const testing::TestParamInfo<Case>& info)
{
    return info.param.name();
}

INSTANTIATE_TEST_SUITE_P(FaultMatrix, OneFault, testing::ValuesIn(everyFault()), nameOf);
INSTANTIATE_TEST_SUITE_P(FaultMatrix, TwoFaults, testing::ValuesIn(faultsOfTheProcedure()), nameOf);

} // namespace
