#include "LedManager.h"
#include "UnitTest.h"

#include <atomic>
#include <cerrno>
#include <thread>

namespace
{

class Leds : public UnitTest
{
protected:
    /// The journal of `commands` that fail.
    static Lines failing(const Lines& commands)
    {
        Lines lines;
        for (const std::string& command : commands) {
            lines.push_back(ran(command));
            lines.push_back(logged("system returned false: " + command));
        }
        return lines;
    }
};

TEST_F(Leds, PanelIsOneObject)
{
    EXPECT_NE(LedManager::instance(), nullptr);
    EXPECT_EQ(LedManager::instance(), LedManager::instance());
}

TEST_F(Leds, TurnOnSendsTheLedThenTheColour)
{
    LedManager::turnOn(LedManager::LED_MAIN, LedManager::COLOR_FAIL);
    LedManager::turnOn(LedManager::LED_REMOTE, LedManager::COLOR_BLUE);
    LedManager::turnOn(LedManager::LED_PASS, LedManager::COLOR_PASS);
    LedManager::turnOn(LedManager::LED_FAIL, LedManager::COLOR_OFF);
    EXPECT_EQ(journal(), (Lines{"system:i2cset -y 0 0x07 0x15 c ; i2cset -y 0 0x07 0x8 c",
                                "system:i2cset -y 0 0x07 0x12 c ; i2cset -y 0 0x07 0x1 c",
                                "system:i2cset -y 0 0x07 0x13 c ; i2cset -y 0 0x07 0x2 c",
                                "system:i2cset -y 0 0x07 0x14 c ; i2cset -y 0 0x07 0x0 c"}));
}

TEST_F(Leds, TurnOffIsTheColourOff)
{
    LedManager::turnOff(LedManager::LED_REMOTE);
    LedManager::turnOn(LedManager::LED_REMOTE, LedManager::COLOR_OFF);
    LedManager::stopFlashingSequence(LedManager::LED_REMOTE);
    EXPECT_EQ(journal(), Lines(3, "system:i2cset -y 0 0x07 0x12 c ; i2cset -y 0 0x07 0x0 c"));
}

TEST_F(Leds, TurnOffAllDarkensFourteenLedsInAscendingOrder)
{
    LedManager::turnOffAll();
    EXPECT_EQ(journal().size(), 14U);
    EXPECT_EQ(entries("system:"), allLeds("0x0"));
}

TEST_F(Leds, TurnOnAllLightsFourteenLedsInAscendingOrder)
{
    LedManager::turnOnAll(LedManager::COLOR_FAIL);
    EXPECT_EQ(journal().size(), 14U);
    EXPECT_EQ(entries("system:"), allLeds("0x8"));
}

TEST_F(Leds, FailedCommandIsLoggedAndTheNextOneRuns)
{
    for (const std::string& command : allLeds("0x0")) {
        script(command, {exits(127)});
    }
    LedManager::turnOffAll();
    EXPECT_EQ(journal(), failing(allLeds("0x0")));
}

using LedStatus = With<Leds>;
INSTANTIATE_TEST_SUITE_P(Statuses, LedStatus, testing::ValuesIn(failedStatuses), nameOf<Named<int>>);

TEST_P(LedStatus, IsAFailure)
{
    script(ledCommand(ledRemote, blue), {raw(value())});
    LedManager::turnOn(LedManager::LED_REMOTE, LedManager::COLOR_BLUE);
    EXPECT_EQ(journal(), failing({ledCommand(ledRemote, blue)}));
}

class Flashing : public Leds
{
protected:
    /// Lets the flashing thread make `cycles` cycles: the stop comes during the pause of the last one.
    static void flash(int cycles)
    {
        std::atomic<int> pauses{0};
        platform::scriptSleep([&pauses, cycles](const timespec*, timespec*) {
            if (pauses + 1 == cycles) {
                LedManager::instance()->stopFlashRemoteAndMainInBlue();
            }
            ++pauses;
            return 0;
        });
        LedManager::instance()->startFlashRemoteAndMainInBlue();
        platform::waitFor([&pauses, cycles] { return pauses == cycles; });
        LedManager::instance()->waitForFlashingEnd();
    }

