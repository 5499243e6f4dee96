#include "UpdateManager.h"

#include "Log.h"
#include "Sleep.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <sstream>
#include <utility>

// A missing callback must end the process in release builds too.
#undef NDEBUG
#include <cassert>

namespace
{

const char removeMarkerCommand[] = "rm /root/RESOURCES/tavren1stboot";

/// Removes everything up to and including the first `key` from `line`. False, and no change, without the key.
bool eraseThrough(std::string& line, const std::string& key)
{
    const std::string::size_type position = line.find(key);
    if (position == std::string::npos) {
        return false;
    }
    line.erase(0, position + key.size());
    return true;
}

/// Removes the first `end` and everything after it from `text`.
void cutAt(std::string& text, char end)
{
    text.resize(std::min(text.find(end), text.size()));
}

} // namespace

UpdateManager* UpdateManager::instance()
{
    static UpdateManager* mInstance = new UpdateManager;
    return mInstance;
}

// One update

void UpdateManager::setCallbacks(ResultCallback resultCallback, ErrorCallback errorCallback,
                                 UpdateFoundCallback updateFoundCallback)
{
    LOG();
    mResultCallback = resultCallback;
    mErrorCallback = errorCallback;
    mUpdateFoundCallback = updateFoundCallback;
}

bool UpdateManager::validateCallbacks()
{
    return mResultCallback != nullptr && mErrorCallback != nullptr && mUpdateFoundCallback != nullptr;
}

void UpdateManager::init(bool head)
{
    LOG();
    assert(validateCallbacks());
    if (head) {
        initRemoteHead();
        return;
    }
    mWorkerThread = new std::thread(initMainHead);
}

void UpdateManager::update(std::vector<UpdateComponent> components, bool head)
{
    LOG();
    assert(validateCallbacks());
    if (head) {
        updateRemoteHead();
        return;
    }
    if (mWorkerThread != nullptr && mWorkerThread->joinable()) {
        mWorkerThread->join();
    }
    delete mWorkerThread;
    mWorkerThread = nullptr; // should the next thread not start
    mWorkerThread = new std::thread(updateMainHead, std::move(components));
}

void UpdateManager::deinit(bool head)
{
    LOG();
    assert(validateCallbacks());
    if (head) {
        deinitRemoteHead();
        return;
    }
    // The worker of update(false) may still be installing: it is left to run, neither joined nor released.
    mWorkerThread = new std::thread(deinitMainHead);
}

// Remote-head procedure

void UpdateManager::initRemoteHead()
{
    stopHARL();
}

void UpdateManager::updateRemoteHead()
{
    static const std::string command = "apt-cache policy solvik4-rh";
    static const std::string updateCommand = "apt --assume-yes install solvik4-rh";
    std::string installed;
    std::string candidate;
    bool packageVersionsFound = false;
    bool boardVersionsFound = false;

    LOG();
    if (!updateMirrors()) {
        LOG() << "Update mirrors failed:";
        instance()->mErrorCallback(ERROR_UPDATE_MIRRORS);
        return;
    }

    const bool packageUpdate = checkUpdate(true, command, installed, candidate, packageVersionsFound);
    if (!packageVersionsFound) {
        LOG() << "Failed to checkUpdate";
        instance()->mErrorCallback(ERROR_CHECK_UPDATE);
        return;
    }
    if (packageUpdate && !installUpdate(updateCommand)) {
        LOG() << "update failed";
        instance()->mErrorCallback(ERROR_INSTALL_PACKAGE);
        return;
    }

    const bool boardUpdate = checkQuorbUpdate(installed, candidate, boardVersionsFound);
    if (boardUpdate && !installQuorbUpdate()) {
        LOG() << "update QUORB failed";
        instance()->mErrorCallback(ERROR_INSTALL_QUORB);
        return;
    }
    // With an up-to-date package a board that could not be checked is not reported.
    if (!packageUpdate && !boardUpdate) {
        instance()->mResultCallback(RESULT_NO_UPDATE);
        return;
    }
    if (!boardVersionsFound) {
        LOG() << "Failed to checkUpdate";
        instance()->mErrorCallback(ERROR_CHECK_UPDATE);
        return;
    }

    // A marker that is already gone counts as removed; only a status that cannot be had is told apart.
    if (std::system(removeMarkerCommand) >= 0) {
        LOG() << "removed" << removeMarkerCommand;
    }
    instance()->mResultCallback(RESULT_UPDATED);
}

