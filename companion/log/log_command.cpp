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

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <memory>
#include <optional>
#include <ostream>
#include <vector>

#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

namespace
{

using Json = nlohmann::ordered_json;

const std::size_t blockSize = std::size_t{256} * 1024; // bytes
const int pollTime = 250;                              // ms between two looks at a file, and at the clock
const int settleTime = 2;                              // s, at most, for the earlier runs in a pipe

/// What an input that holds no text begins with, and what to do about it.
struct Magic
{
    std::string_view bytes;
    const char* advice;
};

const Magic magics[] = {
    {"LPKSHHRH", "a journal's own file: journalctl --file FILE -u harl-updater | harl-updater-tool log"},
    {"\x1f\x8b", "compressed: zcat FILE | harl-updater-tool log"},
    {"\xfd\x37zXZ", "compressed: xzcat FILE | harl-updater-tool log"},
    {"\x28\xb5\x2f\xfd", "compressed: zstdcat FILE | harl-updater-tool log"},
    {"BZh", "compressed: bzcat FILE | harl-updater-tool log"},
    {"PK\x03\x04", "an archive: unzip -p FILE | harl-updater-tool log"},
    {"\xff\xfe", "text in UTF-16: iconv -f UTF-16 -t UTF-8 FILE | harl-updater-tool log"},
    {"\xfe\xff", "text in UTF-16: iconv -f UTF-16 -t UTF-8 FILE | harl-updater-tool log"},
};

/// What to do about an input that begins like this, or null when it may be a log.
const char* adviceFor(std::string_view start)
{
    for (const Magic& magic : magics) {
        if (start.substr(0, magic.bytes.size()) == magic.bytes) {
            return magic.advice;
        }
    }
    return nullptr;
}

/// Reads a source block by block into a parser.
class Reader
{
public:
    Reader(const LogSource& source, LogParser& parser)
        : mSource(source), mParser(parser), mDress(parser), mBlock(blockSize)
    {
    }

    /// Reads one block. False at the source's end for now, and when something is wrong.
    bool readBlock()
    {
        ssize_t length = -1;
        do {
            length = read(mSource.descriptor(), mBlock.data(), mBlock.size());
        } while (length < 0 && errno == EINTR);
        if (length < 0) {
            mError = position() + std::strerror(errno);
        }
        if (length <= 0) {
            return false;
        }
        const std::string_view text(mBlock.data(), static_cast<std::size_t>(length));
        if (const char* advice = mDress.bytes() == 0 ? adviceFor(text) : nullptr; advice != nullptr) {
            mError = position() + "no log but " + advice;
            return false;
        }
        mDress.feed(text);
        if (mDress.tooLarge()) {
            mError =
                "the newest lines come first and are too many to be turned round: tac FILE | harl-updater-tool log";
            return false;
        }
        return true;
    }

    void expectOldestFirst() { mDress.expectOldestFirst(); }

    /// The source has ended.
    void finish() { mDress.finish(); }

    std::uint64_t bytes() const { return mDress.bytes(); }

    /// "byte 17, line 2: ", of what comes next.
    std::string position() const
    {
        return "byte " + std::to_string(mDress.bytes()) + ", line " + std::to_string(mParser.lines() + 1) + ": ";
    }

