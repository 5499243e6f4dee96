#pragma once

#include <string>

/// The plain words for a raw wait status, as std::system returns it and the updater logs it for some commands: "exit
/// 0", "exit 1", "exit 127 (command not found)", "killed by signal 9 (SIGKILL)"; -1: "its status could not be had".
///
/// wait(2): the low seven bits are the signal, the next byte is the exit code.
std::string rawStatusText(long status);

/// The plain words for an exit code, as the updater logs it for the commands whose output it reads: "exit 0", "exit
/// 100".
///
/// A shell turns a signal into 128 and its number; 126 and 127 are its own codes for a command that it could not run,
/// 255 is ssh(1)'s for an error of its own.
std::string exitCodeText(long code);
