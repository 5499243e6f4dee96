#pragma once

#include "log/parser.h"

#include <functional>
#include <string>
#include <string_view>

/// A journal's entry, as far as its fields matter here.
struct JournalEntry
{
    std::string message;
    std::string program;
    std::string process;
    std::string machine; ///< the unit's machine ID
    std::string host;
    std::string boot;
    std::string realtime;  ///< us since 1970, UTC
    std::string monotonic; ///< us since the boot
};

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

    /// Lets `choose` find the parser for each entry of a journal, oldest first; null leaves the entry out. What is no
    /// journal's stays with the parser above.
    void divide(std::function<LogParser*(const JournalEntry&)> choose) { mChoose = std::move(choose); }

    /// Takes the next block of the log.
    void feed(std::string_view block);

    /// The log has ended: hands over the rest.
    void finish();

    std::uint64_t bytes() const { return mBytes; } ///< taken so far

    /// False when something in an export is no field of an entry.
    bool undamaged() const { return mUndamaged; }

    /// True when the log, or what was taken of it, ends in the middle of a line or of a journal's entry.
    bool cut() const { return mCut; }

    /// True when the log is newest first and too large to be turned round.
    bool tooLarge() const { return mReversed && mHeld.size() > longestReversed; }

private:
    enum class Format { UNKNOWN, PLAIN, FIELDS, VERBOSE, JSON };

    std::string findFormat();
    void take(std::string_view block);
    void takeEntryLine(std::string_view line);
    void takeBinary(std::string_view& block);
    void takeField(std::string_view field);
    void setField(std::string_view name, std::string value);
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
    std::string mBinary;  // the name of the field whose bytes come
    JournalEntry mEntry;
    bool mInEntry = false;
    bool mUndamaged = true;
    bool mCut = false;
    std::function<LogParser*(const JournalEntry&)> mChoose;
};
