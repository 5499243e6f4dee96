#pragma once

#include <chrono>
#include <csignal>
#include <functional>
#include <string>
#include <vector>

/// What became of a command.
struct CommandResult
{
    bool started = false;
    bool timedOut = false; ///< It was killed.
    int exitCode = -1;     ///< -1 when it was not started, timed out or was ended by a signal
    std::string output;    ///< standard output, the first 256 KiB of it
    std::string errors;    ///< standard error, likewise

    bool succeeded() const { return exitCode == 0; }
};

/// Holds back what ends this program from outside, Ctrl-C, a lost terminal or kill(1), for as long as it lives: what
/// was begun can be cleared away first.
class HeldSignals
{
public:
    HeldSignals();
    ~HeldSignals();
    HeldSignals(const HeldSignals&) = delete;
    HeldSignals& operator=(const HeldSignals&) = delete;

    /// True when one of them is held back.
    bool any() const;

private:
    sigset_t mHeld;
    sigset_t mBefore;
};

/// Runs a program without a shell, as a service runs it: no terminal, no input. It and its children are killed at
/// `limit`, when `goesOn` says no, and when this program is to end.
///
/// @param arguments    the program, looked for on the PATH of `environment` when it holds no slash, and its arguments
/// @param environment  all of its environment, as NAME=value
/// @param goesOn       asked a hundred times a second, with the time since the start; empty: the limit alone counts
CommandResult runCommand(const std::vector<std::string>& arguments, const std::vector<std::string>& environment,
                         std::chrono::milliseconds limit,
                         const std::function<bool(std::chrono::milliseconds)>& goesOn = {});

/// `texts` as exec(3) takes them, for as long as they are there.
std::vector<char*> pointersTo(const std::vector<std::string>& texts);

/// The program that `name` stands for on `searchPath` (folders with colons between); empty when there is none.
std::string findProgram(const std::string& name, const std::string& searchPath);
