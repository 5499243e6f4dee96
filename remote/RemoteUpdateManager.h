#pragma once

#include "UpdateManager.h"

#include <condition_variable>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

/// Runs one update of the remote head and shows the operator its outcome.
///
/// The update runs on a thread of its own while the caller of update() waits for it on the application lock.
class RemoteUpdateManager
{
public:
    RemoteUpdateManager() = default;

    /// Runs one update; returns when the update thread has ended.
    void update();

    /// Body of the update thread.
    static void processUpdate();

    /// @name Application lock
    /// A bare wait and notify without a state: a notification that comes before the wait is lost.
    /// @{

    /// Blocks the caller until unlockApp() notifies, or until a spurious wake-up.
    static void lockApp();

    /// Wakes the thread that is blocked in lockApp().
    static void unlockApp();

    /// @}
    /// @name Feedback to the operator
    /// Ends the flashing and darkens the panel, plays a sound to its end, then lights the outcome.
    /// @{

    /// Pass sound; LED_PASS after an update, LED_REMOTE and LED_MAIN when there was none, no LED for other values.
    static void resultCallback(UpdateManager::Result result);

    /// Fail sound; LED_REMOTE and LED_MAIN for a failed check or refresh, LED_FAIL for a failed package or board
    /// installation, no LED for other values.
    static void errorCallback(UpdateManager::Error error);

    /// Does nothing: the remote head never offers a list.
    static void updateFoundCallback(std::vector<UpdateManager::UpdateComponent> components);

    /// @}

private:
    std::unique_ptr<std::thread> mUpdateThread;

    static std::mutex mAppLockMutex;
    static std::condition_variable mAppLocker;
};
