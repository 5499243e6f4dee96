#include "RemoteUpdateManager.h"
#include "AppLock.h"
#include "LedManager.h"
#include "UnitTest.h"

#include <algorithm>
#include <atomic>
#include <iterator>

namespace
{

/// What each value lights, after its sound.
struct Outcome
{
    const char* name;
    void (*report)();
    const char* sound;
    Lines lit;
};

template <UpdateManager::Result value>
void reportResult()
{
    RemoteUpdateManager::resultCallback(value);
}

template <UpdateManager::Error value>
void reportError()
{
    RemoteUpdateManager::errorCallback(value);
}

const Lines bothPass = {ledCommand(ledRemote, passColor), ledCommand(ledMain, passColor)};
const Lines bothFail = {ledCommand(ledRemote, failColor), ledCommand(ledMain, failColor)};
const Lines pass = {ledCommand(ledPass, passColor)};
const Lines fail = {ledCommand(ledFail, failColor)};

const Outcome outcomes[] = {
    {"NothingToUpdate", reportResult<UpdateManager::RESULT_NO_UPDATE>, passSoundCommand, bothPass},
    {"Updated", reportResult<UpdateManager::RESULT_UPDATED>, passSoundCommand, pass},
    {"UnknownResult", reportResult<static_cast<UpdateManager::Result>(2)>, passSoundCommand, {}},
    {"NegativeResult", reportResult<static_cast<UpdateManager::Result>(-1)>, passSoundCommand, {}},
    {"FailedCheck", reportError<UpdateManager::ERROR_CHECK_UPDATE>, failSoundCommand, bothFail},
    {"FailedRefresh", reportError<UpdateManager::ERROR_UPDATE_MIRRORS>, failSoundCommand, bothFail},
    {"FailedPackage", reportError<UpdateManager::ERROR_INSTALL_PACKAGE>, failSoundCommand, fail},
    {"FailedBoard", reportError<UpdateManager::ERROR_INSTALL_QUORB>, failSoundCommand, fail},
    {"FailedTeamViewer", reportError<UpdateManager::ERROR_INSTALL_TEAMVIEWER>, failSoundCommand, {}},
    {"UnknownError", reportError<static_cast<UpdateManager::Error>(5)>, failSoundCommand, {}},
    {"NegativeError", reportError<static_cast<UpdateManager::Error>(-1)>, failSoundCommand, {}},
};

void PrintTo(const Outcome& outcome, std::ostream* stream)
{
    *stream << outcome.name;
}

class Feedback : public UnitTest, public testing::WithParamInterface<Outcome>
{
};
INSTANTIATE_TEST_SUITE_P(Outcomes, Feedback, testing::ValuesIn(outcomes), nameOf<Outcome>);

TEST_P(Feedback, DarkensThePanelPlaysItsSoundAndLightsItsLeds)
{
    GetParam().report();
    EXPECT_EQ(journal(), joined({{"log:"}, ran(allLeds(dark)), {ran(GetParam().sound)}, ran(GetParam().lit)}));
}

TEST_P(Feedback, FlashingSendsNothingOnceTheOutcomeIsBeingShown)
{
    LedManager::instance()->startFlashRemoteAndMainInBlue();
    platform::waitFor([] { return entries("sleep:").size() >= 3; });
    GetParam().report();
    const Lines own = journal(std::this_thread::get_id());
    ASSERT_EQ(own.size(), 1 + 14 + 1 + GetParam().lit.size());
    Lines end = journal();
    end.erase(end.begin(), end.end() - static_cast<std::ptrdiff_t>(own.size()) + 1);
    EXPECT_EQ(end, Lines(own.begin() + 1, own.end())) << "another thread's command is among the outcome's";
}

TEST_P(Feedback, IsLoggedBeforeTheFlashingHasEnded)
{
    platform::scriptSleep([](const timespec*, timespec*) {
        platform::note("pause");
        platform::waitFor([] { return !entries("log:").empty(); });
        return 0;
    });
    LedManager::instance()->startFlashRemoteAndMainInBlue();
    platform::waitFor([] { return !entries("pause").empty(); });
    GetParam().report();
}

class OtherFeedback : public UnitTest
{
};

TEST_F(OtherFeedback, OfferedListIsIgnored)
{
    RemoteUpdateManager::updateFoundCallback({{UpdateManager::COMPONENT_QUORB, "QUORB", "1", "2"}});
    EXPECT_EQ(journal(), Lines{});
}

TEST_F(OtherFeedback, LedsAreLitOnlyAfterTheSoundHasEnded)
{
    script(passSoundCommand, {{0, "", true, [] {
                                   platform::delay(30);
                                   platform::note("sound ended");
                               }}});
    RemoteUpdateManager::resultCallback(UpdateManager::RESULT_UPDATED);
    const Lines all = journal();
    EXPECT_EQ(Lines(all.end() - 3, all.end()), joined({{ran(passSoundCommand), "sound ended"}, ran(pass)}));
}

class ApplicationLock : public UnitTest
{
protected:
    void SetUp() override
    {
        UnitTest::SetUp();
        applicationLockWaited = false;
    }

