#include "log/log_command.h"

#include "descriptor.h"
#include "findings.h"
#include "log/catalogue.h"
#include "log/dress.h"
#include "log/follow.h"
#include "log/html.h"
#include "log/json.h"
#include "log/parser.h"
#include "log/run.h"
#include "log/source.h"
#include "log/text.h"
#include "page_file.h"
#include "procedure.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <optional>
#include <ostream>
#include <vector>

#include <nlohmann/json.hpp>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

namespace
{

using Json = nlohmann::ordered_json;

const int pollTime = 250; // ms between two looks at a file, and at the clock
const int settleTime = 2; // s, at most, for the earlier runs in a pipe

/// What an input that holds no text begins with, and what to do about it.
const std::pair<std::string_view, const char*> magics[] = {
    {"LPKSHHRH", "a journal's own file: journalctl --file FILE -u harl-updater | harl-updater-tool log"},
    {"\x1f\x8b", "compressed: zcat FILE | harl-updater-tool log"},
    {"\xfd\x37zXZ", "compressed: xzcat FILE | harl-updater-tool log"},
    {"\x28\xb5\x2f\xfd", "compressed: zstdcat FILE | harl-updater-tool log"},
    {"BZh", "compressed: bzcat FILE | harl-updater-tool log"},
    {"PK\x03\x04", "an archive: unzip -p FILE | harl-updater-tool log"},
    {"\xff\xfe", "text in UTF-16: iconv -f UTF-16 -t UTF-8 FILE | harl-updater-tool log"},
    {"\xfe\xff", "text in UTF-16: iconv -f UTF-16 -t UTF-8 FILE | harl-updater-tool log"},
};

/// Reads one of the sources that the options name, block by block, into a parser.
class Reader
{
public:
    explicit Reader(LogSink& sink) : mParser(sink), mDress(mParser), mBlock(LogSource::blockSize) {}

    /// Opens the source number `index`. False when that fails.
    bool open(const LogOptions& options, std::size_t index, std::ostream& err)
    {
        mJournal = options.journal;
        std::vector<std::string> command = journalCommand;
        if (options.follow) {
            command.insert(command.end(), {"--follow", "--no-tail"});
        }
        mError = mJournal ? mSource.openProgram(command, "the journal of harl-updater", true)
                          : mSource.openFile(options.files.empty() ? "-" : options.files[index]);
        if (mError.empty() && isatty(mSource.descriptor()) == 1) {
            err << "harl-updater-tool: reading the log from the terminal; end it with Ctrl-D.\n";
        }
        return mError.empty();
    }

    /// Reads one block. False at the source's end for now, and when something is wrong.
    bool readBlock()
    {
        const ssize_t length = mSource.read(mBlock);
        if (length < 0) {
            mError = position() + std::strerror(errno);
        }
        if (length <= 0) {
            return false;
        }
        const std::string_view text(mBlock.data(), static_cast<std::size_t>(length));
        for (const auto& [magic, advice] : magics) {
            if (bytes() == 0 && startsWith(text, magic)) {
                mError = position() + "no log but " + advice;
                return false;
            }
        }
        mDress.feed(text);
        if (mDress.tooLarge()) {
            mError =
                "the newest lines come first and are too many to be turned round: tac FILE | harl-updater-tool log";
        }
        return mError.empty();
    }

    /// Ends the reading. What is wrong, in words; empty for nothing.
    ///
    /// @param allRead  the source has come to its end
    std::string finish(bool allRead)
    {
        if (allRead) {
            mDress.finish();
        }
        if (const int code = mSource.close(allRead && mError.empty()); mError.empty() && code != 0) {
            mError = "journalctl ended with status " + std::to_string(code) +
                     ". Run it as root; journalctl --unit=harl-updater shows why.";
        }
        if (mError.empty() && mParser.records() == 0) {
            mError = mJournal && bytes() == 0
                         ? "nothing in it: the service has not run since the journal begins (often with the boot), or "
                           "only root may read it. Run it as root."
                         : "no record of the updater in " + counted(lines(), "line") + ", " + byteCount(bytes()) +
                               ". A record begins with \"Updater | DD-MM-YYYY HH-MM-SS\".";
        }
        return mError.empty() ? "" : mSource.name() + ": " + mError;
    }

