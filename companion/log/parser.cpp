#include "log/parser.h"

#include "log/vocabulary.h"

#include <algorithm>
#include <ctime>
#include <numeric>

namespace
{

const std::string_view mark = "Updater | ";
const std::size_t longestPrefix = 200;                   // bytes of a journal's prefix
const std::string_view timeForm = "00-00-0000 00-00-00"; // DD-MM-YYYY HH-MM-SS

bool isDigit(char character)
{
    return character >= '0' && character <= '9';
}

/// The number that the decimal digits of `text` from `begin` to `end` stand for.
int number(std::string_view text, std::size_t begin, std::size_t end)
{
    const auto append = [](int value, char digit) { return value * 10 + (digit - '0'); };
    return std::accumulate(text.begin() + begin, text.begin() + end, 0, append);
}

std::string_view withoutBlanks(std::string_view text)
{
    while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) { // of every line: faster than to search
        text.remove_prefix(1);
    }
    return text;
}

/// Takes the text up to the next blanks, of which a journal or a copy through a terminal may make more or fewer, off
/// `text`.
bool takeColumn(std::string_view& text, std::string_view& column)
{
    const auto isBlank = [](char character) { return character == ' ' || character == '\t'; };
    const auto end = static_cast<std::size_t>(std::find_if(text.begin(), text.end(), isBlank) - text.begin());
    if (end == text.size() || end == 0) { // of every record: faster than find_first_of()
        return false;
    }
    column = text.substr(0, end);
    text = withoutBlanks(text.substr(end));
    return true;
}

/// "updateMirrors" of "static bool UpdateManager::updateMirrors()".
std::string_view bareName(std::string_view function)
{
    function = function.substr(0, function.find('('));
    return function.substr(function.find_last_of(": ") + 1);
}

/// Length of the indentation of a message at the start of `text`: three tabs, or what a journal makes of them; else 0.
std::size_t indentationOf(std::string_view text)
{
    static const std::string blanks(24, ' ');
    if (startsWith(text, "\t\t\t")) {
        return 3;
    }
    return startsWith(text, blanks) ? blanks.size() : 0;
}

/// True when `text` holds a time: "07:15" or "12.345".
bool hasTime(std::string_view text)
{
    for (std::size_t index = 1; index + 2 < text.size(); ++index) {
        if ((text[index] == ':' || text[index] == '.') && isDigit(text[index - 1]) && isDigit(text[index + 1])) {
            return true;
        }
    }
    return false;
}

/// True for what a console may put in front of each line: a time, such as "[07:15:33.123] " or "[   12.345678] ".
bool isConsolePrefix(std::string_view text)
{
    return !text.empty() && text.size() <= longestPrefix && text.back() == ' ' && hasTime(text);
}

/// `line` without what a terminal's colours or a system logger (a control character as "#" and its octal number) add;
/// in `buffer` if there was anything.
std::string_view plain(std::string_view line, std::string& buffer)
{
    static const char escape = '\x1b';
    const bool logged = contains(line, "#0");
    if (!logged && line.find(escape) == std::string_view::npos) {
        return line;
    }
    buffer.clear();
    while (!line.empty()) {
        const bool encoded = startsWith(line, "#033");
        if (line.front() == escape || encoded) {
            line.remove_prefix(encoded ? 4 : 1);
            if (startsWith(line, "[")) { // up to the final byte of a control sequence, ECMA-48
                const std::size_t end = line.find_first_not_of("0123456789;?", 1);
                line.remove_prefix(std::min(end, line.size() - 1) + 1);
            }
        } else if (startsWith(line, "#011")) {
            buffer += '\t';
            line.remove_prefix(4);
        } else {
            buffer += line.front();
            line.remove_prefix(1);
        }
    }
    return buffer;
}

/// True for what journalctl shows instead of a message with characters that do not print.
bool isHiddenMessage(std::string_view text)
{
    static const std::string_view end = "B blob data]";
    return text.size() > end.size() && text.front() == '[' && text.substr(text.size() - end.size()) == end;
}