    static void untilItIsWaitedFor()
    {
        platform::waitFor([] { return applicationLockWaited.load(); });
    }
};

TEST_F(ApplicationLock, UnlockWakesTheThreadThatIsLocked)
{
    std::atomic<bool> woken{false};
    std::thread waiting([&woken] {
        RemoteUpdateManager::lockApp();
        woken = true;
    });
    untilItIsWaitedFor();
    EXPECT_FALSE(woken);
    EXPECT_EQ(journal(), Lines{"log:"});
    RemoteUpdateManager::unlockApp();
    waiting.join();
    EXPECT_EQ(journal(), (Lines{"log:", "log:", "log:"}));
}

TEST_F(ApplicationLock, IsTakenOnlyAfterItsFirstRecord)
{
    static std::atomic<bool> first{true};
    static std::atomic<bool> unlocked{false};
    platform::afterRecord([] {
        if (first.exchange(false)) {
            std::thread([] {
                RemoteUpdateManager::unlockApp();
                unlocked = true;
            }).detach();
            platform::waitFor([] { return unlocked.load(); });
        }
    });
    std::thread waiting(RemoteUpdateManager::lockApp);
    untilItIsWaitedFor();
    RemoteUpdateManager::unlockApp();
    waiting.join();
}

TEST_F(ApplicationLock, UnlockWithoutAWaiterIsForgotten)
{
    RemoteUpdateManager::unlockApp();
    std::atomic<bool> woken{false};
    std::thread waiting([&woken] {
        RemoteUpdateManager::lockApp();
        woken = true;
    });
    untilItIsWaitedFor();
    EXPECT_FALSE(woken);
    RemoteUpdateManager::unlockApp();
    waiting.join();
}

TEST_F(ApplicationLock, UnlockWaitsUntilTheWokenThreadHasLeftTheLock)
{
    std::atomic<bool> leave{false};
    std::thread waiting(RemoteUpdateManager::lockApp);
    const std::thread::id waiter = waiting.get_id();
    untilItIsWaitedFor();
    platform::afterRecord([waiter, &leave] {
        if (std::this_thread::get_id() == waiter) { // its second record, written under the lock
            platform::note("woken");
            platform::waitFor([&leave] { return leave.load(); });
        }
    });
    RemoteUpdateManager::unlockApp();
    platform::waitFor([] { return journal().back() == "woken"; });

    std::atomic<bool> unlocked{false};
    std::thread second([&unlocked] {
        RemoteUpdateManager::unlockApp();
        unlocked = true;
    });
    platform::waitFor([] { return journal().back() == "log:"; });
    platform::delay(50);
    EXPECT_FALSE(unlocked);
    leave = true;
    waiting.join();
    second.join();
}

/// A whole update of the remote head. The application takes a moment to stop, as a real one does: the update must not
/// be over before the main thread waits for it.
class WholeUpdate : public ApplicationLock
{
protected:
    void SetUp() override
    {
        ApplicationLock::SetUp();
        script(stopHarlCommand, {{0, "", true, untilItIsWaitedFor}});
    }

    /// Runs it. The journal is divided by thread: the caller's, the flashing thread's, and the update thread's.
    void run()
    {
        RemoteUpdateManager().update();
        const Lines all = journal();
        own = journal(std::this_thread::get_id());
        for (const std::string& line : all) {
            const bool led = line.find("i2cset") != std::string::npos;
            if (line == "sleep:1" || (led && line.find("0x1 c") != std::string::npos)) {
                flashing.push_back(line);
            }
        }
        updateThread = journalOf("static void RemoteUpdateManager::processUpdate()");
    }

    static Lines messagesOf(const std::string& thread)
    {
        Lines messages;
        for (const platform::Record& record : platform::records()) {
            if (record.thread == thread) {
                messages.push_back(record.message);
            }
        }
        return messages;
    }

    static Lines journalOf(const std::string& function)
    {
        for (const platform::Record& record : platform::records()) {
            if (record.function == function) {
                return messagesOf(record.thread);
            }
        }
        return {};
    }

