/// What a journal puts around a log, and the order of its lines. Input: a byte for the size of the blocks in which the
/// log comes, then the log.
///
/// Blocks must make no difference, whatever the format; and the messages of a journal must be the same in each format
/// of journalctl.

#include "log/dress.h"
#include "Input.h"

#include <algorithm>
#include <cstdint>
#include <sstream>

#include <nlohmann/json.hpp>

namespace
{

/// Writes down what the parser hands over.
class Events : public LogSink
{
public:
    void record(const ParsedRecord& record) override
    {
        mText << record.line << " record " << record.time << '\t' << record.thread << '\t' << record.operation << '\t'
              << record.message.value_or("(none)") << '\n';
    }
    void otherLine(std::uint64_t line, std::string_view program, std::string_view text) override
    {
        expect(text.find('\n') == std::string_view::npos, "one line");
        mText << line << " other " << program << '\t' << text << '\n';
    }
    void torn(std::uint64_t line) override { mText << line << " torn\n"; }

    std::string text() const { return mText.str(); }

private:
    std::ostringstream mText;
};

std::string events(std::string_view log, std::size_t blockSize)
{
    Events sink;
    LogParser parser(sink);
    Dress dress(parser);
    for (std::size_t begin = 0; begin < log.size(); begin += blockSize) {
        dress.feed(log.substr(begin, blockSize));
    }
    dress.finish();
    expect(dress.bytes() == log.size(), "all bytes taken");
    return sink.text();
}

/// Bytes that are no UTF-8 come as numbers.
std::string jsonEntry(const std::string& message)
{
    nlohmann::json entry = {{"SYSLOG_IDENTIFIER", "harl-updater"}, {"_PID", "1"}, {"MESSAGE", message}};
    try {
        return entry.dump() + '\n';
    } catch (const nlohmann::json::type_error&) {
        entry["MESSAGE"] = std::vector<unsigned char>(message.begin(), message.end());
        return entry.dump() + '\n';
    }
}

/// A message as text where it has no control characters, else as bytes.
std::string exportEntry(const std::string& message)
{
    const bool plain = std::none_of(message.begin(), message.end(), [](char byte) { return byte >= 0 && byte < ' '; });
    std::string length;
    for (std::size_t byte = 0; byte < 8; ++byte) {
        length += static_cast<char>(message.size() >> (8 * byte));
    }
    return "__CURSOR=s=1\nSYSLOG_IDENTIFIER=harl-updater\n" +
           (plain ? "MESSAGE=" + message : "MESSAGE\n" + length + message) + "\n_PID=1\n\n";
}

std::string verboseEntry(const std::string& message)
{
    return "Sat 2026-11-21 07:35:33.000000 UTC [s=1;i=1]\n    SYSLOG_IDENTIFIER=harl-updater\n    MESSAGE=" + message +
           "\n    _PID=1\n";
}

std::string shortEntry(const std::string& message)
{
    return "0.0 - harl-updater[1]: " + message + '\n';
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size)
{
    if (size == 0) {
        return 0;
    }
    const std::size_t blockSize = std::size_t{1} + data[0];
    const std::string log(reinterpret_cast<const char*>(data) + 1, size - 1);
    expect(events(log, std::max<std::size_t>(log.size(), 1)) == events(log, blockSize), "blocks make no difference");

    std::string (*const entries[])(const std::string&) = {shortEntry, jsonEntry, exportEntry, verboseEntry};
    std::string logs[4];
    std::istringstream lines("begin\n" + log);
    for (std::string line; std::getline(lines, line);) {
        for (std::size_t format = 0; format < 4; ++format) {
            logs[format] += entries[format](line);
        }
    }
    const std::string expected = events(logs[0], logs[0].size());
    for (const std::string& dressed : logs) {
        expect(events(dressed, blockSize) == expected, "the same in each format");
    }
    return 0;
}
