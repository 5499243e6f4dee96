#include "log/dress.h"

#include "log/vocabulary.h"

#include <algorithm>
#include <cstring>

#include <endian.h>
#include <nlohmann/json.hpp>

namespace
{

const std::size_t enoughOfALine = 300;                     // bytes, to find out the format
const std::size_t enoughToJudge = std::size_t{128} * 1024; // bytes, to find out the order of the lines

const std::pair<std::string_view, std::string JournalEntry::*> fields[] = {
    {"MESSAGE", &JournalEntry::message},
    {"SYSLOG_IDENTIFIER", &JournalEntry::program},
    {"_PID", &JournalEntry::process},
    {"_MACHINE_ID", &JournalEntry::machine},
    {"_HOSTNAME", &JournalEntry::host},
    {"_BOOT_ID", &JournalEntry::boot},
    {"__REALTIME_TIMESTAMP", &JournalEntry::realtime},
    {"__MONOTONIC_TIMESTAMP", &JournalEntry::monotonic},
};

/// Counts the records that say something.
class Counter : public LogSink
{
public:
    void record(const ParsedRecord& record) override
    {
        count += record.message && meaningOf(record.operation, record.message).event != Event::NONE ? 1 : 0;
    }
    void otherLine(std::uint64_t, std::string_view, std::string_view) override {}
    void torn(std::uint64_t) override {}

    std::uint64_t count = 0;
};

std::uint64_t recordsIn(std::string_view text)
{
    Counter counter;
    LogParser parser(counter);
    parser.feed(text);
    parser.finish();
    return counter.count;
}

/// The lines of `text`, last one first.
std::string turnedRound(std::string_view text)
{
    std::string result;
    result.reserve(text.size() + 1);
    while (!text.empty()) {
        if (text.back() == '\n') {
            text.remove_suffix(1);
        }
        const std::size_t begin = text.rfind('\n') + 1; // 0 without one
        result.append(text.substr(begin)).append("\n");
        text = text.substr(0, begin);
    }
    return result;
}

/// A journal field's value; bytes that are no text come as numbers.
std::string valueOf(const nlohmann::json& entry, const char* name)
{
    const auto field = entry.find(name);
    if (field == entry.end()) {
        return "";
    }
    if (field->is_string()) {
        return field->get<std::string>();
    }
    std::string bytes;
    for (const auto& byte : field->is_array() ? *field : nlohmann::json::array()) {
        bytes += byte.is_number_unsigned() ? static_cast<char>(byte.get<unsigned>()) : ' ';
    }
    return bytes;
}

} // namespace

void Dress::feed(std::string_view block)
{
    mBytes += block.size();
    mCut = block.empty() ? mCut : block.back() != '\n';
    std::string start;
    if (mFormat == Format::UNKNOWN) { // what the first line tells
        mPartial.append(block);
        if (mPartial.size() < enoughOfALine && mPartial.find('\n') == std::string::npos) {
            return;
        }
        block = start = findFormat();
    }
    take(block);
}

/// Finds the format out. Returns what was taken of the log so far.
std::string Dress::findFormat()
{
    const std::string_view line = std::string_view(mPartial).substr(0, std::min(mPartial.find('\n'), enoughOfALine));
    const bool json = startsWith(line, "{") || startsWith(line, "data: {") || startsWith(line, "\x1e");
    mFormat = startsWith(line, "__CURSOR=") ? Format::FIELDS
              : json                        ? Format::JSON
              : contains(line, "[s=")       ? Format::VERBOSE
                                            : Format::PLAIN;
    return std::exchange(mPartial, "");
}

void Dress::take(std::string_view block)
{
    if (mFormat == Format::PLAIN) {
        hand(block);
        return;
    }
    while (!block.empty()) {
        if (!mBinary.empty()) {
            takeBinary(block);
            continue;
        }
        const std::size_t end = block.find('\n');
        mPartial.append(block.substr(0, end));
        if (mPartial.size() > 4 * LogParser::longestLine) {
            mPartial.resize(4 * LogParser::longestLine);
        }
        block.remove_prefix(std::min(end == std::string_view::npos ? block.size() : end + 1, block.size()));
        if (end != std::string_view::npos) {
            takeEntryLine(mPartial);
            mPartial.clear();
        }
    }
}

void Dress::finish()
{
    if (mFormat == Format::UNKNOWN) {
        take(findFormat());
    }
    mCut = mCut || mInEntry || !mBinary.empty();
    if (mFormat != Format::PLAIN) {
        takeEntryLine(mPartial);
        endEntry();
    }
    const std::string held = std::exchange(mHeld, "");
    const bool reversed = mReversed || (!mOrderKnown && recordsIn(turnedRound(held)) > recordsIn(held));
    mParser.feed(reversed ? turnedRound(held) : held);
    mParser.finish();
}

