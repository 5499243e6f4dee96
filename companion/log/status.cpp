#include "log/status.h"

#include "log/run.h"

#include <csignal>
#include <cstring>

namespace
{

/// "signal 9 (SIGKILL)"
std::string signalText(int signal)
{
    const char* name = sigabbrev_np(signal);
    std::string text = "signal " + std::to_string(signal);
    return name == nullptr ? text : text + " (SIG" + name + ')';
}

std::string exitCodeText(long code)
{
    std::string text = "exit " + std::to_string(code);
    if (code == 126) {
        return text + " (command cannot be run)";
    }
    if (code == 127) {
        return text + " (command not found)";
    }
    if (code > 128 && code <= 128 + SIGRTMAX) {
        return text + " (killed by " + signalText(static_cast<int>(code) - 128) + ')';
    }
    return text;
}

} // namespace

std::string statusText(const CommandStatus& status)
{
    if (!status.raw) {
        return exitCodeText(status.number);
    }
    if (status.lost()) {
        return "its status is not available";
    }
    if (status.number < 0 || status.number > 0xFFFF) {
        return std::to_string(status.number) + " (no wait status)";
    }
    const int signal = static_cast<int>(status.number & 0x7F);
    return signal != 0 ? "killed by " + signalText(signal) : exitCodeText(status.number >> 8);
}
