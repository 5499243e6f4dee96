/// Whole runs with varied delays, for the thread sanitizer. Each run is a process of its own. --gtest_repeat=N makes N
/// of each.

#include "AppLock.h"
#include "Cases.h"
#include "UnitTest.h"

#include <algorithm>
#include <random>
#include <unistd.h>

int updaterMain(int, char**); // main() of the remote head's program, renamed for this test program

/// A race ends the process at once, so that it cannot be overlooked. The main head does not join every worker, on
/// purpose: that is not a leak to report.
extern "C" const char* __tsan_default_options() // NOLINT(bugprone-reserved-identifier): the sanitizer calls it
{
    return "halt_on_error=1 report_thread_leaks=0";
}

namespace
{

/// Delays of 0 to 3 ms, drawn by any thread.
class Delays
{
public:
    explicit Delays(unsigned seed) : mRandom(seed) {}
    void wait()
    {
        useconds_t length = 0;
        {
            const std::lock_guard<std::mutex> lock(mMutex);
            length = std::uniform_int_distribution<useconds_t>(0, 3000)(mRandom);
        }
        usleep(length);
    }

private:
    std::mutex mMutex;
    std::mt19937 mRandom;
};

std::unique_ptr<Delays> delays;
std::atomic<int> ledCommandsRunning{0};
std::atomic<bool> outcomeShown{false};
std::atomic<bool> pairSplit{false};

/// Two simultaneous LED commands mix their bytes on the bus.
void sendLed()
{
    if (++ledCommandsRunning > 1 && outcomeShown) {
        pairSplit = true;
    }
    delays->wait();
    --ledCommandsRunning;
}

std::atomic<int> workCommandsRunning{0};
std::atomic<bool> workersMixed{false};

/// A command of a check or an installation: one waits for the other, and an installation for the one before it.
void work()
{
    if (++workCommandsRunning > 1) {
        workersMixed = true;
    }
    delays->wait();
    --workCommandsRunning;
}

void scriptDelays(bool mainHead)
{
    for (const Step& step : stepsOf({mainHead, true, true, true})) {
        const bool opens = step.name == "stop harl";
        const bool closes = step.name == "release stick" || step.name == "start harl" || step.name == "stop updater";
        script(step.command,
               {{0, healthyOutput({mainHead, true, true, true}, step.name), true, [opens, closes, mainHead] {
                     if (opens && !mainHead) {
                         platform::waitFor([] { return applicationLockWaited.load(); });
                     }
                     closes ? delays->wait() : work();
                 }}});
    }
    for (const std::string& command : ledCommands()) {
        script(command, {{0, "", true, sendLed}});
    }
    for (const char* report : {"result 1", "error 1"}) {
        script(outcomeSound(report), {{0, "", true, [] {
                                           outcomeShown = true;
                                           delays->wait();
                                       }}});
    }
    platform::scriptSleep([](const timespec* duration, timespec*) {
        const int cycle = duration->tv_sec == 1 ? 10 : 1; // the flashing thread's pause outlasts what others do
        for (int i = 0; i < cycle; ++i) {
            delays->wait();
        }
        return 0;
    });
}

void runRemoteHead(unsigned seed)
{
    alarm(120);
    delays = std::make_unique<Delays>(seed);
    platform::reset();
    scriptDelays(false);
    if (seed % 2 == 0) {
        script(mirrorsCommand, {exits(100)});
    }
    EXPECT_EQ(updaterMain(0, nullptr), 0);
    EXPECT_FALSE(pairSplit);
    EXPECT_FALSE(platform::records().empty());
    const std::string report = seed % 2 == 0 ? "error 1" : "result 1";
    const Lines commands = entries("system:");
    const auto sound = std::find(commands.begin(), commands.end(), outcomeSound(report));
    ASSERT_NE(sound, commands.end());
    const Lines closing = {unmountCommand, startHarlCommand, stopUpdaterCommand};
    EXPECT_EQ(Lines(sound + 1, commands.end()), joined({outcomePanel(report), closing}));
}

std::atomic<int> reports{0};

/// `order` names the calls: i init, u update, d deinit; a blank waits until all reports so far have come.
void runMainHead(const std::string& order, unsigned seed)
{
    alarm(120);
    delays = std::make_unique<Delays>(seed);
    platform::reset();
    scriptDelays(true);
    UpdateManager* manager = UpdateManager::instance();
    manager->setCallbacks([](UpdateManager::Result) { ++reports; }, [](UpdateManager::Error) { ++reports; },
                          [](std::vector<UpdateManager::UpdateComponent>) { ++reports; });
    int due = 0;
    std::size_t closings = 0;
    for (const char call : order) {
        switch (call) {
        case 'i':
            manager->init(false);
            ++due;
            break;
        case 'u':
            manager->update({{0, "", "", ""}, {1, "", "", ""}, {2, "", "", ""}}, false);
            ++due;
            break;
        case 'd':
            manager->deinit(false);
            ++closings;
            break;
        default:
            platform::waitFor([&] { return reports == due; });
        }
    }
    platform::waitFor([&] { return reports == due && entries(ran(stopUpdaterCommand)).size() == closings; });
    EXPECT_FALSE(workersMixed);
    EXPECT_FALSE(platform::records().empty());
}

unsigned nextSeed()
{
    static std::random_device device;
    return device();
}

TEST(Threads, RemoteHeadTearsNoRecordAndSplitsNoPairOnceTheOutcomeIsShown)
{
    const unsigned seed = nextSeed();
    SCOPED_TRACE("seed " + std::to_string(seed));
    const int before = resultsSoFar();
    EXPECT_EXIT((runRemoteHead(seed), endCase(before)), testing::ExitedWithCode(0), "");
}

TEST(Threads, MainHeadTearsNoRecordInAnyOrderOfCalls)
{
    // A closing step is allowed while a check or an installation still runs; so is a second installation, which waits
    // for the first.
    for (const std::string order : {"i u d", "iu d", "iud", "i ud", "i d", "id", "iuu d", "i u u d"}) {
        const unsigned seed = nextSeed();
        SCOPED_TRACE(order + ", seed " + std::to_string(seed));
        const int before = resultsSoFar();
        EXPECT_EXIT((runMainHead(order, seed), endCase(before)), testing::ExitedWithCode(0), "");
    }
}

} // namespace
