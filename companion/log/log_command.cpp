#include "log/log_command.h"

#include "descriptor.h"
#include "findings.h"
#include "log/explain.h"
#include "log/follow.h"
#include "log/html.h"
#include "log/json.h"
#include "log/parser.h"
#include "log/run.h"
#include "log/source.h"
#include "log/text.h"

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
    {"PK\x03\x04", "an archive: unpack it first"},
    {"\xff\xfe", "text in UTF-16: save it as UTF-8 first"},
    {"\xfe\xff", "text in UTF-16: save it as UTF-8 first"},
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
    Reader(const LogSource& source, LogParser& parser) : mSource(source), mParser(parser), mBlock(blockSize) {}

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
        if (const char* advice = mParser.bytes() == 0 ? adviceFor(text) : nullptr; advice != nullptr) {
            mError = position() + "no log but " + advice;
            return false;
        }
        mParser.feed(text);
        return true;
    }

    /// "byte 17, line 2: ", of what comes next.
    std::string position() const
    {
        return "byte " + std::to_string(mParser.bytes()) + ", line " + std::to_string(mParser.lines() + 1) + ": ";
    }

    /// What is wrong, in words; empty for nothing.
    const std::string& error() const { return mError; }

private:
    const LogSource& mSource;
    LogParser& mParser;
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
            for (const int number : {SIGHUP, SIGINT, SIGTERM}) {
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

/// Prints explained runs one by one: for people, or as one JSON object.
class Printer
{
public:
    Printer(const std::string& source, bool json, std::ostream& out) : mSource(source), mJson(json), mOut(out)
    {
        if (mJson) {
            mOut << "{\"command\": \"log\", \"source\": " << dumped(mSource) << ", \"runs\": [";
        }
    }

    void print(const Run& run)
    {
        mOut << (run.number == 1 ? "" : mJson ? "," : "\n");
        if (mJson) {
            mOut << '\n' << dumped(runToJson(run));
        } else {
            printRun(run, mSource, mOut);
        }
    }

    void finish(const LogParser& parser, int status, const std::string& error)
    {
        if (mJson) {
            mOut << "\n], \"lines\": " << parser.lines() << ", \"bytes\": " << parser.bytes()
                 << ", \"status\": " << status << ", \"error\": " << (error.empty() ? "null" : dumped(error)) << "}\n";
        }
        mOut.flush();
    }

private:
    static std::string dumped(const Json& value) { return value.dump(1, ' ', false, Json::error_handler_t::replace); }

    std::string mSource;
    bool mJson;
    std::ostream& mOut;
};

/// Why the page must not take the place of what is at `path`, in words; empty when it may.
std::string objectionTo(const std::string& path, const LogSource& source)
{
    struct stat page = {};
    struct stat log = {};
    if (lstat(path.c_str(), &page) != 0) {
        return "";
    }
    if (!S_ISREG(page.st_mode)) {
        return "not a plain file; name another one for the page";
    }
    const bool same = fstat(source.descriptor(), &log) == 0 && page.st_dev == log.st_dev && page.st_ino == log.st_ino;
    return same ? "the log itself; name another file for the page" : "";
}

/// What journalctl(1) failed with, in words.
std::string journalText(int code)
{
    return "journalctl ended with status " + std::to_string(code) +
           ". Run it as root; journalctl --unit=harl-updater tells more.";
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

int explainAll(LogSource& source, const LogOptions& options, std::ostream& out, std::ostream& err)
{
    std::unique_ptr<NewFile> file;
    std::optional<HtmlPage> page;
    if (!options.htmlFile.empty()) {
        if (const std::string objection = objectionTo(options.htmlFile, source); !objection.empty()) {
            err << "harl-updater-tool: " << escaped(options.htmlFile) << ": " << objection << '\n';
            return LOG_UNREADABLE;
        }
        file = std::make_unique<NewFile>(options.htmlFile);
        if (!file->stream()) {
            err << "harl-updater-tool: " << escaped(options.htmlFile) << ": " << std::strerror(errno) << '\n';
            return LOG_UNREADABLE;
        }
        page.emplace(source.name(), file->stream());
    }

    Printer printer(source.name(), options.json, out);
    LogStatus status = LOG_UNREADABLE;
    RunBuilder builder([&](Run& run) {
        explain(run);
        printer.print(run);
        if (page) {
            page->writeRun(run);
        }
        status = wentWell(run) ? LOG_WENT_WELL : LOG_WENT_WRONG;
    });
    LogParser parser(builder);
    Reader reader(source, parser);
    while (reader.readBlock()) {
    }
    parser.finish();
    builder.finish();

    std::string error = reader.error();
    if (const int code = source.close(error.empty()); error.empty() && code != 0) {
        error = journalText(code);
    }
    if (error.empty() && parser.records() == 0) {
        error = noRecordText(parser, options.journal);
    }
    if (!error.empty()) {
        status = LOG_UNREADABLE;
    }
    printer.finish(parser, status, error);
    if (!error.empty()) {
        err << "harl-updater-tool: " << source.name() << ": " << error << '\n';
    } else if (page) {
        page->finish();
        if (const std::string wrong = file->keep(); !wrong.empty()) {
            err << "harl-updater-tool: " << escaped(options.htmlFile) << ": " << wrong << '\n';
            return LOG_UNREADABLE;
        }
    }
    return status;
}

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
std::string changeOf(const LogSource& source, const Reader& reader, const LogParser& parser)
{
    struct stat state = {};
    if (fstat(source.descriptor(), &state) == 0 && S_ISREG(state.st_mode) &&
        static_cast<std::uint64_t>(state.st_size) < parser.bytes()) {
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
    std::string error;

    bool open = readEarlierRuns(reader, source);
    while (true) {
        error = changeOf(source, reader, parser);
        if (!open) {
            parser.finish();
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

int runLog(const LogOptions& options, std::ostream& out, std::ostream& err)
{
    LogSource source;
    const std::string wrong = options.journal ? source.openJournal(options.follow) : source.openFile(options.file);
    if (!wrong.empty()) {
        err << "harl-updater-tool: " << source.name() << ": " << wrong << '\n';
        return LOG_UNREADABLE;
    }
    return options.follow ? followLast(source, options, out, err) : explainAll(source, options, out, err);
}
