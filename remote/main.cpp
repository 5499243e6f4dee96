#include "LedManager.h"
#include "Log.h"
#include "RemoteUpdateManager.h"

/// Runs one update of the remote head. Arguments are ignored; the status is 0 whatever the outcome.
int main(int, char**)
{
    LOG() << "TavrenUpdater version: 1.0.0";
    LedManager::instance();
    LedManager::turnOffAll();
    LOG() << "BEFORE UPDATE";
    RemoteUpdateManager remoteUpdateManager;
    remoteUpdateManager.update();
    LOG() << "AFTER UPDATE";
    return 0;
}
