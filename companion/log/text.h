#pragma once

#include "log/run.h"

#include <iosfwd>
#include <string>

/// Prints a run, explained before, for people.
///
/// @param source  where the log came from
void printRun(const Run& run, const std::string& source, std::ostream& out);

/// "07:15:33" of a ParsedRecord::time.
std::string clockText(std::int64_t time);

/// "21-11-2026 07:15:33" of a ParsedRecord::time.
std::string dateText(std::int64_t time);

/// "12 s", "13 min 0 s", "1 h 2 min".
std::string durationText(std::int64_t seconds);

/// How a step came out in a few words, such as "FAILED: exit 100".
std::string resultText(const Step& step);

/// "1.2.0 -> 1.3.0, installed": what became of the package in a run.
std::string packageText(const Run& run);

/// Likewise of the board.
std::string boardText(const Run& run);