void UpdateManager::deinitRemoteHead()
{
    LOG();
    LOG() << "Giving users 30 Secs to view Pass/Fail LED status before completing update";
    sleepSeconds(30);
    startHARL();
}

// Main-head procedure

void UpdateManager::initMainHead()
{
    static const std::string dhPackageCommand = "apt-cache policy solvik4-dh";
    std::string installed;
    std::string candidate;
    bool versionsFound = false;
    bool teamViewerKnown = false;
    std::vector<UpdateComponent> components;

    LOG();
    stopHARL();
    if (!updateMirrors()) {
        LOG() << "Update mirrors failed:";
        instance()->mErrorCallback(ERROR_UPDATE_MIRRORS);
        return;
    }

    if (checkUpdate(true, dhPackageCommand, installed, candidate, versionsFound)) {
        components.push_back({COMPONENT_PACKAGE, "Solvik IV", installed, candidate});
    }
    if (!versionsFound) {
        LOG() << "Failed to checkUpdate";
        instance()->mErrorCallback(ERROR_CHECK_UPDATE);
        return;
    }

    if (checkQuorbUpdate(installed, candidate, versionsFound)) {
        components.push_back({COMPONENT_QUORB, "QUORB", installed, candidate});
    }
    if (!versionsFound) {
        LOG() << "Failed to checkUpdate";
        instance()->mErrorCallback(ERROR_CHECK_UPDATE);
        return;
    }

    if (checkTVUpdate(teamViewerKnown)) {
        LOG() << "going to install TV";
        // TeamViewer has no versions to read: fixed texts.
        components.push_back({COMPONENT_TEAMVIEWER, "TV", "1", "2"});
    }
    if (!teamViewerKnown) {
        LOG() << "Failed to checkUpdate";
        instance()->mErrorCallback(ERROR_CHECK_UPDATE);
        return;
    }

    // On the main head the marker goes once the checks are through, whether or not anything is installed later.
    if (std::system(removeMarkerCommand) >= 0) {
        LOG() << "removed" << removeMarkerCommand;
    }
    if (components.empty()) {
        instance()->mResultCallback(RESULT_NO_UPDATE);
        return;
    }
    instance()->mUpdateFoundCallback(components);
}

void UpdateManager::updateMainHead(std::vector<UpdateComponent> components)
{
    static const std::string command = "apt --assume-yes install solvik4-dh";

    LOG();
    for (const UpdateComponent& component : components) {
        LOG() << "now call install MAIN udate" << component.kind;
        bool installed = true; // a component of an unknown kind is passed over
        Error error = ERROR_INSTALL_PACKAGE;
        switch (component.kind) {
        case COMPONENT_PACKAGE:
            LOG() << "now call install DH udate";
            installed = installUpdate(command);
            break;
        case COMPONENT_QUORB:
            LOG() << "now call install QUORB udate";
            installed = installQuorbUpdate();
            error = ERROR_INSTALL_QUORB;
            break;
        case COMPONENT_TEAMVIEWER:
            LOG() << "now call install TV udate";
            installed = installTVUpdate();
            error = ERROR_INSTALL_TEAMVIEWER;
            break;
        default:
            break;
        }
        if (!installed) {
            instance()->mErrorCallback(error);
            return;
        }
    }
    LOG() << "update maainhead finished";
    instance()->mResultCallback(RESULT_UPDATED);
}

