/// Called in place of each tool of the updater: runs the real one, the next in the search path, and ends it when it
/// takes too long.
///
/// Installed under the tools' names in its own folder, which comes first in the search path of the services. The tool
/// does not notice: arguments, environment (except for that folder in PATH), standard streams and signals are
/// unchanged, and its exit code or signal is passed on. A call that reaches its limit (limits.h) ends with 124, as with
/// timeout(1), and waits for none of its processes any longer.
///
/// The notes of a run are in the folder RUNTIME_DIRECTORY, if the service has one. `notes` has a line for each event,
/// preceded by the time since boot (s):
///
///     option -a | none                      what i2cset needs for the panel's address
///     spent NAME SECONDS                    of the budget NAME
///     sound pass | fail                     is going to be played
///     lit LED COLOR STATUS                  an outcome's LED was sent; 0: both bytes arrived
///     began NAME, ended NAME STATUS         a call of the limit NAME; the raw status
///
/// Needs no start-up of the C++ library, which would only delay each LED byte.

#include "limits.h"

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <dirent.h>
#include <fcntl.h>
#include <iterator>
#include <poll.h>
#include <sys/auxv.h>
#include <sys/prctl.h>
#include <sys/signalfd.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

namespace
{

const int expired = 124;     // timeout(1)
const int notRunnable = 126; // POSIX shell: found but not to be run
const int notFound = 127;    // POSIX shell
const int passedOn[] = {SIGHUP, SIGINT, SIGQUIT, SIGTERM, SIGUSR1, SIGUSR2, SIGALRM};

/// Seconds since boot, as in /proc/uptime.
double now()
{
    timespec time = {};
    clock_gettime(CLOCK_BOOTTIME, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

bool equal(const char* left, const char* right)
{
    return std::strcmp(left, right) == 0;
}

const char* baseName(const char* path)
{
    const char* slash = std::strrchr(path, '/');
    return slash == nullptr ? path : slash + 1;
}

__attribute__((format(printf, 1, 2))) void say(const char* format, ...)
{
    char line[1000];
    va_list arguments;
    va_start(arguments, format);
    std::vsnprintf(line, sizeof line, format, arguments); // NOLINT(clang-analyzer-valist.Uninitialized): false
    va_end(arguments);
    dprintf(STDERR_FILENO, "hand-over: %s\n", line);
}

// The notes of a run

bool notePath(char (&path)[PATH_MAX], const char* name)
{
    const char* folder = std::getenv("RUNTIME_DIRECTORY");
    return folder != nullptr && std::snprintf(path, sizeof path, "%s/%s", folder, name) < PATH_MAX;
}

/// Adds a line to the notes; the run continues without it if it cannot be written.
__attribute__((format(printf, 1, 2))) void note(const char* format, ...)
{
    char path[PATH_MAX];
    if (!notePath(path, "notes")) {
        return;
    }
    const int file = open(path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    if (file == -1) {
        return;
    }
    char line[200];
    int length = std::snprintf(line, sizeof line, "%.2f ", now());
    va_list arguments;
    va_start(arguments, format);
    // NOLINTNEXTLINE(clang-analyzer-valist.Uninitialized): false
    length += std::vsnprintf(line + length, sizeof line - static_cast<size_t>(length), format, arguments);
    va_end(arguments);
    length = std::min(length, static_cast<int>(sizeof line) - 1);
    line[length++] = '\n';
    if (write(file, line, static_cast<size_t>(length)) == -1) {
        say("cannot write %s: %s", path, std::strerror(errno));
    }
    close(file);
}

/// Reads a file of the run's folder as text; empty if there is none.
template <size_t size>
void readNotes(const char* name, char (&text)[size])
{
    char path[PATH_MAX];
    text[0] = '\0';
    const int file = notePath(path, name) ? open(path, O_RDONLY | O_CLOEXEC) : -1;
    if (file == -1) {
        return;
    }
    const ssize_t length = read(file, text, size - 1);
    text[std::max<ssize_t>(length, 0)] = '\0';
    close(file);
}

/// The used part of the budget `name` (s).
double spent(const char* name)
{
    char notes[8192];
    readNotes("notes", notes);
    double sum = 0;
    for (const char* line = notes; line != nullptr; line = std::strchr(line, '\n')) {
        char budget[64];
        double seconds = 0;
        if (std::sscanf(line, "%*f spent %63s %lf", budget, &seconds) == 2 && equal(budget, name)) {
            sum += seconds;
        }
        ++line;
    }
    return sum;
}

// The call

const Limit& limitOf(const char* tool, char** arguments)
{
    const auto contains = [&](const char* word) {
        for (char** argument = arguments + 1; *argument != nullptr; ++argument) {
            if (std::strstr(*argument, word) != nullptr) {
                return true;
            }
        }
        return false;
    };
    for (const Limit& limit : limits) {
        if (limit.tool == nullptr || (equal(limit.tool, tool) && (limit.word == nullptr || contains(limit.word)))) {
            return limit;
        }
    }
    __builtin_unreachable(); // the last one fits all
}

bool sameFile(const struct stat& left, const struct stat& right)
{
    return left.st_dev == right.st_dev && left.st_ino == right.st_ino;
}

/// Finds the real `tool` and takes this program's folder out of PATH. Returns 0 and the tool's `path`, or the shell's
/// exit code for a tool that it does not find or cannot run.
int findReal(const char* tool, char (&path)[PATH_MAX])
{
    char* search = std::getenv("PATH");
    struct stat own = {};
    struct stat other = {};
    // The path that was executed, getauxval(3). NOLINTNEXTLINE(performance-no-int-to-ptr)
    const char* called = reinterpret_cast<const char*>(getauxval(AT_EXECFN));
    const long calledFolder = called == nullptr ? 0 : baseName(called) - called - 1;
    stat("/proc/self/exe", &own);
    path[0] = '\0';
    int result = notFound;
    char* kept = search;
    for (char* folder = search; folder != nullptr;) {
        char* end = folder + std::strcspn(folder, ":");
        const bool last = *end == '\0';
        const int length = static_cast<int>(end - folder);
        char candidate[PATH_MAX];
        const int size =
            std::snprintf(candidate, sizeof candidate, "%.*s%s%s", length, folder, length > 0 ? "/" : "", tool);
        const bool exists = size < PATH_MAX && stat(candidate, &other) == 0;
        const bool replaced = length > 0 && length == calledFolder && std::strncmp(folder, called, calledFolder) == 0;
        if (!(exists && sameFile(own, other)) && !replaced) { // replaced: by an upgrade, a moment ago
            if (exists && S_ISREG(other.st_mode) && result != 0) {
                result = access(candidate, X_OK) == 0 ? 0 : notRunnable;
                std::memcpy(path, candidate, sizeof path);
            }
            if (kept != search) {
                *kept++ = ':';
            }
            kept = std::copy(folder, end, kept);
        }
        folder = last ? nullptr : end + 1;
    }
    if (kept != nullptr) {
        *kept = '\0';
    }
    return result;
}

/// Runs the tool in this process. A script without a first line of its own is the shell's, as execvp(3) has it.
[[noreturn]] void execute(const char* path, char** arguments)
{
    execve(path, arguments, environ);
    if (errno == ENOEXEC) {
        char* shell[64] = {const_cast<char*>("/bin/sh"), const_cast<char*>(path)};
        for (size_t i = 1; arguments[i] != nullptr && i + 2 < sizeof shell / sizeof *shell; ++i) {
            shell[i + 1] = arguments[i];
        }
        execve(shell[0], shell, environ);
    }
    _exit(notRunnable);
}

// Signals

sigset_t held; // wait until they are asked for
sigset_t inheritedMask;
struct sigaction inheritedChild;

/// Those that are ignored stay so.
void holdSignals()
{
    sigemptyset(&held);
    sigaddset(&held, SIGCHLD);
    for (const int signal : passedOn) {
        struct sigaction action = {};
        sigaction(signal, nullptr, &action);
        if (action.sa_handler != SIG_IGN) {
            sigaddset(&held, signal);
        }
    }
    sigprocmask(SIG_BLOCK, &held, &inheritedMask);
    struct sigaction action = {};
    action.sa_handler = SIG_DFL; // with SIGCHLD ignored there would be no status, wait(2)
    sigaction(SIGCHLD, &action, &inheritedChild);
}

/// The next signal within `seconds`, or -1.
int nextSignal(double seconds)
{
    const double wait = std::max(seconds, 0.0);
    const auto whole = static_cast<time_t>(wait);
    const timespec time = {whole, static_cast<long>((wait - static_cast<double>(whole)) * 1e9)};
    return sigtimedwait(&held, nullptr, &time);
}

// Output

/// Relays the tool's output through its own pipe where somebody reads ours to its end, so that no process that the tool
/// leaves running can keep that reader waiting.
class Relay
{
public:
    /// Sets up the relay where standard output is a pipe. If no descriptors are left for it, the tool gets ours.
    void open()
    {
        struct stat output = {};
        int ends[2];
        if (fstat(STDOUT_FILENO, &output) != 0 || !S_ISFIFO(output.st_mode) || pipe2(ends, O_CLOEXEC) != 0) {
            return;
        }
        mSource = ends[0];
        mToolsEnd = ends[1];
        mSignals = signalfd(-1, &held, SFD_CLOEXEC);
        if (mSignals == -1) {
            ::close(mToolsEnd);
            close();
        }
    }
    /// What the tool writes to, or -1 for our own output.
    int toolsEnd() const { return mToolsEnd; }
    /// To be called once the tool runs.
    void begin() const
    {
        if (isOpen()) {
            ::close(mToolsEnd);
            std::signal(SIGPIPE, SIG_IGN); // after the tool's start: it keeps the setting that it was given
        }
    }
    bool isOpen() const { return mSource != -1; }
    /// Whether our reader is slower than the tool.
    bool isFull() const { return mLength > 0; }
    void close()
    {
        ::close(mSource);
        mSource = -1;
    }
    /// Moves output on for up to `seconds`, or until a signal arrives. Returns whether there was any.
    bool move(double seconds)
    {
        pollfd events[] = {{mSignals, POLLIN, 0},
                           {isFull() ? STDOUT_FILENO : mSource, static_cast<short>(isFull() ? POLLOUT : POLLIN), 0}};
        if (poll(events, 2, static_cast<int>(std::max(seconds, 0.0) * 1000) + 1) <= 0 || events[1].revents == 0) {
            return false;
        }
        // A pipe that poll(2) calls writable takes PIPE_BUF bytes at once, pipe(7).
        const ssize_t length =
            isFull() ? write(STDOUT_FILENO, mBuffer, mLength) : read(mSource, mBuffer, sizeof mBuffer);
        if (length == 0 || (length < 0 && errno != EINTR && errno != EAGAIN)) {
            close(); // the tool has closed its end, or our reader its own: now the tool notices that
        }
        const bool written = isFull();
        mLength = written || length < 0 ? 0 : static_cast<size_t>(length);
        return length > 0;
    }

private:
    int mSource = -1;
    int mToolsEnd = -1;
    int mSignals = -1;
    char mBuffer[PIPE_BUF] = {};
    size_t mLength = 0; // of what is read and not yet written
};

// The tool's end

/// The parent of the process, or 0 when it has gone.
pid_t parentOf(const char* process)
{
    char path[64];
    char text[512];
    std::snprintf(path, sizeof path, "/proc/%s/stat", process);
    const int file = open(path, O_RDONLY | O_CLOEXEC);
    if (file == -1) {
        return 0;
    }
    const ssize_t length = read(file, text, sizeof text - 1);
    close(file);
    text[std::max<ssize_t>(length, 0)] = '\0';
    const char* name = std::strrchr(text, ')'); // "id (name) state parent", proc(5); the name may contain anything
    int parent = 0;
    return name != nullptr && std::sscanf(name + 1, " %*c %d", &parent) == 1 ? parent : 0;
}

/// Sends the signal to every descendant, in any session or group. This process is the subreaper of all of them: one
/// whose parent has ended becomes its child.
void signalDescendants(int signal)
{
    struct Process
    {
        pid_t id;
        pid_t parent;
        bool reached;
    };
    static Process processes[8192];
    Process* end = processes;
    DIR* folder = opendir("/proc");
    if (folder == nullptr) {
        return;
    }
    while (const dirent* entry = readdir(folder)) {
        if (std::isdigit(static_cast<unsigned char>(entry->d_name[0])) != 0 && end != std::end(processes)) {
            *end++ = {std::atoi(entry->d_name), parentOf(entry->d_name), false};
        }
    }
    closedir(folder);
    const auto isReached = [&](pid_t id) {
        return id == getpid() ||
               std::any_of(processes, end, [&](const Process& other) { return other.reached && other.id == id; });
    };
    for (bool more = true; more;) {
        more = false;
        for (Process* process = processes; process != end; ++process) {
            if (!process->reached && isReached(process->parent)) {
                kill(process->id, signal);
                process->reached = more = true;
            }
        }
    }
}

/// Reaps every descendant that has ended. Returns whether none is left; `status` is set when `tool` ended.
bool reap(pid_t tool, int& status)
{
    int each = 0;
    pid_t ended = 0;
    while ((ended = waitpid(-1, &each, WNOHANG)) > 0) {
        if (ended == tool) {
            status = each;
        }
    }
    return ended == -1;
}

/// Sends SIGTERM to every descendant, then SIGKILL to those left. Leaves running what does not die of that.
void endDescendants(const char* name)
{
    int status = 0;
    for (const int signal : {SIGTERM, SIGKILL}) {
        const double end = now() + grace;
        signalDescendants(signal);
        signalDescendants(SIGCONT);
        while (now() < end) {
            if (reap(-1, status)) {
                return;
            }
            nextSignal(0.1);
            if (signal == SIGKILL) {
                signalDescendants(signal); // one that was being made
            }
        }
    }
    say("%s: cannot be ended; left behind", name);
}

// One call

struct Streams
{
    int output = -1; ///< -1: as they are
    int errors = -1;
};

pid_t start(const char* path, char** arguments, const Streams& streams)
{
    // A copy of the memory would take longer than everything else. The child has its own descriptors and signal
    // settings, vfork(2). NOLINTBEGIN(clang-analyzer-security.insecureAPI.vfork,clang-analyzer-unix.Vfork)
    const pid_t child = vfork();
    if (child == 0) {
        if (streams.output != -1) {
            dup2(streams.output, STDOUT_FILENO);
        }
        if (streams.errors != -1) {
            dup2(streams.errors, STDERR_FILENO);
        }
        sigaction(SIGCHLD, &inheritedChild, nullptr);
        sigprocmask(SIG_SETMASK, &inheritedMask, nullptr);
        execute(path, arguments);
    }
    // NOLINTEND(clang-analyzer-security.insecureAPI.vfork,clang-analyzer-unix.Vfork)
    return child;
}

/// Runs the tool for up to `seconds`. Returns the raw status.
int supervise(const char* path, char** arguments, double seconds, Streams streams)
{
    const char* name = baseName(path);
    Relay relay;
    if (streams.output == -1) {
        relay.open();
        streams.output = relay.toolsEnd();
    }
    const pid_t child = start(path, arguments, streams);
    if (child == -1) { // no more processes: better without a limit than not at all
        sigprocmask(SIG_SETMASK, &inheritedMask, nullptr);
        execute(path, arguments);
    }
    relay.begin();

    const double end = now() + seconds;
    const int running = -1;
    int status = running;
    double silent = now() + silence;
    while (now() < end) {
        const double begin = now();
        const double wait = std::min(end, status == running ? end : silent) - begin;
        const bool relayed = relay.isOpen(); // then it has waited for signals too
        if (relayed && relay.move(wait)) {
            silent = now() + silence;
        }
        const int signal = nextSignal(relayed ? 0 : wait);
        if (signal == SIGCHLD) {
            reap(child, status);
            silent = now() + silence;
        } else if (signal != -1) {
            signalDescendants(signal);
        }
        if (status == running) {
            continue;
        }
        if (!relay.isOpen()) {
            return status;
        }
        if (!relay.isFull() && begin >= silent) { // and nothing has come since
            say("%s: its output is held open by another process; cut", name);
            return status;
        }
    }
    say("%s: no end within %g s; ended", name, seconds);
    if (relay.isOpen()) {
        relay.close();
    }
    endDescendants(name);
    return W_EXITCODE(expired, 0);
}

/// One call of a tool, within its limit and the rest of its budget. Returns the raw status, or the shell's exit code
/// for a tool that cannot be run.
int call(const char* tool, char** arguments, const Streams& streams = {})
{
    const Limit& limit = limitOf(tool, arguments);
    const double left = limit.budget - spent(limit.name);
    if (left <= 0) {
        return W_EXITCODE(expired, 0);
    }
    char path[PATH_MAX];
    if (const int error = findReal(tool, path); error != 0) {
        const char* search = std::getenv("PATH");
        say("%s: %s in %s", tool, error == notFound ? "not found" : "not to be run", search == nullptr ? "" : search);
        return W_EXITCODE(error, 0);
    }
    if (limit.noted) {
        note("began %s", limit.name);
    }
    const double begin = now();
    const int status = supervise(path, arguments, std::min(limit.call, left), streams);
    const double took = now() - begin;
    if (limit.noted) {
        note("ended %s %d", limit.name, status);
    }
    if (limit.everyCall || status == W_EXITCODE(expired, 0)) {
        note("spent %s %.2f", limit.name, took);
        if (took >= left) {
            say("%s: %g s are used up; further calls fail at once", limit.name, limit.budget);
        }
    }
    return status;
}

// The panel

/// What i2cset needs for the panel's address: since 4.2 it refuses 0x07, which the I2C bus reserves, without -a;
/// before, it had no such option. Its usage text shows which one it is; read once in a run.
bool needsOption()
{
    char text[8192];
    readNotes("notes", text);
    if (const char* option = std::strstr(text, " option "); option != nullptr) {
        return std::strncmp(option, " option -a", 10) == 0;
    }
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) {
        return true;
    }
    char tool[] = "i2cset";
    char help[] = "-h";
    char* arguments[] = {tool, help, nullptr};
    const int status = call(tool, arguments, {ends[1], ends[1]});
    close(ends[1]);
    text[std::max<ssize_t>(read(ends[0], text, sizeof text - 1), 0)] = '\0'; // fits into a pipe
    close(ends[0]);
    const bool needed = std::strstr(text, "[-a]") != nullptr;
    if (status != W_EXITCODE(expired, 0)) {
        note("option %s", needed ? "-a" : "none");
    }
    return needed;
}

/// Sends one byte, and notes it when it lights an outcome: the pass and the fail colour light nothing else.
int sendByte(int count, char** arguments)
{
    char option[] = "-a";
    char* extended[64] = {arguments[0], option};
    if (count + 2 > static_cast<int>(sizeof extended / sizeof *extended) || !needsOption()) {
        std::copy(arguments, arguments + std::min(count, 63), extended);
    } else {
        std::copy(arguments + 1, arguments + count, extended + 2);
    }
    const int status = call("i2cset", extended);
    if (count != 6) { // -y BUS CHIP BYTE c
        return status;
    }
    const char* byte = arguments[4];
    char path[PATH_MAX];
    if (equal(byte, "0x2") || equal(byte, "0x8")) {
        char text[64];
        char led[32] = "unknown";
        int selected = 1;
        readNotes("select", text);
        std::sscanf(text, "%31s %d", led, &selected);
        note("lit %s %s %d", led, byte, status == 0 && selected == 0 ? 0 : 1);
    } else if (const long led = std::strtol(byte, nullptr, 16);
               led >= 0x10 && led <= 0x1d && notePath(path, "select")) {
        const int file = open(path, O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
        char text[16];
        const int length = std::snprintf(text, sizeof text, "%-4.4s %d\n", byte, status == 0 ? 0 : 1);
        if (file != -1) {
            if (write(file, text, static_cast<size_t>(length)) == -1) {
                say("cannot write %s: %s", path, std::strerror(errno));
            }
            close(file);
        }
    }
    return status;
}

// Other tools

int play(char** arguments)
{
    if (arguments[1] != nullptr) {
        note("sound %s", std::strstr(arguments[1], "PASS") != nullptr ? "pass" : "fail");
    }
    return call("aplay", arguments);
}

/// Before the application starts, writes the journal of the run to the disk. journalctl makes journald take in what is
/// on its way; but the next record can cancel what journald of systemd 252 then writes, so the file system is told too.
int controlServices(int count, char** arguments)
{
    if (std::getenv("RUNTIME_DIRECTORY") != nullptr && equal(arguments[count - 1], "harl") &&
        equal(arguments[count - 2], "start")) {
        char journalctl[] = "journalctl";
        char takeIn[] = "--sync";
        char* first[] = {journalctl, takeIn, nullptr};
        char sync[] = "sync";
        char fileSystem[] = "--file-system";
        char folder[] = "/var/log/journal"; // not there when the journal is in memory only
        char* second[] = {sync, fileSystem, folder, nullptr};
        const int nothing = open("/dev/null", O_WRONLY | O_CLOEXEC);
        call(journalctl, first, {nothing, nothing});
        call(sync, second, {nothing, nothing});
    }
    return call("systemctl", arguments);
}

/// Ends as the tool did.
[[noreturn]] void passOn(int status)
{
    if (WIFSIGNALED(status)) {
        const int signal = WTERMSIG(status);
        prctl(PR_SET_DUMPABLE, WCOREDUMP(status) ? 1 : 0); // the status says whether there is a core file
        std::signal(signal, SIG_DFL);
        sigset_t none;
        sigemptyset(&none);
        sigprocmask(SIG_SETMASK, &none, nullptr);
        raise(signal);
        _exit(128 + signal); // cppcheck-suppress unreachableCode
    }
    _exit(WEXITSTATUS(status));
}

} // namespace

/// Usage: TOOL [ARGUMENT...], called by a tool's name.
int main(int count, char** arguments)
{
    if (count < 1) {
        return notFound;
    }
    holdSignals();
    prctl(PR_SET_CHILD_SUBREAPER, 1);
    const char* tool = baseName(arguments[0]);
    if (equal(tool, "i2cset")) {
        passOn(sendByte(count, arguments));
    }
    if (equal(tool, "aplay")) {
        passOn(play(arguments));
    }
    if (equal(tool, "systemctl") && count > 2) {
        passOn(controlServices(count, arguments));
    }
    passOn(call(tool, arguments));
}
