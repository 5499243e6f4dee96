#pragma once

#include "descriptor.h"

#include <cstddef>
#include <string>
#include <vector>

#include <sys/types.h>

/// Where a log comes from: a file, standard input, or what a program prints, such as journalctl(1).
class LogSource
{
public:
    static constexpr std::size_t blockSize = std::size_t{256} * 1024; ///< bytes that are best read at once

    LogSource() = default;
    LogSource(const LogSource&) = delete;
    LogSource& operator=(const LogSource&) = delete;
    ~LogSource() { close(false); }

    /// Opens `path`, or standard input for "-". Returns what is wrong, in words; empty when it is open.
    std::string openFile(const std::string& path);

    /// Reads what a program prints.
    ///
    /// @param arguments  the program, looked for on the search path, and its arguments
    /// @param name       for messages
    /// @param complains  its standard error is this program's; else it is lost
    /// @return what is wrong, in words; empty when it is open
    std::string openProgram(const std::vector<std::string>& arguments, const std::string& name, bool complains);

    /// Name for messages, printable.
    const std::string& name() const { return mName; }
    int descriptor() const { return mDescriptor.number(); }
    bool isRegularFile() const;

    /// Reads what comes next into `block`. Its length, 0 at the end, -1 with errno on an error.
    ssize_t read(std::vector<char>& block) const;

    /// Waits for the program's end, which it brings about unless all of its output was read.
    ///
    /// @return the program's exit code; 0 for the other sources and when it was ended
    int close(bool allRead);

private:
    std::string mName;
    Descriptor mDescriptor;
    pid_t mProgram = -1;
};
