#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

/// One record of the updater's log. The texts are valid during the call that hands the record over.
struct ParsedRecord
{
    std::uint64_t line = 0;                  ///< of the record's first line, from 1
    std::int64_t time = 0;                   ///< local time in seconds since 1970, as if local time were UTC
    std::string_view thread;                 ///< the thread's id as logged
    std::string_view operation;              ///< bare name of the function, such as "updateMirrors"
    std::optional<std::string_view> message; ///< without indentation and line end; none: it is not in the log
    bool cut = false;                        ///< The log ends in the message, which may lack its end.
};

/// Takes what a LogParser finds, in the order of the log; but that a head has no message is known only behind lines of
/// others, so its record comes after them.
class LogSink
{
public:
    virtual ~LogSink() = default;
    virtual void record(const ParsedRecord& record) = 0;

    /// A line that is no record: of a tool that the updater ran, of the service manager, or the rest of a message of
    /// several lines.
    ///
    /// @param program  the name in a journal's prefix; empty without such a prefix
    virtual void otherLine(std::uint64_t line, std::string_view program, std::string_view text) = 0;

    /// A record, or a piece of one, that is not whole. What can be read of it is handed over as a record or other line.
    virtual void torn(std::uint64_t line) = 0;
};

/// Finds the updater's records in a text that comes in blocks of any size.
///
/// A record is "Updater | DD-MM-YYYY HH-MM-SS", thread, FILE:LINE and function with tabs between, and on the next line
/// three tabs and the message (see common/src/Log.h). Each line may begin with what a journal (journalctl -o short,
/// short-iso, short-precise and the like, in any locale), a system logger or a console adds; colours, other blanks and
/// empty lines between make no difference. A record may begin in the middle of a line, after the unfinished output of
/// another program.
///
/// Memory stays below three blocks whatever the text: of a line, the first longestLine bytes count.
class LogParser
{
public:
    static constexpr std::size_t longestLine = 65536; // bytes

    explicit LogParser(LogSink& sink) : mSink(sink) {}

    /// Takes the next block. Hands over all that is complete in it.
    void feed(std::string_view block);

    /// The text has ended: hands over the rest.
    void finish();

    std::uint64_t lines() const { return mLines; }     ///< handled so far
    std::uint64_t records() const { return mRecords; } ///< found so far

private:
    void takeLine(std::string_view line);
    void takeText(std::string_view line, std::size_t indentation);
    void closeHead(bool leftOut);
    void takeMessage(std::optional<std::string_view> message);
    bool parseHead(std::string_view text);
    bool parseTime(std::string_view text);

    LogSink& mSink;
    std::string mPartialLine; // bytes of the line that has not ended yet, longestLine at most
    std::uint64_t mLines = 0;
    std::uint64_t mRecords = 0;

    ParsedRecord mHead; // with texts in mHeadText; its message has not come yet if mHeadOpen
    std::string mHeadText;
    std::size_t mPrefixLength = 0; // bytes in front of the head
    bool mHeadOpen = false;
    bool mEmptySeen = false; // an empty line after the head
    bool mCut = false;
    bool mIndented = false; // some message was
    std::string mPlain;     // what plain() has made of a line

    std::string mDate; // of the last head, and the time its day began
    std::int64_t mMidnight = 0;
};
