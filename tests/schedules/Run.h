#pragma once

#include <string>

/// The result of one exploration.
struct Found
{
    long schedules = 0;
    long late = 0;       ///< those in which the stop came before the flashing was started
    long lost = 0;       ///< those in which the notification came before the wait
    long hangs = 0;      ///< those in which main() did not return
    long stuck = 0;      ///< those of them in which the notification did not come before the wait
    std::string finding; ///< what does not hold in the last schedule; empty when everything held in all
};

enum class Ending { NothingToUpdate, Updated, ReadFailure, InstallFailure };

/// Explores the program's whole run, up to its first finding. In each schedule the update's thread must start before
/// the flashing, and notify under the lock.
///
/// The update begins with commands that take far longer than the main thread needs from there to its wait. The
/// schedules in which the update outruns it nevertheless are known: the flashing is started `late` and continues, where
/// the update waits for it for ever when it is started between the stop and that wait; or the notification is `lost`.
/// Only then does main() not return. In all others the panel's last state must be the outcome, and no other thread may
/// send a byte once the update's thread has begun to show it.
Found exploreUpdate(Ending ending);

/// Explores two rounds of flashing: started, stopped, waited for. `late` counts the rounds whose thread was stopped
/// before its first check.
Found exploreFlashing();
