#include "command.h"

#include "descriptor.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <sstream>

#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>

namespace
{

const std::size_t mostOutput = std::size_t{256} * 1024;       // bytes
const int pollTime = 10;                                      // ms between two looks at whether a program has ended
const std::array<int, 3> endings = {SIGHUP, SIGINT, SIGTERM}; // from outside

struct Pipe
{
    Descriptor readEnd;
    Descriptor writeEnd;
};

Pipe makePipe()
{
    std::array<int, 2> ends = {-1, -1};
    if (pipe2(ends.data(), O_CLOEXEC) != 0) {
        return Pipe();
    }
    fcntl(ends[0], F_SETFL, O_NONBLOCK);
    return {Descriptor(ends[0]), Descriptor(ends[1])};
}

std::vector<char*> pointers(const std::vector<std::string>& texts)
{
    std::vector<char*> result;
    result.reserve(texts.size() + 1);
    for (const std::string& text : texts) {
        result.push_back(const_cast<char*>(text.c_str())); // posix_spawn(3) does not change them
    }
    result.push_back(nullptr);
    return result;
}

std::string searchPathOf(const std::vector<std::string>& environment)
{
    for (const std::string& variable : environment) {
        if (variable.rfind("PATH=", 0) == 0) {
            return variable.substr(5);
        }
    }
    return "";
}

/// Appends what `descriptor` has to give by now. False at its end.
bool drain(int descriptor, std::string& text)
{
    std::array<char, 8192> buffer{};
    for (;;) {
        const ssize_t count = read(descriptor, buffer.data(), buffer.size());
        if (count < 0 && errno == EINTR) {
            continue;
        }
        if (count <= 0) {
            return count < 0 && errno == EAGAIN;
        }
        text.append(buffer.data(), std::min(static_cast<std::size_t>(count), mostOutput - text.size()));
    }
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
    const int error = posix_spawn(&child, program.c_str(), &actions, &attributes, pointers(arguments).data(),
                                  pointers(environment).data());
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
                         std::chrono::milliseconds limit)
{
    CommandResult result;
    const std::string program = findProgram(arguments.front(), searchPathOf(environment));
    Pipe output = makePipe();
    Pipe errors = makePipe();
    if (program.empty() || !output.readEnd || !errors.readEnd) {
        return result;
    }
    const HeldSignals signals;
    const auto deadline = std::chrono::steady_clock::now() + limit;
    const pid_t child = spawn(program, arguments, environment, output.writeEnd.number(), errors.writeEnd.number());
    if (child < 0) {
        return result;
    }
    result.started = true;
    output.writeEnd = Descriptor();
    errors.writeEnd = Descriptor();

    // A background child of the program may keep the pipes open: the program's own end is what counts. It is looked
    // for now and then, as not every kernel tells it to poll(2) (pidfd_open(2): since Linux 5.3).
    std::array<pollfd, 2> watched = {{{output.readEnd.number(), POLLIN, 0}, {errors.readEnd.number(), POLLIN, 0}}};
    while (!hasEnded(child)) {
        if (std::chrono::steady_clock::now() >= deadline || signals.any()) {
            result.timedOut = true;
            break;
        }
        const bool silent = watched[0].fd < 0 && watched[1].fd < 0; // about to end
        poll(watched.data(), watched.size(), silent ? 1 : pollTime);
        if (watched[0].revents != 0 && !drain(watched[0].fd, result.output)) {
            watched[0].fd = -1;
        }
        if (watched[1].revents != 0 && !drain(watched[1].fd, result.errors)) {
            watched[1].fd = -1;
        }
    }
    if (result.timedOut) {
        kill(-child, SIGKILL);
    }
    int status = 0;
    while (waitpid(child, &status, 0) == -1 && errno == EINTR) {
    }
    drain(output.readEnd.number(), result.output);
    drain(errors.readEnd.number(), result.errors);
    if (!result.timedOut && WIFEXITED(status)) {
        result.exitCode = WEXITSTATUS(status);
    }
    return result;
}

std::string findProgram(const std::string& name, const std::string& searchPath)
{
    const auto canRun = [](const std::string& path) {
        struct stat status = {};
        return stat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode) && access(path.c_str(), X_OK) == 0;
    };
    if (name.find('/') != std::string::npos) {
        return canRun(name) ? name : "";
    }
    std::istringstream folders(searchPath);
    std::string path;
    while (std::getline(folders, path, ':')) {
        path.append("/").append(name);
        if (canRun(path)) {
            return path;
        }
    }
    return "";
}