    /// Starts it and stops it within its first pause, which lasts until `resumed`.
    static void stopWithinAPause(const std::atomic<bool>& resumed)
    {
        platform::scriptSleep([&resumed](const timespec*, timespec*) {
            platform::note("pause");
            platform::waitFor([&resumed] { return resumed.load(); });
            return 0;
        });
        LedManager::instance()->startFlashRemoteAndMainInBlue();
        platform::waitFor([] { return !entries("pause").empty(); });
        LedManager::instance()->stopFlashRemoteAndMainInBlue();
    }

    static Lines cycle(const char* lit, const char* unlit)
    {
        return joined({ran(allLeds(dark)), {ran(ledCommand(lit, blue)), ran(ledCommand(unlit, dark)), "sleep:1"}});
    }

    static Lines bothOff() { return {ran(ledCommand(ledMain, dark)), ran(ledCommand(ledRemote, dark))}; }
};

TEST_F(Flashing, RemoteIsLitFirstThenMainInTurn)
{
    flash(3);
    EXPECT_EQ(journal(),
              joined({cycle(ledRemote, ledMain), cycle(ledMain, ledRemote), cycle(ledRemote, ledMain), bothOff()}));
}

TEST_F(Flashing, StartsWithRemoteAgainAfterAStop)
{
    flash(1);
    platform::reset();
    flash(2);
    EXPECT_EQ(journal(), joined({cycle(ledRemote, ledMain), cycle(ledMain, ledRemote), bothOff()}));
}

TEST_F(Flashing, StartReplacesAThreadThatHasEnded)
{
    std::atomic<int> pauses{0};
    platform::scriptSleep([&pauses](const timespec*, timespec*) {
        LedManager::instance()->stopFlashRemoteAndMainInBlue();
        ++pauses;
        return 0;
    });
    for (const int round : {1, 2}) {
        LedManager::instance()->startFlashRemoteAndMainInBlue(); // the second joins the first's thread
        platform::waitFor([&pauses, round] { return pauses == round; });
    }
    LedManager::instance()->waitForFlashingEnd();
    EXPECT_EQ(journal(), joined({cycle(ledRemote, ledMain), bothOff(), cycle(ledRemote, ledMain), bothOff()}));
}

TEST_F(Flashing, ThreadThatIsStoppedBeforeItsFirstCheckOnlyTurnsBothOff)
{
    LedManager::flashingThreadFunction();
    EXPECT_EQ(journal(), bothOff());
}

TEST_F(Flashing, RunsOnAThreadOfItsOwn)
{
    flash(1);
    EXPECT_EQ(journal(std::this_thread::get_id()), Lines{});
}

TEST_F(Flashing, FailedCommandsDoNotEndIt)
{
    script(ledCommand(ledRemote, blue), {exits(1)});
    flash(2);
    const Lines log = entries("log:");
    EXPECT_EQ(log, Lines{"system returned false: " + ledCommand(ledRemote, blue)});
    EXPECT_EQ(entries("sleep:"), (Lines{"1", "1"}));
}

TEST_F(Flashing, SignalDoesNotShortenTheSecond)
{
    std::atomic<int> calls{0};
    platform::scriptSleep([&calls](const timespec*, timespec* remaining) {
        if (calls == 2) {
            LedManager::instance()->stopFlashRemoteAndMainInBlue();
            ++calls;
            return 0;
        }
        ++calls;
        *remaining = {0, calls * 1000L};
        errno = EINTR;
        return -1;
    });
    LedManager::instance()->startFlashRemoteAndMainInBlue();
    platform::waitFor([&calls] { return calls == 3; });
    LedManager::instance()->waitForFlashingEnd();
    EXPECT_EQ(entries("sleep:"), (Lines{"1", "0.1000", "0.2000"}));
}

TEST_F(Flashing, StopReturnsBeforeTheLastCycleHasEndedAndTheWaitAfterIt)
{
    std::atomic<bool> resumed{false};
    stopWithinAPause(resumed);
    platform::note("stopped");
    resumed = true;
    LedManager::instance()->waitForFlashingEnd();
    platform::note("ended");
    const Lines all = journal();
    EXPECT_EQ(Lines(all.end() - 4, all.end()), joined({{"stopped"}, bothOff(), {"ended"}}));
}

TEST_F(Flashing, TwoThreadsCanWaitForItsEnd)
{
    std::atomic<bool> resumed{false};
    stopWithinAPause(resumed);
    const auto wait = [] { LedManager::instance()->waitForFlashingEnd(); };
    std::thread first(wait);
    std::thread second(wait);
    platform::delay(50); // both wait
    resumed = true;
    first.join();
    second.join();
    const Lines all = journal();
    EXPECT_EQ(Lines(all.end() - 2, all.end()), bothOff());
}

TEST_F(Flashing, StopAndWaitWithoutAThreadReturnAtOnce)
{
    LedManager::instance()->stopFlashRemoteAndMainInBlue();
    LedManager::instance()->waitForFlashingEnd();
    LedManager::instance()->waitForFlashingEnd();
    EXPECT_EQ(journal(), Lines{});
}

/// In a child process, which blocked callers cannot outlive: starts again and checks that this does not return, and
/// that a stop then waits for it.
[[noreturn]] void startAgain(bool stopFirst)
{
    static std::atomic<bool> returned{false};
    const int before = resultsSoFar();
    const auto cycles = [] { return entries("sleep:").size(); };
    LedManager::instance()->startFlashRemoteAndMainInBlue();
    platform::waitFor([&cycles] { return cycles() >= 1; });
    if (stopFirst) {
        LedManager::instance()->stopFlashRemoteAndMainInBlue();
    }
    std::thread([] {
        LedManager::instance()->startFlashRemoteAndMainInBlue();
        returned = true;
    }).detach();
    platform::waitFor([&cycles] { return cycles() >= 5; });
    std::thread([] {
        LedManager::instance()->stopFlashRemoteAndMainInBlue();
        returned = true;
    }).detach();
    platform::waitFor([&cycles] { return cycles() >= 10; });
    EXPECT_FALSE(returned);
    endCase(before);
}

TEST_F(Flashing, StartingAgainWithoutAStopBlocksTheCaller)
{
    NEEDS_A_FRESH_PROCESS();
    EXPECT_EXIT(startAgain(false), testing::ExitedWithCode(0), "");
}

TEST_F(Flashing, StartingAgainWithinTheLastPauseRevivesTheOldThread)
{
    NEEDS_A_FRESH_PROCESS();
    EXPECT_EXIT(
        {
            static std::atomic<int> pauses{0};
            platform::scriptSleep([](const timespec*, timespec*) {
                platform::delay(++pauses == 1 ? 1000 : 10); // the first is long enough for a stop and a start
                return 0;
            });
            startAgain(true);
        },
        testing::ExitedWithCode(0), "");
}

class Sequences : public Leds
{
protected:
    const Lines passFor500ms = {
        "i2cset -y 0 0x07 0x13 c ; i2cset -y 0 0x07 0xc2 c", "i2cset -y 0 0x07 0x1f c ; i2cset -y 0 0x07 0x19 c",
        "i2cset -y 0 0x07 0x13 c ; i2cset -y 0 0x07 0xC0 c", "i2cset -y 0 0x07 0x1f c ; i2cset -y 0 0x07 0x19 c"};