/// Removes what a journal puts in front of a line, "Nov 21 07:15:33 unit ssh[123]: " or with another form of the time.
///
/// @param program  out: "ssh" in the example; empty when there is no such prefix
std::string_view withoutJournalPrefix(std::string_view line, std::string_view& program)
{
    program = {};
    // The time comes first, in the words of some locale. Blanks at the line's end may be gone.
    std::size_t end = line.substr(0, longestPrefix).find("]: ");
    if (end == std::string_view::npos && !line.empty() && line.size() <= longestPrefix &&
        line.substr(line.size() - std::min<std::size_t>(line.size(), 2)) == "]:") {
        end = line.size() - 2;
    }
    if (end == std::string_view::npos || !hasTime(line.substr(0, end))) {
        return line;
    }
    std::size_t digits = end;
    while (digits > 0 && isDigit(line[digits - 1])) {
        --digits;
    }
    if (digits == end || digits < 2 || line[digits - 1] != '[') {
        return line;
    }
    const std::string_view front = line.substr(0, digits - 1);
    const std::size_t blank = front.rfind(' ');
    if (blank == std::string_view::npos || blank + 1 == front.size()) {
        return line;
    }
    program = front.substr(blank + 1);
    return line.substr(std::min(end + 3, line.size()));
}

} // namespace

void LogParser::feed(std::string_view block)
{
    while (!block.empty()) {
        const std::size_t end = block.find('\n');
        const bool ends = end != std::string_view::npos;
        const std::string_view line = block.substr(0, end);
        if (ends && mPartialLine.empty()) {
            takeLine(line.substr(0, longestLine));
        } else {
            mPartialLine.append(line.substr(0, longestLine - mPartialLine.size()));
            if (ends) {
                takeLine(mPartialLine);
                mPartialLine.clear();
            }
        }
        block.remove_prefix(line.size() + (ends ? 1 : 0));
    }
}

void LogParser::finish()
{
    if (!mPartialLine.empty()) {
        mCut = true; // what is missing of it may be a digit
        takeLine(mPartialLine);
        mPartialLine.clear();
    }
    closeHead(false);
}

void LogParser::takeLine(std::string_view line)
{
    ++mLines;
    line = plain(line, mPlain);
    line = line.substr(0, line.find_last_not_of('\r') + 1); // ssh(1) has a carriage return in front of a colour's end

    std::size_t position = startsWith(line, mark) ? 0 : line.find(mark);
    if (position == std::string_view::npos) {
        takeText(line, indentationOf(line));
        return;
    }
    // Of two heads in one line, the writing of the first was interrupted.
    for (std::size_t next = position; next != std::string_view::npos; next = line.find(mark, next + mark.size())) {
        position = next;
    }
    std::string_view program;
    const std::string_view front = line.substr(0, position);
    const std::string_view before = withoutJournalPrefix(front, program);
    const bool interrupted = contains(before, mark);
    if (!interrupted && !withoutBlanks(before).empty() && !isConsolePrefix(before)) {
        takeText(front, indentationOf(front)); // a line that another program, or a message, has not ended
    }
    closeHead(!program.empty());
    if (interrupted) {
        mSink.torn(mLines);
    }
    if (!parseHead(line.substr(position))) {
        mSink.torn(mLines);
        return;
    }
    mPrefixLength = position;
    mHead.line = mLines;
    mHeadOpen = true;
    mEmptySeen = false;
}