    /// What is wrong, in words; empty for nothing.
    const std::string& error() const { return mError; }

private:
    const LogSource& mSource;
    LogParser& mParser;
    Dress mDress;
    std::vector<char> mBlock;
    std::string mError;
};

const char* unfinishedFile = nullptr; // for removeUnfinished() only

/// Handles a signal that ends the program.
void removeUnfinished(int number)
{
    unlink(unfinishedFile);
    std::signal(number, SIG_DFL);
    std::raise(number);
}

/// A file that takes the place of another one of its name once it is whole; one at a time. Nothing is left of it when
/// the program is ended before.
class NewFile
{
public:
    explicit NewFile(const std::string& path) : mPath(path), mPartPath(path + ".XXXXXX")
    {
        const Descriptor part(mkstemp(mPartPath.data()));
        if (part) {
            const mode_t withheld = umask(0);
            umask(withheld);
            fchmod(part.number(), 0666 & ~withheld);
            mStream.open(mPartPath, std::ios::binary);
            unfinishedFile = mPartPath.c_str();
            for (const int number : {SIGHUP, SIGINT, SIGTERM, SIGPIPE, SIGQUIT}) {
                if (std::signal(number, removeUnfinished) == SIG_IGN) { // as nohup(1) leaves one
                    std::signal(number, SIG_IGN);
                }
            }
        } else {
            mPartPath.clear();
            mStream.setstate(std::ios::failbit);
        }
    }
    ~NewFile()
    {
        if (!mKept) {
            std::remove(mPartPath.c_str());
        }
        unfinishedFile = nullptr;
    }
    NewFile(const NewFile&) = delete;
    NewFile& operator=(const NewFile&) = delete;

    std::ostream& stream() { return mStream; }

    /// Returns what is wrong, in words; empty when the file is whole and in its place.
    std::string keep()
    {
        mStream.close();
        if (!mStream || std::rename(mPartPath.c_str(), mPath.c_str()) != 0) {
            return std::strerror(errno);
        }
        mKept = true;
        return "";
    }

private:
    std::string mPath;
    std::string mPartPath;
    std::ofstream mStream;
    bool mKept = false;
};

/// Prints explained runs one by one: for people, as one line each, or as one JSON object.
class Printer
{
public:
    Printer(const LogOptions& options, std::ostream& out) : mOptions(options), mOut(out)
    {
        if (mOptions.json) {
            mOut << "{\"command\": \"log\", \"version\": " << jsonVersion << ", \"runs\": [";
        }
    }

    void print(const Run& run, const std::string& source)
    {
        const char* between = mPrinted && !mOptions.list ? "\n" : "";
        mOut << (mOptions.json && mPrinted ? "," : between);
        mPrinted = true;
        if (mOptions.json) {
            mOut << '\n' << dumped(runToJson(run, source));
        } else if (mOptions.list) {
            mOut << run.number << "  " << dateText(run.begin) << "  " << operatorView(run).meaning
                 << (run.failure ? " [" + run.failure->failure->name + ']' : "") << '\n';
        } else {
            printRun(run, source, mOut);
        }
    }

    void finish(std::uint64_t lines, std::uint64_t bytes, int status, const std::string& error)
    {
        if (mOptions.json) {
            mOut << "\n], \"lines\": " << lines << ", \"bytes\": " << bytes << ", \"status\": " << status
                 << ", \"error\": " << (error.empty() ? "null" : dumped(error)) << "}\n";
        }
        mOut.flush();
    }

private:
    static std::string dumped(const Json& value) { return value.dump(1, ' ', false, Json::error_handler_t::replace); }