    /// False, and nothing more is to be read, when something is wrong; also when a file has become shorter.
    bool isGood()
    {
        struct stat state = {};
        if (mSource.isRegularFile() && fstat(mSource.descriptor(), &state) == 0 &&
            static_cast<std::uint64_t>(state.st_size) < bytes()) {
            mError = position() + "the file was made shorter while it was read; start again";
        }
        return mError.empty();
    }

    void expectOldestFirst() { mDress.expectOldestFirst(); }
    const LogSource& source() const { return mSource; }
    std::uint64_t bytes() const { return mDress.bytes(); }
    std::uint64_t lines() const { return mParser.lines(); }

private:
    /// "byte 17, line 2: ", of what comes next.
    std::string position() const
    {
        return "byte " + std::to_string(bytes()) + ", line " + std::to_string(lines() + 1) + ": ";
    }

    LogSource mSource;
    LogParser mParser;
    Dress mDress;
    std::vector<char> mBlock;
    std::string mError;
    bool mJournal = false;
};

/// Opens a file without a name: nothing is left of it however the program ends. False, and errno tells why, when none
/// can be made.
bool openUnnamed(std::fstream& file)
{
    const char* folder = std::getenv("TMPDIR");
    std::string path = std::string(folder == nullptr ? "/tmp" : folder) + "/harl-updater-tool-XXXXXX";
    const Descriptor made(mkstemp(path.data()));
    if (made) {
        file.open(path, std::ios::binary | std::ios::in | std::ios::out);
        unlink(path.c_str());
    }
    return file.is_open();
}

std::string dumped(const Json& value)
{
    return value.dump(1, ' ', false, Json::error_handler_t::replace);
}

/// Reads all sources and explains their runs one by one: for people, as one line each, or as one JSON object.
class Explanation
{
public:
    Explanation(const LogOptions& options, std::ostream& out, std::ostream& err)
        : mOptions(options), mOut(out), mErrors(err), mBuilder([this](Run& run) { take(run); })
    {
    }

    int run()
    {
        if (mOptions.json) {
            mOut << "{\"command\": \"log\", \"version\": " << jsonVersion << ", \"runs\": [";
        }
        std::string error = mOptions.htmlFile.empty() ? "" : openPage();
        const std::size_t count = std::max<std::size_t>(mOptions.files.size(), 1);
        for (std::size_t index = 0; index < count && error.empty(); ++index) {
            error = readSource(index);
        }
        mBuilder.finish();
        if (mLast) {
            show(mLast->first, mLast->second);
        }
        if (error.empty() && mOptions.run > mRuns) {
            error = "there is no run " + std::to_string(mOptions.run) + ": the log has " + counted(mRuns, "run");
        }
        if (mOptions.json) {
            mOut << "\n], \"lines\": " << mLines << ", \"bytes\": " << mBytes
                 << ", \"status\": " << (error.empty() ? mStatus : LOG_UNREADABLE)
                 << ", \"error\": " << (error.empty() ? "null" : dumped(error)) << "}\n";
        }
        mOut.flush();
        if (error.empty() && mPage.is_open()) {
            endPage(mPage);
            error = pageError(writeFile(mOptions.htmlFile, mPage));
        }
        if (!error.empty()) {
            mErrors << "harl-updater-tool: " << error << '\n';
        }
        return error.empty() ? mStatus : LOG_UNREADABLE;
    }

private:
    std::string pageError(const std::string& wrong) const
    {
        return wrong.empty() ? "" : escaped(mOptions.htmlFile) + ": " + wrong;
    }

    /// What is wrong, in words; empty for nothing.
    std::string openPage()
    {
        std::string wrong = objectionTo(mOptions.htmlFile, mOptions.files);
        if (wrong.empty() && !openUnnamed(mPage)) {
            wrong = std::strerror(errno);
        }
        if (wrong.empty()) {
            beginPage(mPage);
        }
        return pageError(wrong);
    }

    std::string readSource(std::size_t index)
    {
        Reader reader(mBuilder);
        const bool opened = reader.open(mOptions, index, mErrors);
        mSource = reader.source().name();
        while (opened && reader.readBlock()) {
        }
        std::string error = reader.finish(opened);
        mBuilder.sourceEnds();
        mLines += reader.lines();
        mBytes += reader.bytes();
        return error;
    }

    void take(Run& run)
    {
        explain(run);
        mRuns = run.number;
        const bool clean = run.besides.empty() && run.board.found();
        mStatus = wentWell(run) && (clean || !mOptions.strict) ? LOG_WENT_WELL : LOG_WENT_WRONG;
        if (mOptions.last) {
            mLast = {run, mSource};
        } else if (mOptions.run == 0 || mOptions.run == run.number) {
            show(run, mSource);
        }
    }

