#include "log/status.h"

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

} // namespace

std::string rawStatusText(long status)
{
    if (status == -1) {
        return "its status could not be had";
    }
    if (status < 0 || status > 0xFFFF) {
        return std::to_string(status) + " (no wait status)";
    }
    const int signal = static_cast<int>(status & 0x7F);
    if (signal != 0) {
        return "killed by " + signalText(signal);
    }
    return exitCodeText(status >> 8);
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