void UpdateManager::deinitMainHead()
{
    startHARL();
}

// Checks and installations

bool UpdateManager::updateMirrors()
{
    static const std::string command = "apt update";
    std::string output;

    LOG();
    const std::int32_t code = runProcess(command, output);
    if (code == 0) {
        LOG() << "OK";
        return true;
    }
    // The package tools exit with 100 on any error of theirs, apt-get(8); here it stands for a missing connection.
    if (code == 100) {
        LOG() << "NO_INTERNET_ERROR_CODE";
        return false;
    }
    LOG() << "NOT OK " << code;
    return false;
}

bool UpdateManager::checkUpdate(bool ignoreNoInternet, const std::string& command, std::string& installed,
                                std::string& candidate, bool& versionsFound)
{
    std::string output;

    LOG() << command;
    versionsFound = false;
    installed.clear();
    candidate.clear();
    const std::int32_t code = runProcess(command, output);
    if (code == 100 && !ignoreNoInternet) {
        LOG() << "NO_INTERNET_ERROR_CODE";
        return false;
    }

    std::istringstream lines(output);
    std::string line;
    while (std::getline(lines, line)) {
        if (eraseThrough(line, "Installed: ")) {
            installed = line;
        } else if (eraseThrough(line, "Candidate: ")) {
            candidate = line;
        }
        LOG() << line;
    }

    LOG() << installed << "  " << candidate;
    if (installed.empty() || candidate.empty()) {
        LOG() << "NWM_UM_CHECK_UPDATE_FAILED";
        return false;
    }
    versionsFound = true;
    if (installed == candidate) {
        LOG() << "NWM_UM_NO_UPDATES " << installed << " == " << candidate;
        return false;
    }
    LOG() << "NWM_UM_UPDATE_FOUND: " << installed << " -> " << candidate;
    return true;
}

bool UpdateManager::installUpdate(const std::string& command)
{
    std::string output;

    LOG();
    const std::int32_t code = runProcess(command, output);
    if (code != 0) {
        LOG() << code << output;
        return false;
    }
    return true;
}

bool UpdateManager::checkQuorbUpdate(std::string& installed, std::string& candidate, bool& versionsFound)
{
    static const std::string command =
        R"(ssh  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes 192.168.9.2 " cat /root/App/AppExe/version.txt | grep 'Brimvale'")";
    static const std::string candidateCommand = "ls /root/USB_MOUNT/debs/QUORB/armhf/";
    const std::string::size_type prefixLength = 5; // of the version directory's name, in front of the version
    std::string output;

    versionsFound = false;
    installed.clear();
    candidate.clear();
    if (runProcess(command, output) != 0) {
        LOG() << "Failed to checkUpdate";
        return false;
    }
    std::istringstream lines(output);
    std::string line;
    while (std::getline(lines, line)) {
        if (eraseThrough(line, "Brimvale\t")) {
            installed = line;
        }
        LOG() << line;
    }
    cutAt(installed, '\r');

    if (runProcess(candidateCommand, output) != 0) {
        LOG() << "Failed to check candidate QUORB version";
        return false;
    }
    candidate = output;
    cutAt(candidate, '\n');
    candidate.erase(0, prefixLength);

    LOG() << installed << "  " << candidate;
    if (installed.empty() || candidate.empty()) {
        LOG() << "Failed to checkUpdate";
        return false;
    }
    versionsFound = true;
    if (installed != candidate) {
        LOG() << "Update found: " << installed << " -> " << candidate;
        return true;
    }
    LOG() << "QUORB up to date";
    return false;
}