    static std::string stepTimeOf(int duration)
    {
        platform::reset();
        LedManager::setFlashingSequence(LedManager::LED_PASS, LedManager::COLOR_PASS, duration);
        EXPECT_EQ(entries("system:").at(1), entries("system:").at(3));
        return entries("system:").at(1);
    }
};

TEST_F(Sequences, ResetStartAndStopSendTheirModes)
{
    LedManager::resetFlashingSequence(LedManager::LED_FIRST);
    LedManager::startFlashingSequence(LedManager::LED_FAIL);
    LedManager::stopFlashingSequence(LedManager::LED_LAST);
    EXPECT_EQ(journal(), (Lines{"system:i2cset -y 0 0x07 0x10 c ; i2cset -y 0 0x07 0x80 c",
                                "system:i2cset -y 0 0x07 0x14 c ; i2cset -y 0 0x07 0x40 c",
                                "system:i2cset -y 0 0x07 0x1d c ; i2cset -y 0 0x07 0x0 c"}));
}

TEST_F(Sequences, FailedModeIsLogged)
{
    for (const char* mode : {"0x80", "0x40", "0x0"}) {
        script(ledCommand("0x13", mode), {exits(1)});
    }
    LedManager::resetFlashingSequence(LedManager::LED_PASS);
    LedManager::startFlashingSequence(LedManager::LED_PASS);
    LedManager::stopFlashingSequence(LedManager::LED_PASS);
    EXPECT_EQ(journal(), failing({ledCommand("0x13", "0x80"), ledCommand("0x13", "0x40"), ledCommand("0x13", "0x0")}));
}

TEST_F(Sequences, SetAppendsTheColourThenDarkness)
{
    LedManager::setFlashingSequence(LedManager::LED_PASS, LedManager::COLOR_PASS, 500);
    EXPECT_EQ(journal().size(), 4U);
    EXPECT_EQ(entries("system:"), passFor500ms);
}

TEST_F(Sequences, StepTimeIsInUnitsOf20MillisecondsRoundedTowardsZero)
{
    EXPECT_EQ(stepTimeOf(0), ledCommand("0x1f", "0x00"));
    EXPECT_EQ(stepTimeOf(19), ledCommand("0x1f", "0x00"));
    EXPECT_EQ(stepTimeOf(39), ledCommand("0x1f", "0x01"));
    EXPECT_EQ(stepTimeOf(5119), ledCommand("0x1f", "0xff"));
}

TEST_F(Sequences, StepTimesOutOfRangeAreLeftToTheToolToRefuse)
{
    EXPECT_EQ(stepTimeOf(5120), ledCommand("0x1f", "0x100"));
    EXPECT_EQ(stepTimeOf(-19), ledCommand("0x1f", "0x00"));
    EXPECT_EQ(stepTimeOf(-20), ledCommand("0x1f", "0xffffffff"));
}

using FailedSequence = With<Sequences, std::size_t>;
INSTANTIATE_TEST_SUITE_P(Commands, FailedSequence,
                         testing::Values(Named<std::size_t>{"First", 0}, Named<std::size_t>{"Second", 1},
                                         Named<std::size_t>{"Third", 2}, Named<std::size_t>{"Fourth", 3}),
                         nameOf<Named<std::size_t>>);

TEST_P(FailedSequence, EndsThere)
{
    // The second and the fourth command are the same: fail the right one.
    const bool fourth = value() == 3;
    script(passFor500ms[value()],
           fourth ? std::vector<platform::Answer>{exits(0), exits(1)} : std::vector<platform::Answer>{exits(1)});
    LedManager::setFlashingSequence(LedManager::LED_PASS, LedManager::COLOR_PASS, 500);
    EXPECT_EQ(entries("system:"),
              Lines(passFor500ms.begin(), passFor500ms.begin() + static_cast<std::ptrdiff_t>(value()) + 1));
    EXPECT_EQ(entries("log:"), Lines{"system returned false: " + passFor500ms[value()]});
}

} // namespace