    void show(const Run& run, const std::string& source)
    {
        if (mOptions.json) {
            mOut << (mShown ? ",\n" : "\n") << dumped(runToJson(run, source));
        } else if (mOptions.list) {
            mOut << run.number << "  " << dateText(run.begin) << "  " << operatorView(run).meaning
                 << (run.failure ? " [" + run.failure->failure->name + ']' : "") << '\n';
        } else {
            mOut << (mShown ? "\n" : "");
            printRun(run, source, mOut);
        }
        mShown = true;
        if (mPage.is_open()) {
            writeRunToPage(run, source, mPage);
        }
    }

    const LogOptions& mOptions;
    std::ostream& mOut;
    std::ostream& mErrors;
    RunBuilder mBuilder;
    std::fstream mPage;
    std::string mSource;
    std::optional<std::pair<Run, std::string>> mLast; // with its source
    bool mShown = false;                              // a run
    std::uint64_t mRuns = 0;
    std::uint64_t mLines = 0;
    std::uint64_t mBytes = 0;
    LogStatus mStatus = LOG_UNREADABLE;
};

/// Waits for more from a pipe, `time` ms at most; for all of `time` with a file. True when a pipe has more, or has
/// ended.
bool awaitMore(const LogSource& source, int time)
{
    pollfd wanted = {source.isRegularFile() ? -1 : source.descriptor(), POLLIN, 0};
    return poll(&wanted, 1, time) > 0;
}

/// Reads all that is there by now. A file's end is the end for now; a pipe ends when nobody writes into it any more.
///
/// @return false when nothing more can come
bool readWhatIsThere(Reader& reader)
{
    const bool file = reader.source().isRegularFile();
    while (file || awaitMore(reader.source(), 0)) {
        if (!reader.readBlock()) {
            return file;
        }
    }
    return true;
}

/// Reads the earlier runs, which a journal hands out with little pauses. As readWhatIsThere() otherwise.
bool readEarlierRuns(Reader& reader)
{
    const std::int64_t end = localNow() + settleTime;
    while (readWhatIsThere(reader)) {
        if (reader.source().isRegularFile() || localNow() > end || !awaitMore(reader.source(), pollTime)) {
            return true;
        }
    }
    return false;
}

int followLast(const LogOptions& options, std::ostream& out, std::ostream& err)
{
    Follower follower(options.json, options.terminal, out);
    LogStatus status = LOG_UNREADABLE;
    RunBuilder builder([&](Run& run) {
        explain(run);
        follower.runComplete(run);
        status = wentWell(run) ? LOG_WENT_WELL : LOG_WENT_WRONG;
    });
    Reader reader(builder);
    bool open = reader.open(options, 0, err);
    const bool opened = open;
    if (opened) {
        reader.expectOldestFirst();
        open = readEarlierRuns(reader);
    }
    while (open && reader.isGood()) {
        follower.show(builder.current(), localNow());
        if (follower.ended()) {
            break;
        }
        awaitMore(reader.source(), pollTime);
        open = readWhatIsThere(reader);
    }
    const std::string error = reader.finish(!open);
    if (opened && !open) {
        follower.show(builder.current(), localNow());
    }
    builder.finish();
    if (!error.empty()) {
        err << "harl-updater-tool: " << error << '\n';
        return LOG_UNREADABLE;
    }
    return status;
}

} // namespace

std::string conflictIn(const LogOptions& options)
{
    const bool picks = options.list || options.last || options.run > 0;
    const std::pair<bool, const char*> conflicts[] = {
        {options.journal && !options.files.empty(), "--journal reads the service's journal: name no FILE with it."},
        {options.follow && options.files.size() > 1, "--follow shows one log: name one FILE."},
        {options.follow && (!options.htmlFile.empty() || picks),
         "--follow shows the run that goes on: neither --html, --list, --last nor --run go with it."},
        {options.last && options.run > 0, "--last and --run name one run each: leave one of them out."},
        {options.list && options.json, "--list is for people; --json prints a list anyway: leave one of them out."},
    };
    for (const auto& [applies, text] : conflicts) {
        if (applies) {
            return text;
        }
    }
    return "";
}

int runLog(const LogOptions& options, std::ostream& out, std::ostream& err)
{
    return options.follow ? followLast(options, out, err) : Explanation(options, out, err).run();
}