    const LogOptions& mOptions;
    std::ostream& mOut;
    bool mPrinted = false;
};

/// Why the page must not take the place of what is at `path`, in words; empty when it may.
std::string objectionTo(const std::string& path, const LogOptions& options)
{
    struct stat page = {};
    if (lstat(path.c_str(), &page) != 0) {
        return "";
    }
    if (!S_ISREG(page.st_mode)) {
        return "not a plain file; name another one for the page";
    }
    const auto isPage = [&](const std::string& file) {
        struct stat log = {};
        const int result = file == "-" ? fstat(STDIN_FILENO, &log) : stat(file.c_str(), &log);
        return result == 0 && page.st_dev == log.st_dev && page.st_ino == log.st_ino;
    };
    const bool same =
        options.files.empty() ? isPage("-") : std::any_of(options.files.begin(), options.files.end(), isPage);
    return same ? "the log itself; name another file for the page" : "";
}

/// What journalctl(1) failed with, in words.
std::string journalText(int code)
{
    return "journalctl ended with status " + std::to_string(code) +
           ". Run it as root; journalctl --unit=harl-updater shows why.";
}

std::string noRecordText(const LogParser& parser, bool journal)
{
    if (journal && parser.bytes() == 0) {
        return "nothing in it: the service has not run since the journal begins (often with the boot), or only root "
               "may read it. Run it as root.";
    }
    return "no record of the updater in " + counted(parser.lines(), "line") + ", " + byteCount(parser.bytes()) +
           ". A record begins with \"Updater | DD-MM-YYYY HH-MM-SS\".";
}

/// Opens the source number `index` of the options. What is wrong, in words; empty when it is open.
std::string openSource(const LogOptions& options, std::size_t index, LogSource& source, std::ostream& err)
{
    if (options.journal) {
        return source.openJournal(options.follow);
    }
    std::string wrong = source.openFile(options.files.empty() ? "-" : options.files[index]);
    if (wrong.empty() && isatty(source.descriptor()) == 1) {
        err << "harl-updater-tool: reading the log from the terminal; end it with Ctrl-D.\n";
    }
    return wrong;
}

/// True when a run leaves nothing to be done.
bool isClean(const Run& run)
{
    return wentWell(run) && run.besides.empty() && run.board.found();
}

/// Reads all sources and explains their runs.
class Explanation
{
public:
    Explanation(const LogOptions& options, std::ostream& out, std::ostream& err)
        : mOptions(options), mErrors(err), mPrinter(options, out), mBuilder([this](Run& run) { take(run); })
    {
    }

    int run()
    {
        std::string error = openPage();
        const std::size_t count = std::max<std::size_t>(mOptions.files.size(), 1);
        for (std::size_t index = 0; index < count && error.empty(); ++index) {
            error = readSource(index);
        }
        mBuilder.finish();
        if (mLast) {
            show(*mLast, mLastSource);
        }
        if (error.empty() && mOptions.run > mRuns) {
            error = "there is no run " + std::to_string(mOptions.run) + ": the log has " + counted(mRuns, "run");
        }
        mPrinter.finish(mLines, mBytes, error.empty() ? mStatus : LOG_UNREADABLE, error);
        if (error.empty() && mPage) {
            mPage->finish();
            if (const std::string wrong = mFile->keep(); !wrong.empty()) {
                error = escaped(mOptions.htmlFile) + ": " + wrong;
            }
        }
        if (!error.empty()) {
            mErrors << "harl-updater-tool: " << error << '\n';
            return LOG_UNREADABLE;
        }
        return mStatus;
    }

private:
    std::string openPage()
    {
        if (mOptions.htmlFile.empty()) {
            return "";
        }
        std::string wrong = objectionTo(mOptions.htmlFile, mOptions);
        if (wrong.empty()) {
            mFile = std::make_unique<NewFile>(mOptions.htmlFile);
            if (mFile->stream()) {
                mPage.emplace(mFile->stream());
                return "";
            }
            wrong = std::strerror(errno);
        }
        return escaped(mOptions.htmlFile) + ": " + wrong;
    }

    std::string readSource(std::size_t index)
    {
        LogSource source;
        std::string error = openSource(mOptions, index, source, mErrors);
        mSource = source.name();
        if (!error.empty()) {
            return mSource + ": " + error;
        }
        LogParser parser(mBuilder);
        Reader reader(source, parser);
        while (reader.readBlock()) {
        }
        reader.finish();
        mBuilder.sourceEnds();
        mLines += parser.lines();
        mBytes += reader.bytes();
        error = reader.error();
        if (const int code = source.close(error.empty()); error.empty() && code != 0) {
            error = journalText(code);
        }
        if (error.empty() && parser.records() == 0) {
            error = noRecordText(parser, mOptions.journal);
        }
        return error.empty() ? "" : mSource + ": " + error;
    }

    void take(Run& run)
    {
        explain(run);
        mRuns = run.number;
        mStatus = (mOptions.strict ? isClean(run) : wentWell(run)) ? LOG_WENT_WELL : LOG_WENT_WRONG;
        if (mOptions.last) {
            mLast = run;
            mLastSource = mSource;
        } else if (mOptions.run == 0 || mOptions.run == run.number) {
            show(run, mSource);
        }
    }

