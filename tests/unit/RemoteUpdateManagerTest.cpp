#include "RemoteUpdateManager.h"
#include "AppLock.h"
#include "LedManager.h"
#include "UnitTest.h"

#include <algorithm>
#include <atomic>
#include <iterator>

namespace
{

const char passSound[] = "system:aplay /root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav";
const char failSound[] = "system:aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav";

std::string led(const std::string& code, const std::string& color)
{
    return "system:i2cset -y 0 0x07 " + code + " c ; i2cset -y 0 0x07 " + color + " c";
}

Lines panelDark()
{
    Lines lines;
    for (const char* code : {"0x10", "0x11", "0x12", "0x13", "0x14", "0x15", "0x16", "0x17", "0x18", "0x19", "0x1a",
                             "0x1b", "0x1c", "0x1d"}) {
        lines.push_back(led(code, "0x0"));
    }
    return lines;
}

class Feedback : public UnitTest
{
protected:
    static Lines result(std::int32_t value)
    {
        platform::reset();
        RemoteUpdateManager::resultCallback(static_cast<UpdateManager::Result>(value));
        return journal();
    }

    static Lines error(std::int32_t value)
    {
        platform::reset();
        RemoteUpdateManager::errorCallback(static_cast<UpdateManager::Error>(value));
        return journal();
    }

    static Lines shown(const std::string& sound, const Lines& lit)
    {
        return joined({{"log:"}, panelDark(), {sound}, lit});
    }
};

TEST_F(Feedback, NothingToUpdateLightsBothHeadsInThePassColour)
{
    EXPECT_EQ(result(UpdateManager::RESULT_NO_UPDATE), shown(passSound, {led("0x12", "0x2"), led("0x15", "0x2")}));
    EXPECT_EQ(platform::records().at(0).function,
              "static void RemoteUpdateManager::resultCallback(UpdateManager::Result)");
}

TEST_F(Feedback, UpdatedLightsThePassLed)
{
    EXPECT_EQ(result(UpdateManager::RESULT_UPDATED), shown(passSound, {led("0x13", "0x2")}));
}

TEST_F(Feedback, OtherResultsPlayThePassSoundInTheDark)
{
    for (const std::int32_t value : {-1, 2, 7}) {
        EXPECT_EQ(result(value), shown(passSound, {}));
    }
}

TEST_F(Feedback, FailedCheckAndRefreshLightBothHeadsInTheFailColour)
{
    const Lines expected = shown(failSound, {led("0x12", "0x8"), led("0x15", "0x8")});
    EXPECT_EQ(error(UpdateManager::ERROR_CHECK_UPDATE), expected);
    EXPECT_EQ(error(UpdateManager::ERROR_UPDATE_MIRRORS), expected);
    EXPECT_EQ(platform::records().at(0).function,
              "static void RemoteUpdateManager::errorCallback(UpdateManager::Error)");
}

TEST_F(Feedback, FailedInstallationsLightTheFailLed)
{
    const Lines expected = shown(failSound, {led("0x14", "0x8")});
    EXPECT_EQ(error(UpdateManager::ERROR_INSTALL_PACKAGE), expected);
    EXPECT_EQ(error(UpdateManager::ERROR_INSTALL_QUORB), expected);
}

TEST_F(Feedback, OtherErrorsPlayTheFailSoundInTheDark)
{
    for (const std::int32_t value : {-1, static_cast<std::int32_t>(UpdateManager::ERROR_INSTALL_TEAMVIEWER), 5}) {
        EXPECT_EQ(error(value), shown(failSound, {}));
    }
}

TEST_F(Feedback, OfferedListIsIgnored)
{
    RemoteUpdateManager::updateFoundCallback({{UpdateManager::COMPONENT_QUORB, "QUORB", "1", "2"}});
    EXPECT_EQ(journal(), Lines{});
}

struct Outcome
{
    void (*report)();
    std::size_t leds; // that it lights
};

const Outcome outcomes[] = {
    {[] { RemoteUpdateManager::resultCallback(UpdateManager::RESULT_NO_UPDATE); }, 2},
    {[] { RemoteUpdateManager::resultCallback(UpdateManager::RESULT_UPDATED); }, 1},
    {[] { RemoteUpdateManager::errorCallback(UpdateManager::ERROR_UPDATE_MIRRORS); }, 2},
    {[] { RemoteUpdateManager::errorCallback(UpdateManager::ERROR_INSTALL_QUORB); }, 1},
};

TEST_F(Feedback, FlashingSendsNothingOnceTheOutcomeIsBeingShown)
{
    for (const Outcome& outcome : outcomes) {
        platform::reset();
        LedManager::instance()->startFlashRemoteAndMainInBlue();
        platform::waitFor([] { return entries("sleep:").size() >= 3; });
        outcome.report();
        const Lines own = journal(std::this_thread::get_id());
        ASSERT_EQ(own.size(), 1 + 14 + 1 + outcome.leds);
        Lines end = journal();
        end.erase(end.begin(), end.end() - static_cast<std::ptrdiff_t>(own.size()) + 1);
        EXPECT_EQ(end, Lines(own.begin() + 1, own.end())) << "another thread's command is among the outcome's";
    }
}

TEST_F(Feedback, IsLoggedBeforeTheFlashingHasEnded)
{
    for (const Outcome& outcome : outcomes) {
        platform::reset();
        platform::scriptSleep([](const timespec*, timespec*) {
            platform::note("pause");
            platform::waitFor([] { return !entries("log:").empty(); });
            return 0;
        });
        LedManager::instance()->startFlashRemoteAndMainInBlue();
        platform::waitFor([] { return !entries("pause").empty(); });
        outcome.report();
    }
}

TEST_F(Feedback, LedsAreLitOnlyAfterTheSoundHasEnded)
{
    script("aplay /root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav", {{0, "", true, [] {
                                                                     platform::delay(30);
                                                                     platform::note("sound ended");
                                                                 }}});
    RemoteUpdateManager::resultCallback(UpdateManager::RESULT_UPDATED);
    const Lines all = journal();
    EXPECT_EQ(Lines(all.end() - 3, all.end()), (Lines{passSound, "sound ended", led("0x13", "0x2")}));
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
    EXPECT_EQ(platform::records().at(0).function, "static void RemoteUpdateManager::lockApp()");
    EXPECT_EQ(platform::records().at(1).function, "static void RemoteUpdateManager::unlockApp()");
    EXPECT_EQ(platform::records().at(2).function, "static void RemoteUpdateManager::lockApp()");
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
        script("systemctl stop harl", {{0, "", true, untilItIsWaitedFor}});
    }

