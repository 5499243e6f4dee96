#pragma once

#include "Fault.h"

#include "Platform.h"

#include <string>
#include <vector>

/// @file
/// The procedures of the two heads as tables, written independently of the updater: which command follows which answer,
/// and what is reported at the end. The fault matrix takes all its expectations from here.

/// What the updater evaluates of a command.
enum class Reads {
    Nothing, ///< at no more than its raw status, for the log
    Status,  ///< whether its raw status is 0
    Code,    ///< whether its exit code is 0
    Policy,  ///< the two versions in its output, whatever its exit code
    Board,   ///< its exit code, then the board's version in its output
    Listing, ///< at its exit code, then at the first line of its output
    Marker,  ///< its exit code, where 2 means no marker, then the first line of its output
};

/// A command of the updater, by the name that the tables give it.
struct Step
{
    std::string name;
    std::string command;
    Reads reads;
};

/// What is installed and offered in one run.
struct Unit
{
    bool mainHead;
    bool packageDiffers;
    bool boardDiffers;
    bool teamViewer; ///< its marker is on the stick; main head only
};

/// A fault of one step. A faulty upload succeeds after `times` attempts; in other steps `times` does not count.
struct Injection
{
    std::string step;
    const Fault* fault;
    int times = 0;
};

/// The expected result of one run.
struct Expected
{
    platform::Lines calls; ///< commands and pauses in order, as the journal spells them, reports included
    std::string report;    ///< the last one: "result 0", "error 1" ...
    std::string message;   ///< of the last record before it; empty when it is not fixed
};

/// The commands of the procedure on `unit`, each once, without those of panel and sound.
std::vector<Step> stepsOf(const Unit& unit);

/// What a healthy command prints on `unit`.
std::string healthyOutput(const Unit& unit, const std::string& step);

/// The exit code of a healthy command on `unit`.
int healthyCode(const Unit& unit, const std::string& step);

/// The LED commands that darken the panel, and those that show `report`.
platform::Lines darkPanel();
platform::Lines outcomePanel(const std::string& report);

/// The command that plays the sound for `report`.
std::string outcomeSound(const std::string& report);

/// Follows the tables from the first step to the last.
Expected follow(const Unit& unit, const std::vector<Injection>& injections);