/// Takes a line of a journal's entry.
void Dress::takeEntryLine(std::string_view line)
{
    if (mFormat == Format::JSON) {
        for (const std::string_view mark : {"data: ", "\x1e"}) {
            line.remove_prefix(startsWith(line, mark) ? mark.size() : 0);
        }
        mObject.append(line);
        if (mObject.size() > 16 * LogParser::longestLine) {
            mObject.clear();
        }
        if (line.empty() || line.back() != '}') {
            return;
        }
        const nlohmann::json entry = nlohmann::json::parse(mObject, nullptr, false);
        if (entry.is_object()) {
            for (const auto& [name, member] : fields) {
                mEntry.*member = valueOf(entry, name.data());
            }
            mEntry.message += '\n';
            mObject.clear();
            endEntry();
        } else if (startsWith(line, "{")) {
            mObject.clear(); // one that is cut off
        }
        return;
    }
    const bool ends = mFormat == Format::VERBOSE ? !line.empty() && line.front() != ' ' : line.empty();
    if (ends) {
        endEntry();
    } else {
        takeField(line.substr(std::min(line.find_first_not_of(mFormat == Format::VERBOSE ? " " : ""), line.size())));
    }
}

/// Takes what `block` has of a field that is no plain text: its length in eight bytes, the lowest first, its bytes, and
/// a line end.
void Dress::takeBinary(std::string_view& block)
{
    const std::size_t lengthSize = 8;
    std::size_t wanted = lengthSize;
    if (mPartial.size() >= lengthSize) {
        std::uint64_t length = 0;
        std::memcpy(&length, mPartial.data(), sizeof length);
        wanted += static_cast<std::size_t>(std::min<std::uint64_t>(le64toh(length), 4 * LogParser::longestLine)) + 1;
    }
    const std::size_t taken = std::min(wanted - mPartial.size(), block.size());
    mPartial.append(block.substr(0, taken));
    block.remove_prefix(taken);
    if (mPartial.size() == wanted && wanted > lengthSize) {
        mPartial.pop_back();
        setField(mBinary, mPartial.substr(lengthSize));
        mBinary.clear();
        mPartial.clear();
    }
}

void Dress::takeField(std::string_view field)
{
    static const std::string_view nameBytes = "ABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789_";
    const std::size_t end = field.find('=');
    const std::string_view name = field.substr(0, end);
    if (name == "__CURSOR" && mInEntry) { // the entry before lacks its end
        mUndamaged = false;
        mEntry = {};
    }
    mInEntry = true;
    if (name.empty() || name.find_first_not_of(nameBytes) != std::string_view::npos) {
        mUndamaged = mUndamaged && mFormat != Format::FIELDS;
    } else if (end != std::string_view::npos) {
        setField(name, std::string(field.substr(end + 1)));
    } else if (mFormat == Format::FIELDS) {
        mBinary = name;
    }
}

void Dress::setField(std::string_view name, std::string value)
{
    for (const auto& [known, member] : fields) {
        if (name == known) {
            mEntry.*member = std::move(value);
            mEntry.message += name == "MESSAGE" ? "\n" : "";
            return;
        }
    }
}

/// Hands over an entry as journalctl's short formats show it.
void Dress::endEntry()
{
    LogParser* const chosen = mChoose && !mEntry.message.empty() ? mChoose(mEntry) : nullptr;
    if (!mEntry.message.empty() && (chosen != nullptr || !mChoose)) {
        const std::string process = mEntry.process.empty() ? "0" : mEntry.process;
        const std::string line = "0.0 - " + mEntry.program + '[' + process + "]: " + mEntry.message;
        mChoose ? chosen->feed(line) : hand(line);
    }
    for (const auto& [name, member] : fields) {
        (mEntry.*member).clear();
    }
    mInEntry = false;
}

/// Hands text to the parser once the order of its lines is known.
void Dress::hand(std::string_view text)
{
    if (mOrderKnown && !mReversed) {
        mParser.feed(text);
        return;
    }
    if (!tooLarge()) {
        mHeld.append(text);
    }
    if (!mOrderKnown && mHeld.size() >= enoughToJudge) {
        mOrderKnown = true;
        mReversed = recordsIn(turnedRound(mHeld)) > recordsIn(mHeld);
        if (!mReversed) {
            mParser.feed(std::exchange(mHeld, ""));
        }
    }
}
