#pragma once

#include "log/run.h"
#include "texts.h"

#include <iosfwd>
#include <string>
#include <utility>
#include <vector>

/// The words for what is known of a run.

/// What the operator saw and heard at the end of a run, as far as its log tells.
struct OperatorView
{
    std::vector<std::pair<std::string, std::string>> leds; ///< name and colour: "REMOTE", "pass"; all others are dark
    std::string sound;                                     ///< "pass", "fail", or empty for none
    std::string seen;                                      ///< both in words
    std::string meaning;                                   ///< in words
};

OperatorView operatorView(const Run& run);

/// Prints a run, explained before, for people.
///
/// @param source  where the log came from
void printRun(const Run& run, const std::string& source, std::ostream& out);

/// Names for programs, such as "no-update" and "failed"; "none" for a log that does not reach an outcome.
const char* outcomeName(Outcome outcome);
const char* resultName(StepResult result);

/// A ParsedRecord::time as "07:15:33", "21-11-2026 07:15:33" and "2026-11-21T07:15:33".
std::string clockText(std::int64_t time);
std::string dateText(std::int64_t time);
std::string isoText(std::int64_t time);

/// "12 s", "13 min 0 s", "1 h 2 min".
std::string durationText(std::int64_t seconds);

/// How a step came out in a few words, such as "FAILED: exit 100".
std::string resultText(const Run& run, const Step& step);

/// The plain words for how a command ended: "exit 0", "exit 127 (command not found)", "killed by signal 9 (SIGKILL)".
///
/// wait(2): of a raw status, the low seven bits are the signal, the next byte is the exit code. A shell turns a signal
/// into 128 and its number; 126 and 127 are its own codes for a command that it could not run, 255 is ssh(1)'s for an
/// error of its own.
std::string statusText(const CommandStatus& status);

/// "apt update" or "wait 780 s", and how it ended: "exit 0", "failed", or nothing when the log does not tell.
std::string actionText(const Action& action);
std::string actionStatusText(const Action& action);

/// What other programs said, a line each: "scp: Connection closed (20 times)".
std::vector<std::string> shownLines(const OtherLines& lines);

/// What became of the package and of the board in a run: "1.2.0 -> 1.3.0, installed".
std::string packageText(const Run& run);
std::string boardText(const Run& run);

/// "Failed: Refresh the package mirrors (line 23) [mirrors-unreachable]", why, what to do, and all three for
/// printText().
std::string headingOf(const Run& run, const Problem& problem);
std::string causeOf(const Run& run, const Problem& problem);
std::string remedyOf(const Run& run, const Problem& problem);
std::string problemText(const Run& run, const Problem& problem);

/// What the catalogue's texts get of a run.
///
/// @param step     that the text is about, or null
/// @param failure  the entry's name; empty for a gap
Values valuesOf(const Run& run, const Step* step, std::string_view failure);

/// What the log leaves open, a sentence for each.
std::vector<std::string> gapTexts(const Run& run);
