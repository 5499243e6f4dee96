/// What a journal puts around a log, and the order of its lines. Input: a byte for the size of the blocks in which the
/// log comes, then the log.
///
/// Blocks must make no difference, whatever the format; the messages of a journal must be the same in each format of
/// journalctl; and what is said of the log's runs must be the same in every dress.

#include "log/dress.h"
#include "Input.h"
#include "log/catalogue.h"
#include "log/json.h"
#include "log/run.h"

#include <algorithm>
#include <cstdint>
#include <ctime>
#include <iomanip>
#include <sstream>
#include <vector>

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

/// Gathers the records that say something, as lines: those in which no byte could be part of a dress. Others do not
/// tell the order of a log's lines.
class Records : public LogSink
{
public:
    void record(const ParsedRecord& record) override
    {
        const std::string_view message = record.message.value_or("");
        const std::string_view parts[] = {record.thread, record.operation, message};
        const bool plain = std::all_of(std::begin(parts), std::end(parts), [](std::string_view part) {
            return !part.empty() && part.find('#') == std::string_view::npos &&
                   std::all_of(part.begin(), part.end(), [](char byte) { return byte >= ' ' && byte <= '~'; });
        });
        const bool says = meaningOf(record.operation, record.message).event != Event::NONE;
        if (!plain || !says || message.front() == ' ' || message.back() == ' ') {
            return;
        }
        std::ostringstream head;
        const auto time = static_cast<std::time_t>(record.time);
        head << "Updater | " << std::put_time(std::gmtime(&time), "%d-%m-%Y %H-%M-%S") << '\t' << record.thread << '\t'
             << "file:1\tvoid " << record.operation << "()";
        lines.push_back(head.str());
        lines.push_back("\t\t\t" + std::string(message));
    }
    void otherLine(std::uint64_t, std::string_view, std::string_view) override {}
    void torn(std::uint64_t) override {}

    std::vector<std::string> lines;
};

/// What is said of the runs, without their places in the log.
std::string said(std::string_view log, std::size_t blockSize)
{
    std::string text;
    RunBuilder builder([&](Run& run) {
        explain(run);
        run.firstLine = run.lastLine = run.torn.firstLine = 0;
        for (Step& step : run.steps) {
            step.line = 0;
        }
        text += runToJson(run, "").dump() + '\n';
    });
    LogParser parser(builder);
    Dress dress(parser);
    for (std::size_t begin = 0; begin < log.size(); begin += blockSize) {
        dress.feed(log.substr(begin, blockSize));
    }
    dress.finish();
    builder.finish();
    return text;
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

/// As rsyslogd(8) writes it.
std::string loggedLine(const std::string& line)
{
    std::string result = "Nov 21 07:35:33 unit harl-updater[1]: ";
    for (const char byte : line) {
        result += byte == '\t' ? "#011" : std::string(1, byte);
    }
    return result + '\n';
}

std::string colouredLine(const std::string& line)
{
    return "\x1b[0;1;31m" + line + "\x1b[0m\n";
}

std::string spacedLine(const std::string& line)
{
    return line + "\n\n";
}

std::string plainLine(const std::string& line)
{
    return line + '\n';
}

std::string dressed(const std::vector<std::string>& lines, std::string (*dress)(const std::string&))
{
    std::string log;
    for (const std::string& line : lines) {
        log += dress(line);
    }
    return log;
}

/// The log's records in every dress; newest first too.
void expectSameFacts(std::string_view log, std::size_t blockSize)
{
    Records records;
    LogParser parser(records);
    parser.feed(log);
    parser.finish();
    std::vector<std::string>& lines = records.lines;
    const std::string expected = said(dressed(lines, plainLine), blockSize);
    for (const auto dress : {jsonEntry, exportEntry, verboseEntry, shortEntry, loggedLine, colouredLine, spacedLine}) {
        expect(said(dressed(lines, dress), blockSize) == expected, "the same facts in each dress");
    }
    std::reverse(lines.begin(), lines.end());
    expect(said(dressed(lines, plainLine), blockSize) == expected, "the same facts newest first");
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
    for (const std::string& text : logs) {
        expect(events(text, blockSize) == expected, "the same in each format");
    }
    expectSameFacts(log, blockSize);
    return 0;
}
