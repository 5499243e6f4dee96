#include "log/source.h"

#include "command.h"
#include "texts.h"

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
    const int error =
        posix_spawnp(&mProgram, arguments.front().c_str(), &actions, nullptr, pointersTo(arguments).data(), environ);
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

ssize_t LogSource::read(std::vector<char>& block) const
{
    return TEMP_FAILURE_RETRY(::read(mDescriptor.number(), block.data(), block.size()));
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
    TEMP_FAILURE_RETRY(waitpid(mProgram, &status, 0));
    mProgram = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 0;
}