    void show(const Run& run, const std::string& source)
    {
        mPrinter.print(run, source);
        if (mPage) {
            mPage->writeRun(run, source);
        }
    }

    const LogOptions& mOptions;
    std::ostream& mErrors;
    Printer mPrinter;
    RunBuilder mBuilder;
    std::unique_ptr<NewFile> mFile;
    std::optional<HtmlPage> mPage;
    std::string mSource;
    std::optional<Run> mLast;
    std::string mLastSource;
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
bool readWhatIsThere(Reader& reader, const LogSource& source)
{
    if (source.isRegularFile()) {
        while (reader.readBlock()) {
        }
        return true;
    }
    while (awaitMore(source, 0)) {
        if (!reader.readBlock()) {
            return false;
        }
    }
    return true;
}

/// Reads the earlier runs, which a journal hands out with little pauses. As readWhatIsThere() otherwise.
bool readEarlierRuns(Reader& reader, const LogSource& source)
{
    const std::int64_t end = localNow() + settleTime;
    while (readWhatIsThere(reader, source)) {
        if (source.isRegularFile() || localNow() > end || !awaitMore(source, pollTime)) {
            return true;
        }
    }
    return false;
}

/// What is wrong with a file that others write to, in words; empty for nothing.
std::string changeOf(const LogSource& source, const Reader& reader)
{
    struct stat state = {};
    if (fstat(source.descriptor(), &state) == 0 && S_ISREG(state.st_mode) &&
        static_cast<std::uint64_t>(state.st_size) < reader.bytes()) {
        return reader.position() + "the file was made shorter while it was read; start again";
    }
    return reader.error();
}

int followLast(LogSource& source, const LogOptions& options, std::ostream& out, std::ostream& err)
{
    Follower follower(options.json, options.terminal, out);
    LogStatus status = LOG_UNREADABLE;
    RunBuilder builder([&](Run& run) {
        explain(run);
        follower.runComplete(run);
        status = wentWell(run) ? LOG_WENT_WELL : LOG_WENT_WRONG;
    });
    LogParser parser(builder);
    Reader reader(source, parser);
    reader.expectOldestFirst();
    std::string error;

    bool open = readEarlierRuns(reader, source);
    while (true) {
        error = changeOf(source, reader);
        if (!open) {
            reader.finish();
        }
        follower.show(builder.current(), localNow());
        if (!open || !error.empty() || follower.ended()) {
            break;
        }
        awaitMore(source, pollTime);
        open = readWhatIsThere(reader, source);
    }
    builder.finish();
    const int code = source.close(!open && error.empty());
    if (error.empty() && code != 0) {
        error = journalText(code);
    } else if (error.empty() && parser.records() == 0) {
        error = noRecordText(parser, options.journal);
    }
    if (!error.empty()) {
        err << "harl-updater-tool: " << source.name() << ": " << error << '\n';
        return LOG_UNREADABLE;
    }
    return status;
}

} // namespace

std::string conflictIn(const LogOptions& options)
{
    if (options.journal && !options.files.empty()) {
        return "--journal reads the service's journal: name no FILE with it.";
    }
    if (options.follow && options.files.size() > 1) {
        return "--follow shows one log: name one FILE.";
    }
    if (options.follow && (!options.htmlFile.empty() || options.list || options.last || options.run > 0)) {
        return "--follow shows the run that goes on: neither --html, --list, --last nor --run go with it.";
    }
    if (options.last && options.run > 0) {
        return "--last and --run name one run each: leave one of them out.";
    }
    return options.list && options.json ? "--list is for people: --json prints a list anyway." : "";
}

int runLog(const LogOptions& options, std::ostream& out, std::ostream& err)
{
    if (!options.follow) {
        return Explanation(options, out, err).run();
    }
    LogSource source;
    const std::string wrong = openSource(options, 0, source, err);
    if (!wrong.empty()) {
        err << "harl-updater-tool: " << source.name() << ": " << wrong << '\n';
        return LOG_UNREADABLE;
    }
    return followLast(source, options, out, err);
}
