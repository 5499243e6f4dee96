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
    // All entries, with their times and programs; --all keeps tabs as they are.
    std::vector<std::string> arguments = {"journalctl",
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
    return openProgram(arguments, "the journal of harl-updater", true);
}

std::string LogSource::openProgram(const std::vector<std::string>& arguments, const std::string& name, bool complains)
{
    mName = name;
    std::array<int, 2> ends = {-1, -1};
    if (pipe2(ends.data(), O_CLOEXEC) != 0) {
        return std::strerror(errno);
    }
    mDescriptor = Descriptor(ends[0]);
    const Descriptor writeEnd(ends[1]);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, writeEnd.number(), STDOUT_FILENO);
    if (!complains) {
        posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
    }
    std::vector<char*> words;
    words.reserve(arguments.size() + 1);
    for (const std::string& argument : arguments) {
        words.push_back(const_cast<char*>(argument.c_str())); // not changed, posix_spawn(3)
    }
    words.push_back(nullptr);
    const int error = posix_spawnp(&mProgram, words.front(), &actions, nullptr, words.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (error == 0) {
        return "";
    }
    mProgram = -1;
    return error == ENOENT ? arguments.front() + " is not on the search path. On a machine without it, give the log as "
                                                 "a file."
                           : arguments.front() + " cannot be run: " + std::strerror(error);
}

bool LogSource::isRegularFile() const
{
    struct stat status = {};
    return fstat(mDescriptor.number(), &status) == 0 && S_ISREG(status.st_mode);
}

int LogSource::close(bool allRead)
{
    mDescriptor = Descriptor();
    if (mProgram < 0) {
        return 0;
    }
    int status = 0;
    if (!allRead) {
        kill(mProgram, SIGTERM);
    }
    while (waitpid(mProgram, &status, 0) < 0 && errno == EINTR) {
    }
    mProgram = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 0;
}
