/// Preloaded into the updater by the bench (LD_PRELOAD), and into none of its children.
///
/// Writes the start and the end of every command and every wait to the file named by BENCH_CALLS, one line each, with
/// tabs between the columns:
///
///   seconds of CLOCK_BOOTTIME, thread id, "system" | "popen" | "nanosleep", "start" | "rest" | "end", value, text
///
/// For a command the text is its command line and the value at its end the raw status. For a wait the value is the
/// requested time (s) and the text the time that it really takes (s); "rest" has what remains of both after a change of
/// the speed.
///
/// Shortens the waits: BENCH_SPEED times (1: full length), but to no less than BENCH_SHORTEST_WAIT (s; 0.2 when it is
/// not set) so that the panel's flashing stays visible; a longer one makes its pauses longer. BENCH_SPEED may also be
/// the absolute path of a file with the number, which may change while the updater runs. The wall clock that the
/// updater sees advances by the time cut from waits of 2 s and more, so that the log reads like a run at full length.

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <dlfcn.h>
#include <fcntl.h>
#include <fstream>
#include <mutex>
#include <string>
#include <unistd.h>

namespace
{

const double clockWait = 2;      // s, the shortest wait whose shortening moves the wall clock
const double longestSleep = 0.1; // s, between two looks at the file with the speed

std::atomic<double> clockOffset{0};   // s, by which the updater's wall clock is ahead
std::mutex writing;                   // both threads use one descriptor, as the updater may have no more
thread_local std::string pipeCommand; // the updater reads one command at a time on a thread

__attribute__((constructor)) void leaveChildrenAlone()
{
    unsetenv("LD_PRELOAD");
}

/// The function that would have been called without this library.
template <typename Function>
Function next(const char* name, Function)
{
    return reinterpret_cast<Function>(dlsym(RTLD_NEXT, name));
}

double number(const char* variable, double otherwise)
{
    const char* text = getenv(variable);
    return text == nullptr ? otherwise : std::atof(text);
}

double seconds(const timespec& time)
{
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

timespec timeOf(double seconds)
{
    return {static_cast<std::time_t>(seconds), static_cast<long>((seconds - std::floor(seconds)) * 1e9)};
}

/// The file with the speed, null when BENCH_SPEED is the number itself.
const char* speedFile()
{
    const char* speed = getenv("BENCH_SPEED");
    return speed != nullptr && *speed == '/' ? speed : nullptr;
}

/// How many times shorter the waits are now.
double speed()
{
    double result = number("BENCH_SPEED", 1);
    if (speedFile() != nullptr) {
        std::ifstream(speedFile()) >> result;
    }
    return std::max(1.0, result);
}

void writeLine(const char* call, const char* phase, long value, const std::string& text)
{
    const int savedErrno = errno;
    const char* path = getenv("BENCH_CALLS");
    timespec now = {};
    clock_gettime(CLOCK_BOOTTIME, &now);
    char head[128];
    std::snprintf(head, sizeof head, "%lld.%06ld\t%d\t%s\t%s\t%ld\t", static_cast<long long>(now.tv_sec),
                  now.tv_nsec / 1000, gettid(), call, phase, value);
    const std::string line = head + text + '\n';
    const std::lock_guard<std::mutex> lock(writing);
    const int file = path == nullptr ? -1 : open(path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    if (file < 0 || write(file, line.data(), line.size()) < 0) {
        std::perror("bench: BENCH_CALLS");
    }
    if (file >= 0) {
        close(file);
    }
    errno = savedErrno;
}

} // namespace

extern "C" {

int system(const char* command)
{
    writeLine("system", "start", 0, command);
    const int status = next("system", &system)(command);
    writeLine("system", "end", status, command);
    return status;
}

FILE* popen(const char* command, const char* mode)
{
    pipeCommand = command;
    writeLine("popen", "start", 0, command);
    FILE* pipe = next("popen", &popen)(command, mode);
    if (pipe == nullptr) {
        writeLine("popen", "end", -1, command);
    }
    return pipe;
}

int pclose(FILE* pipe)
{
    const int status = next("pclose", &pclose)(pipe);
    writeLine("popen", "end", status, pipeCommand);
    return status;
}

int nanosleep(const timespec* asked, timespec* remaining)
{
    const double length = seconds(*asked);
    const double shortest = number("BENCH_SHORTEST_WAIT", 0.2) / length;
    double left = length; // of the wait as requested
    double taken = 0;
    double factor = 0;
    int result = 0;
    do {
        const double now = std::max(shortest, 1 / speed());
        if (now != factor) {
            const char* phase = factor == 0 ? "start" : "rest";
            factor = now;
            writeLine("nanosleep", phase, std::lround(left), std::to_string(left * factor));
        }
        const double whole = left * factor;
        const double sleep = speedFile() != nullptr ? std::min(whole, longestSleep) : whole;
        const timespec wait = timeOf(sleep);
        timespec rest = {};
        result = next("nanosleep", &nanosleep)(&wait, &rest);
        const double slept = sleep - (result == 0 ? 0 : seconds(rest));
        taken += slept;
        left = result == 0 && sleep == whole ? 0 : left - slept / factor;
    } while (result == 0 && left > 0);
    if (result == -1 && errno == EINTR && remaining != nullptr) {
        *remaining = timeOf(left);
        errno = EINTR;
    } else if (length >= clockWait) {
        clockOffset = clockOffset + length - taken; // one thread at a time waits that long
    }
    writeLine("nanosleep", "end", 0, "");
    return result;
}

std::time_t time(std::time_t* result)
{
    timespec now = {};
    clock_gettime(CLOCK_REALTIME, &now);
    const double fraction = static_cast<double>(now.tv_nsec) / 1e9;
    const std::time_t shown = now.tv_sec + static_cast<std::time_t>(fraction + clockOffset);
    if (result != nullptr) {
        *result = shown;
    }
    return shown;
}
}