/// A line without a head: a message when one is awaited, else another program's.
void LogParser::takeText(std::string_view line, std::size_t indentation)
{
    std::string_view program;
    std::string_view text = line;
    if (indentation == 0) {
        text = withoutJournalPrefix(line, program);
        indentation = indentationOf(text);
    }
    if (indentation == 0 && mHeadOpen && mPrefixLength > 0) {
        // Some console's prefix: as long as the one of the head, or nearly.
        const std::size_t tabs = line.substr(0, mPrefixLength + 8).find("\t\t\t");
        if (tabs != std::string_view::npos) {
            text = line.substr(tabs);
            indentation = 3;
        }
    }
    if (indentation == 0 && program.empty() && mPrefixLength > 0 && isConsolePrefix(line.substr(0, mPrefixLength))) {
        text = line.substr(std::min(mPrefixLength, line.size()));
    }
    const std::string_view words = withoutBlanks(text);
    mIndented = mIndented || (indentation != 0 && !words.empty());
    if (mHeadOpen && indentation != 0) {
        takeMessage(text.substr(indentation));
    } else if (mHeadOpen && words.empty() && !mCut) {
        mEmptySeen = true; // the message without its blanks, or a line that a copy has put in
    } else if (mHeadOpen && isMessageOf(mHead.operation, words, !mIndented)) {
        takeMessage(words); // its blanks are gone
    } else if (mHeadOpen && isHiddenMessage(text)) {
        closeHead(true);
    } else if (indentation != 0 && !words.empty() && (indentation == 3 || mRecords == 0)) {
        mSink.torn(mLines);      // a message whose head is not there
    } else if (!words.empty()) { // also between a head and its message
        mSink.otherLine(mLines, program, text);
    }
}

/// The head's message does not come any more.
///
/// @param leftOut  a journal has left it out
void LogParser::closeHead(bool leftOut)
{
    if (!mHeadOpen) {
        return;
    }
    if (!mEmptySeen && !leftOut) {
        mSink.torn(mHead.line);
    }
    takeMessage(mEmptySeen ? std::optional(std::string_view()) : std::nullopt);
}

/// The message of mHead has come, or does not come any more: the record is complete.
void LogParser::takeMessage(std::optional<std::string_view> message)
{
    mHeadOpen = false;
    ++mRecords;
    mHead.message = message;
    mHead.cut = mCut;
    mSink.record(mHead);
}

/// Reads a record's first line, from its mark on, into mHead. False, and mHead is of no use, when it is not whole.
bool LogParser::parseHead(std::string_view text)
{
    mHeadText = text.substr(mark.size());
    const std::string_view time = std::string_view(mHeadText).substr(0, timeForm.size());
    std::string_view rest = withoutBlanks(std::string_view(mHeadText).substr(time.size()));
    std::string_view position;
    if (!parseTime(time) || !takeColumn(rest, mHead.thread) || !takeColumn(rest, position)) {
        return false;
    }
    rest = rest.substr(0, rest.find_last_not_of(" \t") + 1);
    if (!contains(position, ":") || rest.empty() || rest.back() != ')') {
        return false;
    }
    mHead.operation = bareName(rest);
    return !mHead.operation.empty();
}

/// Reads "DD-MM-YYYY HH-MM-SS" into mHead.
bool LogParser::parseTime(std::string_view text)
{
    if (text.size() != timeForm.size()) {
        return false;
    }
    const bool sameDay = text.substr(0, 10) == mDate;
    const std::size_t begin = sameDay ? 10 : 0; // a day that is known has its form
    const auto hasForm = [](char it, char wanted) { return wanted == '0' ? isDigit(it) : it == wanted; };
    if (!std::equal(text.begin() + begin, text.end(), timeForm.begin() + begin, hasForm)) {
        return false;
    }
    const int hour = number(text, 11, 13);
    const int minute = number(text, 14, 16);
    const int second = number(text, 17, 19);
    if (hour > 23 || minute > 59 || second > 60) {
        return false;
    }
    if (!sameDay) {
        std::tm date = {};
        date.tm_mday = number(text, 0, 2);
        date.tm_mon = number(text, 3, 5) - 1;
        date.tm_year = number(text, 6, 10) - 1900;
        if (date.tm_mday < 1 || date.tm_mday > 31 || date.tm_mon < 0 || date.tm_mon > 11) {
            return false;
        }
        mDate = text.substr(0, 10);
        mMidnight = timegm(&date);
    }
    mHead.time = mMidnight + hour * std::int64_t{3600} + minute * std::int64_t{60} + second;
    return true;
}
