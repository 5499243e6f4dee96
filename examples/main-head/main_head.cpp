/// A main head's program: checks, shows what has an update, lets the operator choose, installs that, reports the
/// outcome and gives the instrument back.
///
/// The log goes to standard output; the dialogue goes to standard error and reads standard input. docs/main-head.md
/// explains which call runs where.

#include "Log.h"
#include "UpdateManager.h"

#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <future>
#include <iostream>
#include <sstream>
#include <string>
#include <unistd.h>
#include <utility>
#include <vector>

namespace
{

using Components = std::vector<UpdateManager::UpdateComponent>;

// What the engine's worker threads hand to the main thread: the list that the check offers, empty when there is nothing
// to be done; then, the installation's end.
std::promise<Components> offered;
std::promise<void> installed;
bool isInstalling = false; // written between the two halves, when no other thread of the engine's runs

void reportEnd()
{
    if (isInstalling) {
        installed.set_value();
    } else {
        offered.set_value({});
    }
}

const char* describe(UpdateManager::Error error)
{
    switch (error) {
    case UpdateManager::ERROR_CHECK_UPDATE:
        return "The versions could not be read.";
    case UpdateManager::ERROR_UPDATE_MIRRORS:
        return "The package mirrors could not be reached.";
    case UpdateManager::ERROR_INSTALL_PACKAGE:
        return "The package could not be installed.";
    case UpdateManager::ERROR_INSTALL_QUORB:
        return "The Quorb board could not be updated.";
    case UpdateManager::ERROR_INSTALL_TEAMVIEWER:
        return "TeamViewer could not be installed.";
    }
    return "The update failed.";
}

// The callbacks, on the worker threads: they only hand over what they are given, and never call the engine.

void resultCallback(UpdateManager::Result result)
{
    LOG() << result;
    std::cerr << (result == UpdateManager::RESULT_UPDATED ? "Everything chosen is installed.\n"
                                                          : "There is nothing to update.\n");
    reportEnd();
}

void errorCallback(UpdateManager::Error error)
{
    LOG() << error;
    std::cerr << describe(error) << '\n';
    reportEnd();
}

void updateFoundCallback(Components components)
{
    for (const UpdateManager::UpdateComponent& component : components) {
        LOG() << component.kind << " " << component.name << " " << component.installedVersion << " -> "
              << component.candidateVersion;
    }
    offered.set_value(std::move(components));
}

/// The components that `answer` names: all, none, or their numbers in the list. False when it is none of these.
bool parseAnswer(const std::string& answer, const Components& components, Components& chosen)
{
    chosen.clear();
    if (answer == "all") {
        chosen = components;
        return true;
    }
    if (answer == "none") {
        return true;
    }
    std::vector<bool> isChosen(components.size(), false);
    std::istringstream words(answer);
    std::size_t number = 0;
    while (words >> number) {
        if (number < 1 || number > components.size()) {
            return false;
        }
        isChosen[number - 1] = true;
    }
    for (std::size_t i = 0; i < components.size(); ++i) { // in the list's order, which is the one to install in
        if (isChosen[i]) {
            chosen.push_back(components[i]);
        }
    }
    return words.eof() && !chosen.empty();
}

/// Shows the list and asks what to install, with the answer from `input`. Without an answer nothing is chosen.
Components choose(const Components& components, std::FILE* input)
{
    std::cerr << "These have an update:\n";
    for (std::size_t i = 0; i < components.size(); ++i) {
        std::cerr << "  " << i + 1 << "  " << components[i].name;
        if (components[i].kind != UpdateManager::COMPONENT_TEAMVIEWER) { // it has no versions to show
            std::cerr << "  " << components[i].installedVersion << " -> " << components[i].candidateVersion;
        }
        std::cerr << '\n';
    }
    Components chosen;
    char answer[100];
    do {
        std::cerr << "Install which? (numbers, all or none) ";
        if (std::fgets(answer, sizeof answer, input) == nullptr) {
            std::cerr << "\nNo answer: nothing is installed.\n";
            return {};
        }
    } while (!parseAnswer({answer, std::strcspn(answer, "\n")}, components, chosen));
    return chosen;
}

/// Takes standard input away from the engine's commands, which inherit it: ssh reads whatever it finds there. Null when
/// there is none.
std::FILE* takeInput()
{
    const int own = fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, STDERR_FILENO + 1);
    const int nothing = open("/dev/null", O_RDONLY | O_CLOEXEC);
    if (own == -1 || nothing == -1 || dup2(nothing, STDIN_FILENO) == -1) {
        return nullptr;
    }
    close(nothing);
    return fdopen(own, "r");
}

} // namespace

int main()
{
    std::FILE* input = takeInput();
    if (input == nullptr) {
        std::cerr << "main-head: standard input cannot be read: start it with </dev/null\n";
        return 1;
    }
    UpdateManager* manager = UpdateManager::instance();
    manager->setCallbacks(resultCallback, errorCallback, updateFoundCallback);
    manager->init(false);
    Components components = offered.get_future().get();
    if (!components.empty()) {
        components = choose(components, input);
    }
    if (!components.empty()) {
        isInstalling = true;
        manager->update(std::move(components), false);
        installed.get_future().wait(); // the closing step would not wait
    }
    std::cerr << "The instrument is given back.\n";
    manager->deinit(false);
    while (true) { // the closing step runs on a thread of its own and ends the service
        pause();
    }
}
