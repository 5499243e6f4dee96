#include "command.h"

#include "descriptor.h"
#include "texts.h"

#include <algorithm>
#include <array>
#include <csignal>
#include <sstream>
#include <thread>

#include <fcntl.h>
#include <spawn.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>

namespace
{

const std::size_t mostKept = std::size_t{256} * 1024;          // bytes of an output
const std::size_t mostWritten = std::size_t{64} * 1024 * 1024; // bytes; a program that writes more gets an error
const std::chrono::milliseconds longestPause(10);              // between two looks at whether a program has ended
const std::chrono::milliseconds killLimit(2000);               // for a killed program to be gone
const std::array<int, 3> endings = {SIGHUP, SIGINT, SIGTERM};  // from outside

/// A file in memory for what a program writes, which so waits for nobody and cannot fill the memory. Its length is that
/// of mostWritten; what was written ends at its offset.
Descriptor makeOutput()
{
    Descriptor file(memfd_create("output", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    if (file && (ftruncate(file.number(), mostWritten) != 0 || fcntl(file.number(), F_ADD_SEALS, F_SEAL_GROW) != 0)) {
        file = Descriptor();
    }
    return file;
}

std::string contentOf(const Descriptor& output)
{
    const auto written = static_cast<std::size_t>(std::max<off_t>(lseek(output.number(), 0, SEEK_CUR), 0));
    std::string text(std::min(written, mostKept), '\0');
    text.resize(static_cast<std::size_t>(std::max<ssize_t>(pread(output.number(), text.data(), text.size(), 0), 0)));
    return text;
}

std::string searchPathOf(const std::vector<std::string>& environment)
{
    for (const std::string& variable : environment) {
        if (startsWith(variable, "PATH=")) {
            return variable.substr(5);
        }
    }
    return "";
}

/// Starts the program in a session of its own. Its process id, or -1.
pid_t spawn(const std::string& program, const std::vector<std::string>& arguments,
            const std::vector<std::string>& environment, int output, int errors)
{
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;
    posix_spawn_file_actions_init(&actions);
    posix_spawnattr_init(&attributes);
    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_adddup2(&actions, output, STDOUT_FILENO);
    posix_spawn_file_actions_adddup2(&actions, errors, STDERR_FILENO);
    sigset_t none;
    sigemptyset(&none);
    posix_spawnattr_setsigmask(&attributes, &none);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSID | POSIX_SPAWN_SETSIGMASK);
    pid_t child = -1;
    const int error = posix_spawn(&child, program.c_str(), &actions, &attributes, pointersTo(arguments).data(),
                                  pointersTo(environment).data());
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attributes);
    return error == 0 ? child : -1;
}

/// True once the child has ended; its status is still to be asked for.
bool hasEnded(pid_t child)
{
    siginfo_t info = {};
    return waitid(P_PID, static_cast<id_t>(child), &info, WEXITED | WNOHANG | WNOWAIT) == 0 && info.si_pid == child;
}

} // namespace

HeldSignals::HeldSignals() : mHeld(), mBefore()
{
    sigemptyset(&mHeld);
    for (const int number : endings) {
        struct sigaction action = {};
        if (sigaction(number, nullptr, &action) == 0 && action.sa_handler != SIG_IGN) { // as nohup(1) leaves one
            sigaddset(&mHeld, number);
        }
    }
    sigprocmask(SIG_BLOCK, &mHeld, &mBefore);
}

HeldSignals::~HeldSignals()
{
    sigprocmask(SIG_SETMASK, &mBefore, nullptr);
}

bool HeldSignals::any() const
{
    sigset_t pending;
    sigpending(&pending);
    return std::any_of(endings.begin(), endings.end(), [&](int number) {
        return sigismember(&mHeld, number) == 1 && sigismember(&pending, number) == 1;
    });
}

CommandResult runCommand(const std::vector<std::string>& arguments, const std::vector<std::string>& environment,
                         std::chrono::milliseconds limit, const std::function<bool(std::chrono::milliseconds)>& goesOn)
{
    using Clock = std::chrono::steady_clock;
    CommandResult result;
    const std::string program = findProgram(arguments.front(), searchPathOf(environment));
    const Descriptor output = makeOutput();
    const Descriptor errors = makeOutput();
    if (program.empty() || !output || !errors) {
        return result;
    }
    const HeldSignals signals;
    const Clock::time_point begin = Clock::now();
    const pid_t child = spawn(program, arguments, environment, output.number(), errors.number());
    if (child < 0) {
        return result;
    }
    result.started = true;
    // The program's own end counts, not that of its children. Not every kernel tells it to poll(2) (pidfd_open(2):
    // since Linux 5.3).
    for (std::chrono::milliseconds pause{1}; !hasEnded(child) && !result.timedOut;
         pause = std::min(2 * pause, longestPause)) {
        std::this_thread::sleep_for(pause);
        const auto time = std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - begin);
        result.timedOut = time >= limit || signals.any() || (goesOn && !goesOn(time));
    }
    if (result.timedOut) {
        kill(-child, SIGKILL);
        for (auto tries = killLimit / longestPause; tries > 0 && !hasEnded(child); --tries) {
            std::this_thread::sleep_for(longestPause);
        }
    }
    int status = 0;
    if (hasEnded(child)) { // else it waits for a file system or a device that does not answer
        waitpid(child, &status, 0);
    }
    result.output = contentOf(output);
    result.errors = contentOf(errors);
    result.exitCode = !result.timedOut && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    return result;
}

std::vector<char*> pointersTo(const std::vector<std::string>& texts)
{
    std::vector<char*> result;
    result.reserve(texts.size() + 1);
    for (const std::string& text : texts) {
        result.push_back(const_cast<char*>(text.c_str())); // exec(3) does not change them
    }
    result.push_back(nullptr);
    return result;
}

std::string findProgram(const std::string& name, const std::string& searchPath)
{
    const auto canRun = [](const std::string& path) {
        struct stat status = {};
        return stat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode) && access(path.c_str(), X_OK) == 0;
    };
    if (contains(name, "/")) {
        return canRun(name) ? name : "";
    }
    std::istringstream folders(searchPath);
    for (std::string path; std::getline(folders, path, ':');) {
        path.append("/").append(name);
        if (canRun(path)) {
            return path;
        }
    }
    return "";
}
