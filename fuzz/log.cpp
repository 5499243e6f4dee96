/// `harl-updater-tool log`: its parser, its explanation and its reports. Input: a byte for the size of the blocks in
/// which the log comes, then the log.
///
/// Blocks must make no difference, all output must be fit for a terminal, for JSON and for a page, and no log before a
/// whole run may change the explanation of that run.

#include "Input.h"
#include "Printable.h"
#include "log/catalogue.h"
#include "log/follow.h"
#include "log/html.h"
#include "log/json.h"
#include "log/text.h"

#include <algorithm>
#include <fstream>
#include <sstream>

#include <nlohmann/json.hpp>

namespace
{

/// Records what the parser hands over, and checks what must hold for all of it.
class Events : public LogSink
{
public:
    void record(const ParsedRecord& record) override
    {
        // Only after lines of others is it known that a head has no message.
        expect(record.line > mLastRecord, "records in order");
        mLastRecord = record.line;
        mText << '\n' << record.line << " record";
        for (const std::string_view text : {record.thread, record.operation, record.message.value_or("(none)")}) {
            expect(text.find('\n') == std::string_view::npos, "a record's text in one line");
            mText << '\t' << text;
        }
        mText << '\t' << record.time;
    }
    void otherLine(std::uint64_t line, std::string_view program, std::string_view text) override
    {
        expect(text.find('\n') == std::string_view::npos, "one line");
        expect(line >= mLastOther, "lines of others in order");
        mLastOther = line;
        note(line, "other");
        mText << '\t' << program << '\t' << text;
    }
    void torn(std::uint64_t line) override { note(line, "torn"); }

    std::string text() const { return mText.str(); }
    std::uint64_t lastLine() const { return std::max(mLastLine, mLastRecord); }

private:
    void note(std::uint64_t line, const char* kind)
    {
        expect(line > 0, "lines count from 1");
        mLastLine = std::max(mLastLine, line);
        mText << '\n' << line << ' ' << kind;
    }

    std::ostringstream mText;
    std::uint64_t mLastLine = 0;
    std::uint64_t mLastRecord = 0;
    std::uint64_t mLastOther = 0;
};

void feed(LogParser& parser, std::string_view log, std::size_t blockSize)
{
    for (std::size_t begin = 0; begin < log.size(); begin += blockSize) {
        parser.feed(log.substr(begin, blockSize));
    }
    parser.finish();
}

std::string events(std::string_view log, std::size_t blockSize)
{
    Events sink;
    LogParser parser(sink);
    feed(parser, log, blockSize);
    expect(sink.lastLine() <= parser.lines(), "no line after the last");
    expect(parser.lines() == static_cast<std::uint64_t>(std::count(log.begin(), log.end(), '\n')) +
                                 (!log.empty() && log.back() != '\n' ? 1 : 0),
           "all lines counted");
    return sink.text();
}

/// Everything shown of a log; checks what must hold for it.
void expectFitReports(std::string_view log, std::size_t blockSize)
{
    std::ostringstream report;
    std::ostringstream pageText;
    std::ostringstream changes;
    beginPage(pageText);
    Follower follower(true, false, changes);
    RunBuilder builder([&](Run& run) {
        follower.runComplete(run);
        explain(run);
        expect(!run.failure || run.stepOf(*run.failure) != nullptr, "a failure has its step");
        printRun(run, "log", report);
        report << runToJson(run, "log").dump(); // throws when a text is not UTF-8
        writeRunToPage(run, "log", pageText);
    });
    LogParser parser(builder);
    for (std::size_t begin = 0; begin < log.size(); begin += blockSize) {
        parser.feed(log.substr(begin, blockSize));
        const Run* run = builder.current();
        follower.show(run, run == nullptr ? 0 : run->end + 1);
    }
    parser.finish();
    builder.finish();
    endPage(pageText);
    expectPrintable(report.str());
    expectPrintable(pageText.str());
    expectPrintable(changes.str());
}

/// The explanation of the last run of a log, without the places in the log.
std::string lastRun(std::string_view log)
{
    std::string said;
    RunBuilder builder([&](Run& run) {
        const std::uint64_t before = run.firstLine - 1;
        for (Step& step : run.steps) {
            step.line -= before;
        }
        run.lastLine -= before;
        run.firstLine = run.number = 1;
        run.torn = {}; // of pieces in front of the first run
        explain(run);
        said = runToJson(run, "log").dump();
    });
    LogParser parser(builder);
    feed(parser, log, log.size());
    builder.finish();
    return said;
}

std::string fileContent(const std::string& name)
{
    std::ostringstream text;
    text << std::ifstream(name, std::ios::binary).rdbuf();
    expect(!text.str().empty(), name.c_str());
    return text.str();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size)
{
    static const std::string wholeRun = fileContent(GOLDEN_LOG_FOLDER "/mirrors-fail.log");
    static const std::string saidOfIt = lastRun(wholeRun);
    if (size == 0) {
        return 0;
    }
    const std::size_t blockSize = std::size_t{1} + data[0];
    const std::string log(reinterpret_cast<const char*>(data) + 1, size - 1);

    expect(events(log, std::max<std::size_t>(log.size(), 1)) == events(log, blockSize), "blocks make no difference");
    expectFitReports(log, 64 * blockSize);
    expect(lastRun(log + '\n' + wholeRun) == saidOfIt, "a whole run is explained as it is");
    return 0;
}