    /// Runs it. The journal is parted by threads: the caller's, the flashing thread's, and the update thread's.
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
    script(mirrorsCommand, {exits(100)});
    run();
    EXPECT_EQ(own, (Lines{"log:", "log:", "log:", "log:1"}));
    // The first and the last record of the update thread: it had ended when the caller went on.
    const std::vector<platform::Record> records = platform::records();
    EXPECT_EQ(std::count_if(records.begin(), records.end(),
                            [](const platform::Record& record) {
                                return record.function == "static void RemoteUpdateManager::processUpdate()";
                            }),
              2);
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
    EXPECT_EQ(platform::records().at(0).function, "void RemoteUpdateManager::update()");
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
    EXPECT_EQ(commands,
              (Lines{"systemctl stop harl", mirrorsCommand, policyCommand, installCommand, boardVersionCommand,
                     stickVersionCommand, uploadCommand, boardScriptCommand, "780", markerCommand,
                     "aplay /root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav", "30", "umount /root/USB_MOUNT/",
                     "systemctl start harl", "10", "systemctl stop harl-updater"}));
    EXPECT_EQ(flashing.front(), led("0x12", "0x1"));
}

TEST_F(WholeUpdate, OutcomeStaysOnThePanel)
{
    struct Row
    {
        const char* failing;
        int status;
        const char* sound;
        Lines lit;
    };
    const Row rows[] = {
        {"", 0, passSound, {led("0x13", "0x2")}},
        {mirrorsCommand, 1, failSound, {led("0x12", "0x8"), led("0x15", "0x8")}},
        {installCommand, 1, failSound, {led("0x14", "0x8")}},
        {uploadCommand, 1, failSound, {led("0x14", "0x8")}},
        {boardVersionCommand, 255, failSound, {led("0x12", "0x8"), led("0x15", "0x8")}},
    };
    for (const Row& row : rows) {
        SetUp();
        scriptPackage(policyCommand, "1.2.0", "1.3.0");
        scriptBoard("2.1.0", "2.2.0");
        script(row.failing, {exits(row.status)});
        run();
        const Lines all = journal();
        const auto sound = std::find(all.begin(), all.end(), row.sound);
        ASSERT_NE(sound, all.end()) << row.failing;
        Lines after;
        std::copy_if(sound, all.end(), std::back_inserter(after),
                     [](const std::string& line) { return line.find("i2cset") != std::string::npos; });
        EXPECT_EQ(after, row.lit) << row.failing;
    }
}

} // namespace
