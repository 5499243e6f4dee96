#include "RemoteUpdateManager.h"

#include "LedManager.h"
#include "Log.h"
#include "SoundManager.h"

std::mutex RemoteUpdateManager::mAppLockMutex;
std::condition_variable RemoteUpdateManager::mAppLocker;

namespace
{

/// What comes before the LEDs of an outcome: the flashing ends, the panel goes dark, `sound` plays to its end.
void announceOutcome(SoundManager::Sound sound)
{
    LedManager::instance()->stopFlashRemoteAndMainInBlue();
    LedManager::instance()->waitForFlashingEnd(); // else its last cycle would darken the outcome
    LedManager::turnOffAll();
    SoundManager::play(sound);
}

} // namespace

void RemoteUpdateManager::update()
{
    LOG();
    mUpdateThread = std::make_unique<std::thread>(processUpdate);
    LedManager::instance()->startFlashRemoteAndMainInBlue();
    lockApp();
    LOG() << mUpdateThread->joinable();
    if (mUpdateThread->joinable()) {
        mUpdateThread->join();
    }
}

void RemoteUpdateManager::processUpdate()
{
    LOG();
    UpdateManager* manager = UpdateManager::instance();
    manager->setCallbacks(resultCallback, errorCallback, updateFoundCallback);
    manager->init(true);
    manager->update({}, true);
    manager->deinit(true);
    unlockApp();
    LOG();
}

// Application lock

void RemoteUpdateManager::lockApp()
{
    LOG();
    std::unique_lock<std::mutex> lock(mAppLockMutex);
    mAppLocker.wait(lock); // a wake-up without a notification is harmless: update() joins the thread anyway
    LOG();
}

void RemoteUpdateManager::unlockApp()
{
    LOG();
    const std::lock_guard<std::mutex> lock(mAppLockMutex);
    mAppLocker.notify_one();
}

// Feedback to the operator

void RemoteUpdateManager::resultCallback(UpdateManager::Result result)
{
    LOG();
    announceOutcome(SoundManager::SOUND_PASS);
    switch (result) {
    case UpdateManager::RESULT_NO_UPDATE:
        LedManager::turnOn(LedManager::LED_REMOTE, LedManager::COLOR_PASS);
        LedManager::turnOn(LedManager::LED_MAIN, LedManager::COLOR_PASS);
        break;
    case UpdateManager::RESULT_UPDATED:
        LedManager::turnOn(LedManager::LED_PASS, LedManager::COLOR_PASS);
        break;
    }
}

void RemoteUpdateManager::errorCallback(UpdateManager::Error error)
{
    LOG();
    announceOutcome(SoundManager::SOUND_FAIL);
    switch (error) {
    case UpdateManager::ERROR_CHECK_UPDATE:
    case UpdateManager::ERROR_UPDATE_MIRRORS:
        LedManager::turnOn(LedManager::LED_REMOTE, LedManager::COLOR_FAIL);
        LedManager::turnOn(LedManager::LED_MAIN, LedManager::COLOR_FAIL);
        break;
    case UpdateManager::ERROR_INSTALL_PACKAGE:
    case UpdateManager::ERROR_INSTALL_QUORB:
        LedManager::turnOn(LedManager::LED_FAIL, LedManager::COLOR_FAIL);
        break;
    case UpdateManager::ERROR_INSTALL_TEAMVIEWER: // only the main head, whose panel is not this one, reports it
        break;
    }
}

void RemoteUpdateManager::updateFoundCallback(std::vector<UpdateManager::UpdateComponent>)
{
}
