/// The signature that each operation's records carry.

#include "AppLock.h"
#include "LedManager.h"
#include "RemoteUpdateManager.h"
#include "SoundManager.h"
#include "UnitTest.h"

namespace
{

/// An operation, a call of it that logs, and what its records carry.
struct Operation
{
    const char* name;
    void (*call)();
    const char* signature;
};

void PrintTo(const Operation& operation, std::ostream* stream)
{
    *stream << operation.name;
}

/// A whole update, which ends at once. It must not be over before the main thread waits for it.
void updateAtOnce()
{
    applicationLockWaited = false;
    script(stopHarlCommand, {{0, "", true, [] { platform::waitFor([] { return applicationLockWaited.load(); }); }}});
    script(mirrorsCommand, {exits(100)});
    RemoteUpdateManager().update();
}

std::string ignored;
bool found = false;
const auto led = LedManager::LED_PASS;

const Operation operations[] = {
    {"setCallbacks", [] { UpdateManager::instance()->setCallbacks(noteResult, noteError, noteUpdateFound); },
     "void UpdateManager::setCallbacks(UpdateManager::ResultCallback, UpdateManager::ErrorCallback, "
     "UpdateManager::UpdateFoundCallback)"},
    {"init", [] { UpdateManager::instance()->init(true); }, "void UpdateManager::init(bool)"},
    {"update", [] { UpdateManager::instance()->update({}, true); },
     "void UpdateManager::update(std::vector<UpdateManager::UpdateComponent>, bool)"},
    {"deinit", [] { UpdateManager::instance()->deinit(true); }, "void UpdateManager::deinit(bool)"},
    {"updateRemoteHead", UpdateManager::updateRemoteHead, "static void UpdateManager::updateRemoteHead()"},
    {"deinitRemoteHead", UpdateManager::deinitRemoteHead, "static void UpdateManager::deinitRemoteHead()"},
    {"initMainHead", UpdateManager::initMainHead, "static void UpdateManager::initMainHead()"},
    {"updateMainHead", [] { UpdateManager::updateMainHead({}); },
     "static void UpdateManager::updateMainHead(std::vector<UpdateManager::UpdateComponent>)"},
    {"updateMirrors", [] { UpdateManager::updateMirrors(); }, "static bool UpdateManager::updateMirrors()"},
    {"checkUpdate", [] { UpdateManager::checkUpdate(true, policyCommand, ignored, ignored, found); },
     "static bool UpdateManager::checkUpdate(bool, const string&, std::string&, std::string&, bool&)"},
    {"installUpdate", [] { UpdateManager::installUpdate(installCommand); },
     "static bool UpdateManager::installUpdate(const string&)"},
    {"checkQuorbUpdate", [] { UpdateManager::checkQuorbUpdate(ignored, ignored, found); },
     "static bool UpdateManager::checkQuorbUpdate(std::string&, std::string&, bool&)"},
    {"uploadQuorbFiles", [] { UpdateManager::uploadQuorbFiles(); }, "static bool UpdateManager::uploadQuorbFiles()"},
    {"installQuorbUpdate", [] { UpdateManager::installQuorbUpdate(); },
     "static bool UpdateManager::installQuorbUpdate()"},
    {"checkTVUpdate", [] { UpdateManager::checkTVUpdate(found); }, "static bool UpdateManager::checkTVUpdate(bool&)"},
    {"installTVUpdate", [] { UpdateManager::installTVUpdate(); }, "static bool UpdateManager::installTVUpdate()"},
    {"runProcess", [] { UpdateManager::runProcess("true", ignored); },
     "static int32_t UpdateManager::runProcess(const string&, std::string&)"},
    {"stopHARL", UpdateManager::stopHARL, "static void UpdateManager::stopHARL()"},
    {"startHARL", UpdateManager::startHARL, "static void UpdateManager::startHARL()"},
    {"stopUpdater", UpdateManager::stopUpdater, "static void UpdateManager::stopUpdater()"},
    {"remoteUpdate", updateAtOnce, "void RemoteUpdateManager::update()"},
    {"processUpdate", updateAtOnce, "static void RemoteUpdateManager::processUpdate()"},
    {"lockApp", updateAtOnce, "static void RemoteUpdateManager::lockApp()"},
    {"unlockApp", RemoteUpdateManager::unlockApp, "static void RemoteUpdateManager::unlockApp()"},
    {"resultCallback", [] { RemoteUpdateManager::resultCallback(UpdateManager::RESULT_UPDATED); },
     "static void RemoteUpdateManager::resultCallback(UpdateManager::Result)"},
    {"errorCallback", [] { RemoteUpdateManager::errorCallback(UpdateManager::ERROR_CHECK_UPDATE); },
     "static void RemoteUpdateManager::errorCallback(UpdateManager::Error)"},
    {"turnOn", [] { LedManager::turnOn(led, LedManager::COLOR_PASS); },
     "static void LedManager::turnOn(LedManager::Led, LedManager::Color)"},
    {"setFlashingSequence", [] { LedManager::setFlashingSequence(led, LedManager::COLOR_PASS, 500); },
     "static void LedManager::setFlashingSequence(LedManager::Led, LedManager::Color, int)"},
    {"resetFlashingSequence", [] { LedManager::resetFlashingSequence(led); },
     "static void LedManager::resetFlashingSequence(LedManager::Led)"},
    {"startFlashingSequence", [] { LedManager::startFlashingSequence(led); },
     "static void LedManager::startFlashingSequence(LedManager::Led)"},
    {"stopFlashingSequence", [] { LedManager::stopFlashingSequence(led); },
     "static void LedManager::stopFlashingSequence(LedManager::Led)"},
    {"play", [] { SoundManager::play(static_cast<SoundManager::Sound>(7)); },
     "static void SoundManager::play(SoundManager::Sound)"},
};

class Signature : public UnitTest, public testing::WithParamInterface<Operation>
{
protected:
    void SetUp() override
    {
        registerCallbacks();
        // The panel's commands fail, which is what its operations log.
        for (const char* second : {"0x2", "0xc2", "0x80", "0x40", "0x0"}) {
            script(ledCommand(ledPass, second), {exits(1)});
        }
    }
};
INSTANTIATE_TEST_SUITE_P(Of, Signature, testing::ValuesIn(operations), nameOf<Operation>);

TEST_P(Signature, IsInItsRecords)
{
    GetParam().call();
    std::vector<std::string> signatures;
    for (const platform::Record& record : platform::records()) {
        signatures.push_back(record.function);
    }
    EXPECT_THAT(signatures, testing::Contains(GetParam().signature));
}

} // namespace