bool UpdateManager::uploadQuorbFiles()
{
    static const std::string command =
        "scp  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes /root/USB_MOUNT/debs/QUORB/armhf/*/OSUpgrade.zip 192.168.9.2:/root/ && scp  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes /root/USB_MOUNT/debs/QUORB/armhf/*/unzipUpgrade.sh 192.168.9.2:/";
    const int attempts = 20;

    LOG() << command;
    for (int attempt = 0; attempt < attempts; ++attempt) {
        if (std::system(command.c_str()) == 0) {
            return true;
        }
        LOG() << "Uploading failed. Trying again. ";
    }
    LOG() << "Failed to upload QUORB with 20 tries. Closing";
    return false;
}

bool UpdateManager::installQuorbUpdate()
{
    static const std::string command =
        R"(ssh  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes 192.168.9.2 "/unzipUpgrade.sh")";

    LOG();
    if (!uploadQuorbFiles()) {
        LOG() << "Failed inside uploadQuorbFiles";
        return false;
    }

    LOG() << command;
    // The upload is what counts: a script that fails, or drops the connection, does not change the result.
    const int status = std::system(command.c_str());
    LOG() << "Install script ended with code: " << status;
    LOG() << "Starts sleeping for 13mins";
    sleepSeconds(780);
    LOG() << "Sleeping for 13mins ended up";
    return true;
}

bool UpdateManager::verifyQuorb()
{
    return true;
}

bool UpdateManager::checkTVUpdate(bool& ok)
{
    static const std::string command = "ls /root/USB_MOUNT/debs/installTV";
    static const std::string marker = "/root/USB_MOUNT/debs/installTV";
    std::string output;

    ok = true;
    const std::int32_t code = runProcess(command, output);
    if (code == 0) {
        LOG() << "Teamviewer path" << marker;
        cutAt(output, '\n');
        // ls prints a file's own path but a directory's contents: only a plain file requests the installation.
        if (output == marker) {
            LOG() << "Teamviewer install is required";
            return true;
        }
        LOG() << "No need to install Teamviewer";
        return false;
    }
    // ls(1) exits with 2 when it cannot access a path named on its command line.
    if (code == 2) {
        LOG() << "install Teamviewer flag doesnot exist";
        return false;
    }
    ok = false;
    LOG() << "Failed to check if TV install is needed";
    return false;
}

bool UpdateManager::installTVUpdate()
{
    static const std::string command = "/root/RESOURCES/teamviewer_updatescript.sh";

    LOG();
    LOG() << command;
    const int status = std::system(command.c_str());
    LOG() << "Install script ended with code: " << status;
    return true;
}

// Services

void UpdateManager::stopHARL()
{
    LOG();
    const int status = std::system("systemctl stop harl");
    LOG() << status;
}

void UpdateManager::startHARL()
{
    LOG();
    const int unmountStatus = std::system("umount /root/USB_MOUNT/");
    LOG() << unmountStatus;
    const int startStatus = std::system("systemctl start harl");
    LOG() << startStatus;
    sleepSeconds(10);
    stopUpdater();
}

void UpdateManager::stopUpdater()
{
    LOG();
    const int status = std::system("systemctl stop harl-updater");
    LOG() << status;
}

// Commands

std::int32_t UpdateManager::runProcess(const std::string& command, std::string& output)
{
    char buffer[1024];
    char streamBuffer[64 * 1024]; // as much as a pipe holds: fewer calls for long outputs

    output.clear();
    output.reserve(sizeof streamBuffer); // growing from the first short line takes more copies
    LOG() << "Running command: " << command;
    FILE* pipe = popen(command.c_str(), "r");
    if (pipe == nullptr) {
        return 0;
    }
    std::setvbuf(pipe, streamBuffer, _IOFBF, sizeof streamBuffer);
    flockfile(pipe); // once, not for each line
    while (fgets(buffer, sizeof buffer, pipe) != nullptr) {
        output.append(buffer);
    }
    funlockfile(pipe);
    // The wait status of a normal exit is the exit code times 256, wait(2).
    const std::int32_t code = pclose(pipe) / 256;
    LOG() << "Exit code:" << code;
    return code;
}
