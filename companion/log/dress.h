#pragma once

#include "log/parser.h"

#include <string>
#include <string_view>

/// Takes off what a program that kept the log has put around its lines, and hands the lines to a parser: the formats of
/// journalctl -o (export, json, json-pretty, json-sse, json-seq and verbose; the others are a prefix for the parser),
/// and newest lines first.
class Dress
{
public:
    static constexpr std::size_t longestReversed = std::size_t{64} * 1024 * 1024; // bytes

    explicit Dress(LogParser& parser) : mParser(parser) {}

    /// The lines are not newest first: nothing is held back to find that out.
    void expectOldestFirst() { mOrderKnown = true; }

    /// Takes the next block of the log.
    void feed(std::string_view block);

    /// The log has ended: hands over the rest.
    void finish();

    std::uint64_t bytes() const { return mBytes; } ///< taken so far

    /// True when the log is newest first and too large to be turned round.
    bool tooLarge() const { return mReversed && mHeld.size() > longestReversed; }

private:
    enum class Format { UNKNOWN, PLAIN, FIELDS, VERBOSE, JSON };

    std::string findFormat();
    void take(std::string_view block);
    void takeEntryLine(std::string_view line);
    void takeBinary(std::string_view& block);
    void takeField(std::string_view field);
    void endEntry();
    void hand(std::string_view text);

    LogParser& mParser;
    Format mFormat = Format::UNKNOWN;
    bool mReversed = false;
    bool mOrderKnown = false;
    std::uint64_t mBytes = 0;
    std::string mHeld;    // text whose order is not known yet, or that is to be turned round
    std::string mPartial; // of a line that has not ended yet
    std::string mObject;  // of a JSON object likewise
    std::string mProgram; // of the journal's entry
    std::string mProcess;
    std::string mMessage;
};
