#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

/// The answer of one command, which the stand-ins for popen(3) and pclose(3) give to the updater's runner.
struct Answer
{
    int status; ///< raw wait status; -1: pclose(3) fails
    std::string output;
};

/// Splits a fuzzer's input into the answers of `count` commands: a digit for each one's status, then their
/// outputs, separated by the byte 0x1E. Seeds stay readable that way.
std::vector<Answer> answersOf(const std::uint8_t* data, std::size_t size, std::size_t count);

/// The next commands get these answers, in order.
void give(const std::vector<Answer>& answers);

/// How many of these answers have been taken.
std::size_t taken();

/// The result of reading an output in pieces of at most 1023 bytes that end at a line feed, each taken for a C string:
/// after a zero byte, the rest of the piece is lost.
std::string asRead(const std::string& output);

/// The exit code that the runner must derive from a raw wait status.
int codeOf(int status);

/// The lines of asRead() `output`; a last one without a line feed counts, an empty one after the last line feed does
/// not.
std::vector<std::string> linesRead(const std::string& output);

/// The text after the first `key` in the last line that has `key` and none of `unless`; "" without such a line.
std::string lastBehind(const std::vector<std::string>& lines, const std::string& key, const std::string& unless = "");

/// The updater's log since the last call.
std::string takeLog();

/// Ends the process unless `holds`, so that the fuzzer keeps the input.
void expect(bool holds, const char* what);
