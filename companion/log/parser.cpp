#include "log/parser.h"

#include <algorithm>
#include <cstring>

namespace
{

const std::string_view mark = "Updater | ";
const std::size_t longestPrefix = 200; // bytes of a journal's prefix

bool startsWith(std::string_view text, std::string_view start)
{
    return text.substr(0, start.size()) == start;
}

bool isDigit(char character)
{
    return character >= '0' && character <= '9';
}

/// The number that `digits` decimal digits of `text` at `position` stand for, -1 if they are no digits.
int number(std::string_view text, std::size_t position, std::size_t digits)
{
    int value = 0;
    for (std::size_t index = position; index < position + digits; ++index) {
        if (!isDigit(text[index])) {
            return -1;
        }
        value = value * 10 + (text[index] - '0');
    }
    return value;
}

/// Days from 1970-01-01 to a date of the Gregorian calendar.
std::int64_t daysSinceEpoch(std::int64_t year, int month, int day)
{
    // The year is made to begin in March, so that the leap day is its last.
    year -= month <= 2 ? 1 : 0;
    const std::int64_t dayOfYear = (153 * (month + (month > 2 ? -3 : 9)) + 2) / 5 + day - 1;
    return year * 365 + year / 4 - year / 100 + year / 400 + dayOfYear - 719468;
}

/// Takes the text up to the next tab, or up to the eight blanks that a journal makes of one, off `text`.
bool takeColumn(std::string_view& text, std::string_view& column)
{
    std::size_t end = text.find('\t');
    std::size_t separator = 1;
    if (end == std::string_view::npos) {
        end = text.find("        ");
        separator = 8;
    }
    if (end == std::string_view::npos || end == 0) {
        return false;
    }
    column = text.substr(0, end);
    text.remove_prefix(end + separator);
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

/// True for what a console may put in front of each line: a time, such as "[07:15:33.123] " or "[   12.345678] ".
bool isConsolePrefix(std::string_view text)
{
    if (text.empty() || text.size() > longestPrefix || text.back() != ' ') {
        return false;
    }
    for (std::size_t index = 1; index + 2 < text.size(); ++index) {
        if ((text[index] == ':' || text[index] == '.') && isDigit(text[index - 1]) && isDigit(text[index + 1])) {
            return true;
        }
    }
    return false;
}

/// True for what journalctl shows instead of a message with characters that do not print.
bool isHiddenMessage(std::string_view text)
{
    static const std::string_view end = "B blob data]";
    return text.size() > end.size() && text.front() == '[' && text.substr(text.size() - end.size()) == end;
}

std::string_view withoutLineEnd(std::string_view line)
{
    while (!line.empty() && line.back() == '\r') {
        line.remove_suffix(1);
    }
    return line;
}

} // namespace

std::string_view withoutJournalPrefix(std::string_view line, std::string_view& program)
{
    program = {};
    // The time comes first; a line of another program seldom begins in these ways and then holds no "[123]: ".
    const char first = line.empty() ? '\0' : line.front();
    if (!isDigit(first) && first != '[' && (first < 'A' || first > 'Z')) {
        return line;
    }
    const std::size_t end = line.substr(0, longestPrefix).find("]: ");
    if (end == std::string_view::npos) {
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
    return line.substr(end + 3);
}

void LogParser::feed(std::string_view block)
{
    mBytes += block.size();
    while (!block.empty()) {
        const void* found = std::memchr(block.data(), '\n', block.size());
        const std::size_t length =
            found == nullptr ? block.size() : static_cast<std::size_t>(static_cast<const char*>(found) - block.data());
        if (found != nullptr && mPartialLine.empty()) {
            takeLine(block.substr(0, std::min(length, longestLine)));
        } else {
            mPartialLine.append(block.substr(0, std::min(length, longestLine - mPartialLine.size())));
            if (found != nullptr) {
                takeLine(mPartialLine);
                mPartialLine.clear();
            }
        }
        block.remove_prefix(std::min(length + 1, block.size()));
    }
}

void LogParser::finish()
{
    if (!mPartialLine.empty()) {
        takeLine(mPartialLine);
        mPartialLine.clear();
    }
    if (mHeadOpen) {
        mSink.torn(mHead.line);
        takeMessage({});
    }
}

void LogParser::takeLine(std::string_view line)
{
    ++mLines;
    line = withoutLineEnd(line);

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
    const bool interrupted = before.find(mark) != std::string_view::npos;
    if (!interrupted && !before.empty() && !isConsolePrefix(before)) {
        takeText(front, indentationOf(front)); // a line that another program, or a message, has not ended
    }
    if (mHeadOpen) {
        // A journal may leave out the line of an empty message.
        if (program.empty()) {
            mSink.torn(mHead.line);
        }
        takeMessage({});
    }
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
    if (mHeadOpen && indentation != 0) {
        takeMessage(text.substr(indentation));
        return;
    }
    if (mHeadOpen && isHiddenMessage(text)) {
        takeMessage({});
        return;
    }
    if (mHeadOpen) {
        mSink.torn(mHead.line);
        takeMessage({});
    } else if (indentation != 0 && mRecords == 0) {
        mSink.torn(mLines); // the log begins in the middle of a record
        return;
    }
    if (!text.empty()) {
        mSink.otherLine(mLines, program, text);
    }
}

/// The message of mHead has come: the record is complete.
void LogParser::takeMessage(std::string_view message)
{
    mHeadOpen = false;
    ++mRecords;
    mHead.message = message;
    mSink.record(mHead);
}

/// Reads a record's first line, from its mark on, into mHead. False, and mHead is of no use, when it is not whole.
bool LogParser::parseHead(std::string_view text)
{
    mHeadText.assign(text);
    std::string_view rest = mHeadText;
    std::string_view time;
    std::string_view position;
    rest.remove_prefix(mark.size());
    if (!takeColumn(rest, time) || !parseTime(time) || !takeColumn(rest, mHead.thread) || !takeColumn(rest, position)) {
        return false;
    }
    const std::size_t colon = position.rfind(':');
    if (colon == std::string_view::npos || rest.empty() || rest.back() != ')') {
        return false;
    }
    mHead.file = position.substr(0, colon);
    mHead.operation = bareName(rest);
    return !mHead.operation.empty();
}

/// Reads "DD-MM-YYYY HH-MM-SS" into mHead.
bool LogParser::parseTime(std::string_view text)
{
    if (text.size() != 19 || text[10] != ' ' || text[13] != '-' || text[16] != '-') {
        return false;
    }
    const int hour = number(text, 11, 2);
    const int minute = number(text, 14, 2);
    const int second = number(text, 17, 2);
    if (hour < 0 || hour > 23 || minute < 0 || minute > 59 || second < 0 || second > 60) {
        return false;
    }
    if (text.substr(0, 10) != mDate) {
        const int day = number(text, 0, 2);
        const int month = number(text, 3, 2);
        const int year = number(text, 6, 4);
        if (text[2] != '-' || text[5] != '-' || day < 1 || day > 31 || month < 1 || month > 12 || year < 0) {
            return false;
        }
        mDate = text.substr(0, 10);
        mMidnight = daysSinceEpoch(year, month, day) * 86400;
    }
    mHead.time = mMidnight + hour * std::int64_t{3600} + minute * std::int64_t{60} + second;
    return true;
}
