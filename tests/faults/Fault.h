#pragma once

#include <string>
#include <vector>

/// The effect of a fault on the text that a healthy command prints.
enum class Text {
    Kept,            ///< nothing that matters is lost
    None,            ///< nothing is printed, or nobody reads it
    Preceded,        ///< other lines come first
    CarriageReturns, ///< every line ends in a carriage return
};

/// One way in which a command can go wrong.
struct Fault
{
    std::string name;
    int status; ///< raw wait status, wait(2); -1 when there is none
    Text text;
    std::string (*output)(const std::string& healthy); ///< what is printed instead of the healthy text
    bool starts = true;                                ///< false: no shell can be started
    int delay = 0;                                     ///< ms, before the command ends

    /// The exit code as the updater's runner derives it: a killed or unstarted command counts as 0.
    int code() const { return status / 256; }
};

/// The faults of a command whose output is read.
const std::vector<Fault>& readFaults();

/// The faults of a command whose status alone is visible.
const std::vector<Fault>& runFaults();
