#pragma once

#include <string>

struct CommandStatus;

/// The plain words for how a command ended: "exit 0", "exit 127 (command not found)", "killed by signal 9 (SIGKILL)".
///
/// wait(2): of a raw status, the low seven bits are the signal, the next byte is the exit code. A shell turns a signal
/// into 128 and its number; 126 and 127 are its own codes for a command that it could not run, 255 is ssh(1)'s for an
/// error of its own.
std::string statusText(const CommandStatus& status);
