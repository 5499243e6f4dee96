#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

/// One command's answer as the stand-ins for popen(3) and pclose(3) give it to the updater's runner.
struct Answer
{
    int status; ///< raw wait status; -1: pclose(3) fails
    std::string output;
};

/// Takes a fuzzer's input apart into the answers of `count` commands: a digit for each one's status, then their
/// outputs, separated by the byte 0x1E. Seeds stay readable that way.
std::vector<Answer> answersOf(const std::uint8_t* data, std::size_t size, std::size_t count);

/// The next commands get these answers, in order.
void give(const std::vector<Answer>& answers);

/// How many of the answers given have been taken.
std::size_t taken();

/// What reading an output in pieces of at most 1023 bytes that end at a line feed gives, when each piece is taken for a
/// C string: in a piece with a zero byte the rest is lost.
std::string asRead(const std::string& output);

/// The exit code that the runner is to derive from a raw wait status.
int codeOf(int status);

/// The lines of a text; a last one without a line feed counts, an empty one after the last line feed does not.
std::vector<std::string> linesOf(const std::string& text);

/// What follows the first `key` in the last line that has it and none of `unless`; "" without such a line.
std::string lastBehind(const std::vector<std::string>& lines, const std::string& key, const std::string& unless = "");

/// The updater's log since the last call.
std::string takeLog();

/// Ends the process, for the fuzzer to keep the input, unless `holds`.
void expect(bool holds, const char* what);
