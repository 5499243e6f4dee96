/// A main head for the bench: checks, accepts whatever is offered, installs it, and gives the instrument back.
///
/// The offered list and the outcomes are records of the log. It ends as the updater does, with its service.

#include "Log.h"
#include "UpdateManager.h"

#include <future>
#include <unistd.h>
#include <utility>
#include <vector>

namespace
{

using Components = std::vector<UpdateManager::UpdateComponent>;

// What the check reported: the list to install, empty when there is nothing to be done. Then, the installation's end.
std::promise<Components> checked;
std::promise<void> installed;
bool isInstalling = false; // written between the two halves, when no other thread of the engine's runs

void reportEnd()
{
    if (isInstalling) {
        installed.set_value();
    } else {
        checked.set_value({});
    }
}

void resultCallback(UpdateManager::Result result)
{
    LOG() << result;
    reportEnd();
}

void errorCallback(UpdateManager::Error error)
{
    LOG() << error;
    reportEnd();
}

void updateFoundCallback(Components components)
{
    for (const UpdateManager::UpdateComponent& component : components) {
        LOG() << component.kind << " " << component.name << " " << component.installedVersion << " -> "
              << component.candidateVersion;
    }
    checked.set_value(std::move(components));
}

} // namespace

int main()
{
    UpdateManager* manager = UpdateManager::instance();
    manager->setCallbacks(resultCallback, errorCallback, updateFoundCallback);
    manager->init(false);
    Components components = checked.get_future().get();
    if (!components.empty()) {
        isInstalling = true;
        manager->update(std::move(components), false);
        installed.get_future().wait();
    }
    manager->deinit(false);
    while (true) { // the closing step runs on a thread of its own and ends the service
        pause();
    }
}
