#include "log/source.h"

#include "findings.h"

#include <array>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <vector>

#include <fcntl.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>

std::string LogSource::openFile(const std::string& path)
{
    const bool standardInput = path == "-";
    mName = standardInput ? "standard input" : escaped(path);
    mDescriptor = Descriptor(standardInput ? dup(STDIN_FILENO) : open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!mDescriptor) {
        return std::strerror(errno);
    }
    struct stat status = {};
    if (fstat(mDescriptor.number(), &status) == 0 && S_ISDIR(status.st_mode)) {
        return "a folder; name a file in it";
    }
    return "";
}

std::string LogSource::openJournal(bool follow)
{
    mName = "the journal of harl-updater";
    std::array<int, 2> ends = {-1, -1};
    if (pipe2(ends.data(), O_CLOEXEC) != 0) {
        return std::strerror(errno);
    }
    mDescriptor = Descriptor(ends[0]);
    const Descriptor writeEnd(ends[1]);

    // All entries, with their times and programs; --all keeps tabs as they are.
    std::vector<const char*> arguments = {"journalctl",
                                          "--unit=harl-updater",
                                          "--unit=harl-updater-give-back",
                                          "--unit=harl-updater-verify",
                                          "--output=short-iso",
                                          "--all",
                                          "--quiet",
                                          "--no-pager"};
    if (follow) {
        arguments.insert(arguments.end(), {"--follow", "--no-tail"});
    }
    arguments.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, writeEnd.number(), STDOUT_FILENO);
    const int error = posix_spawnp(&mJournal, arguments.front(), &actions, nullptr,
                                   const_cast<char* const*>(arguments.data()), // not changed, posix_spawn(3)
                                   environ);
    posix_spawn_file_actions_destroy(&actions);
    if (error == 0) {
        return "";
    }
    mJournal = -1;
    return error == ENOENT ? "journalctl is not on the search path. On a machine without it, give the log as a file."
                           : "journalctl cannot be run: " + std::string(std::strerror(error));
}

bool LogSource::isRegularFile() const
{
    struct stat status = {};
    return fstat(mDescriptor.number(), &status) == 0 && S_ISREG(status.st_mode);
}

int LogSource::close(bool allRead)
{
    mDescriptor = Descriptor();
    if (mJournal < 0) {
        return 0;
    }
    int status = 0;
    if (!allRead) {
        kill(mJournal, SIGTERM);
    }
    while (waitpid(mJournal, &status, 0) < 0 && errno == EINTR) {
    }
    mJournal = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 0;
}