    Lines own;
    Lines flashing;
    Lines updateThread;
};

const Lines opening = {"", "", "", "", "0"}; // thread, callbacks, init, stopHARL and its status
const Lines closing = {"", "",  "Giving users 30 Secs to view Pass/Fail LED status before completing update",
                       "", "0", "0",
                       "", "0", // stopUpdater and its status
                       "", ""}; // unlock, end of the thread

Lines messages(const Lines& lines)
{
    Lines result;
    for (const std::string& line : lines) {
        if (line.compare(0, 4, "log:") == 0) {
            result.push_back(line.substr(4));
        }
    }
    return result;
}

TEST_F(WholeUpdate, CallerWaitsForTheUpdateThreadAndJoinsIt)
{
    const std::thread::id caller = std::this_thread::get_id();
    platform::afterRecord([caller] {
        const std::vector<platform::Record> records = platform::records();
        const auto ofTheThread = std::count_if(records.begin(), records.end(), [](const platform::Record& record) {
            return record.function == "static void RemoteUpdateManager::processUpdate()";
        });
        if (std::this_thread::get_id() != caller && ofTheThread == 2) { // its first and its last record
            platform::delay(50); // without the join the caller would continue first
            platform::note("end of the update thread");
        }
    });
    script(mirrorsCommand, {exits(100)});
    run();
    EXPECT_EQ(own, (Lines{"log:", "log:", "log:", "log:1"}));
    EXPECT_EQ(entries("end of the update thread"), Lines{""});
}

TEST_F(WholeUpdate, IsLoggedBeforeAnyThreadStarts)
{
    const std::thread::id caller = std::this_thread::get_id();
    platform::afterRecord([caller] {
        if (std::this_thread::get_id() == caller && journal(caller).size() == 1) {
            platform::delay(50); // another thread would have its say
            EXPECT_EQ(journal(), Lines{"log:"});
        }
    });
    script(mirrorsCommand, {exits(100)});
    run();
}

TEST_F(WholeUpdate, RunsOpeningUpdateAndClosingInOrder)
{
    scriptPackage(policyCommand, "1.2.0", "1.3.0");
    scriptBoard("2.1.0", "2.2.0");
    run();
    EXPECT_EQ(updateThread, joined({opening,
                                    {"", ""}, // update, updateRemoteHead
                                    messages(mirrorsOk()),
                                    messages(packageChecked(policyCommand, "1.2.0", "1.3.0")),
                                    messages(packageInstalled(installCommand)),
                                    messages(boardChecked("2.1.0", "2.2.0")),
                                    messages(boardInstalled()),
                                    {"removedrm /root/RESOURCES/tavren1stboot", ""}, // the result callback
                                    closing}));
    Lines commands;
    for (const std::string& line : journal()) {
        const std::string command = line.substr(line.find(':') + 1);
        if (line.compare(0, 4, "log:") != 0 && line != "sleep:1" && line.find("i2cset") == std::string::npos) {
            commands.push_back(command);
        }
    }
    EXPECT_EQ(commands, (Lines{stopHarlCommand, mirrorsCommand, policyCommand, installCommand, boardVersionCommand,
                               stickVersionCommand, uploadCommand, boardScriptCommand, "780", markerCommand,
                               passSoundCommand, "30", unmountCommand, startHarlCommand, "10", stopUpdaterCommand}));
    EXPECT_EQ(flashing.front(), ran(ledCommand(ledRemote, blue)));
}

/// A command that fails, or none, and what the panel must show at the end.
struct Failure
{
    const char* name;
    const char* command;
    int code;
    const char* sound;
    Lines lit;
};

void PrintTo(const Failure& failure, std::ostream* stream)
{
    *stream << failure.name;
}

class OutcomeOfAWholeUpdate : public WholeUpdate, public testing::WithParamInterface<Failure>
{
};
INSTANTIATE_TEST_SUITE_P(Failures, OutcomeOfAWholeUpdate,
                         testing::Values(Failure{"None", "", 0, passSoundCommand, pass},
                                         Failure{"Refresh", mirrorsCommand, 1, failSoundCommand, bothFail},
                                         Failure{"Package", installCommand, 1, failSoundCommand, fail},
                                         Failure{"Board", uploadCommand, 1, failSoundCommand, fail},
                                         Failure{"BoardCheck", boardVersionCommand, 255, failSoundCommand, bothFail}),
                         nameOf<Failure>);

TEST_P(OutcomeOfAWholeUpdate, StaysOnThePanel)
{
    scriptPackage(policyCommand, "1.2.0", "1.3.0");
    scriptBoard("2.1.0", "2.2.0");
    script(GetParam().command, {exits(GetParam().code)});
    run();
    const Lines commands = entries("system:");
    const auto sound = std::find(commands.begin(), commands.end(), GetParam().sound);
    ASSERT_NE(sound, commands.end());
    Lines after;
    std::copy_if(sound, commands.end(), std::back_inserter(after),
                 [](const std::string& command) { return command.compare(0, 7, "i2cset ") == 0; });
    EXPECT_EQ(after, GetParam().lit);
}

} // namespace
