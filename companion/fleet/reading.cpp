#include "fleet/reading.h"

#include "findings.h"
#include "log/catalogue.h"
#include "log/dress.h"
#include "log/source.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <mutex>
#include <set>
#include <thread>

#include <endian.h>

namespace
{

namespace fs = std::filesystem;

enum class Kind { TEXT, JOURNAL, ARCHIVE };

/// What is read one after the other: a file, or those of a journal. A full one has "@" and a number after its name; the
/// one that still grows, which comes last, has nothing there.
using Files = std::set<std::pair<bool, std::string>>;
using Inputs = std::map<std::string, Files>; ///< by name

Kind kindOf(const std::string& path)
{
    std::string bytes(8, '\0');
    std::ifstream(path, std::ios::binary).read(bytes.data(), 8);
    return path == "-"                     ? Kind::TEXT
           : bytes == "LPKSHHRH"           ? Kind::JOURNAL
           : startsWith(bytes, "\x1f\x8b") ? Kind::ARCHIVE
                                           : Kind::TEXT;
}

/// Starts a program that reads a file. What is wrong, in words; empty for nothing.
std::string start(LogSource& source, std::vector<std::string> program, const std::string& path)
{
    program.push_back("--file=" + fs::absolute(path).string());
    return source.openProgram(program, path, false);
}

std::string open(LogSource& source, Kind kind, const std::string& path)
{
    switch (kind) {
    case Kind::JOURNAL:
        return start(source, {"journalctl", "--output=export", "--quiet"}, path);
    case Kind::ARCHIVE: // its journal.txt and kept-logs/
        return start(source, {"tar", "--extract", "--gzip", "--to-stdout", "--wildcards", "harl-updater-report/[jk]*"},
                     path);
    default:
        return source.openFile(path);
    }
}

/// How many entries a journal's file states. systemd, journal-def.h: n_entries, 64 bits, is at byte 152.
std::uint64_t entriesStated(const std::string& path)
{
    std::uint64_t entries = 0;
    std::ifstream file(path, std::ios::binary);
    file.seekg(152).read(reinterpret_cast<char*>(&entries), sizeof entries);
    return le64toh(entries);
}

/// True when journalctl finds a journal's file whole.
bool isVerified(const std::string& path)
{
    LogSource source;
    return start(source, {"journalctl", "--verify", "--quiet"}, path).empty() && source.close(true) == 0;
}

/// When an entry was made.
struct Moment
{
    std::int64_t time = 0; ///< as ParsedRecord::time
    std::string boot;
};

/// How far the journal of a machine's boot has been read, by the clock that only goes forward: us since the boot, and
/// which of the entries with this time.
struct Progress
{
    std::pair<std::uint64_t, std::uint64_t> entry; ///< the last one
    std::pair<std::uint64_t, std::uint64_t> newest;

    /// Takes an entry of this time. False when it came before.
    bool advance(std::uint64_t time)
    {
        entry = {time, time == entry.first ? entry.second + 1 : 1};
        const bool isNew = entry > newest;
        newest = std::max(newest, entry);
        return isNew;
    }
};

/// The runs of one unit in an input.
class UnitLog
{
public:
    /// @param machine  its ID; empty where the log does not tell
    /// @param whole    false once the input is known not to be
    UnitLog(const std::string& machine, const std::string& name, const bool& whole, Fleet& fleet)
        : mMachine(machine), mName(name), mWhole(whole), mFleet(fleet), mBuilder([this](Run& run) { take(run); }),
          mParser(mBuilder)
    {
    }

    LogParser& parser() { return mParser; }

    /// Notes where an entry comes from, before its text is read. False when it came before.
    bool enter(const JournalEntry& entry)
    {
        if (!mProgress[entry.boot].advance(std::strtoull(entry.monotonic.c_str(), nullptr, 10))) {
            mFleet.addRepeat();
            return false;
        }
        if (const Run* run = mBuilder.current(); run != nullptr && run->number != mNumber) {
            mNumber = run->number;
            mBegan = mLast;
        }
        mLast = {std::strtoll(entry.realtime.c_str(), nullptr, 10) / 1000000, entry.boot};
        mName = entry.host.empty() ? mName : entry.host;
        return true;
    }

    void finish()
    {
        mParser.finish();
        mBuilder.finish();
    }

private:
    void take(Run& run)
    {
        if (!mWhole && run.ended == RunEnd::NOT_SEEN) {
            return;
        }
        const Moment& began = run.number == mNumber ? mBegan : mLast;
        if (run.steps.empty() && run.service.has(ServiceEvent::NOT_ALLOWED)) { // it has no record of its own
            run.begin = run.end = began.time;
        }
        explain(run);
        mFleet.add(escaped(mMachine), escaped(mName), began.boot, run);
    }

    std::string mMachine;
    std::string mName;
    const bool& mWhole;
    Fleet& mFleet;
    std::map<std::string, Progress> mProgress; // by boot
    Moment mLast;
    std::uint64_t mNumber = 0; // of the run that began at the place below
    Moment mBegan;
    RunBuilder mBuilder;
    LogParser mParser;
};

/// Reads one input.
class InputReader
{
public:
    InputReader(const std::string& name, Fleet& fleet) : mName(name), mFleet(fleet) {}

    /// What is wrong, in words; empty for nothing.
    std::string read(const Files& files)
    {
        std::string wrong;
        for (const auto& [grows, file] : files) {
            const std::string found = readFile(file);
            wrong = wrong.empty() ? found : wrong;
        }
        mWhole = wrong.empty();
        for (auto& [machine, log] : mLogs) {
            log.finish();
        }
        return wrong;
    }

private:
    std::string readFile(const std::string& path)
    {
        const Kind kind = kindOf(path);
        const std::uint64_t stated = kind == Kind::JOURNAL ? entriesStated(path) : 0; // before a receiver adds to them
        LogSource source;
        std::string wrong = open(source, kind, path);
        if (!wrong.empty()) {
            return wrong;
        }
        std::uint64_t entries = 0;
        Dress dress(logOf("").parser());
        dress.divide([&](const JournalEntry& entry) {
            ++entries;
            mWhole = mWhole && dress.undamaged();
            return parserFor(entry);
        });
        std::vector<char> block(LogSource::blockSize);
        ssize_t length = 0;
        while ((length = source.read(block)) > 0) {
            dress.feed({block.data(), static_cast<std::size_t>(length)});
        }
        wrong = length < 0 ? std::strerror(errno) : "";
        dress.finish();
        const int status = source.close(true);
        const bool hasRecord =
            std::any_of(mLogs.begin(), mLogs.end(), [](auto& log) { return log.second.parser().records() > 0; });
        const std::pair<bool, std::string> faults[] = {
            {!wrong.empty(), wrong},
            {kind == Kind::ARCHIVE && status != 0, "not a whole archive of harl-updater-tool report"},
            {kind == Kind::JOURNAL && (status != 0 || (entries < stated && !isVerified(path))),
             "a journal that is damaged or cut off: journalctl --verify --file=" + escaped(path)},
            {!dress.undamaged(), "damaged: not everything in it is a journal's entry"},
            {dress.tooLarge(), "the newest lines come first and are too many to be turned round: turn them with tac"},
            {kind == Kind::TEXT && dress.cut(), "cut off: it ends in the middle of a line or of an entry"},
            {kind != Kind::JOURNAL && !hasRecord, "no record of the updater in it"},
        };
        const auto* fault = std::find_if(std::begin(faults), std::end(faults), [](auto& one) { return one.first; });
        return fault == std::end(faults) ? "" : fault->second;
    }

    LogParser* parserFor(const JournalEntry& entry)
    {
        const bool manager = entry.program == "systemd" && contains(entry.message, "harl-updater");
        if (entry.program != "harl-updater" && !manager) {
            return nullptr;
        }
        UnitLog& log = logOf(entry.machine);
        return entry.machine.empty() || log.enter(entry) ? &log.parser() : nullptr;
    }

    UnitLog& logOf(const std::string& machine)
    {
        return mLogs.try_emplace(machine, machine, machine.empty() ? mName : machine, mWhole, mFleet).first->second;
    }

    const std::string& mName;
    Fleet& mFleet;
    bool mWhole = true;
    std::map<std::string, UnitLog> mLogs; // by machine; that of no machine has the log's name
};

/// The inputs of these paths; `unread` gets the folders that cannot be read.
Inputs inputsOf(const std::vector<std::string>& paths, nlohmann::ordered_json& unread)
{
    Inputs inputs;
    const auto add = [&](const std::string& path) {
        std::size_t at = path.size();
        std::size_t end = at;
        if (kindOf(path) == Kind::JOURNAL) {
            at = path.find('@', path.rfind('/') + 1);
            end = std::min(at, path.rfind('.'));
        }
        inputs[path.substr(0, end)].insert({at != end, path});
    };
    for (const std::string& path : paths) {
        std::error_code error;
        if (!fs::is_directory(path, error)) {
            add(path);
            continue;
        }
        for (fs::recursive_directory_iterator file(path, error), end; !error && file != end; file.increment(error)) {
            if (file->is_regular_file(error)) {
                add(file->path());
            }
        }
        if (error) {
            unread.push_back({{"input", escaped(path)}, {"why", error.message()}});
        }
    }
    return inputs;
}

} // namespace

nlohmann::ordered_json readFleet(const std::vector<std::string>& paths, Fleet& fleet)
{
    auto unread = nlohmann::ordered_json::array();
    Inputs inputs = inputsOf(paths, unread);
    std::mutex mutex; // of what follows
    auto next = inputs.begin();
    const auto work = [&] {
        for (std::unique_lock lock(mutex); next != inputs.end();) {
            const auto& [name, files] = *next++;
            lock.unlock();
            const std::string wrong = InputReader(name, fleet).read(files);
            lock.lock();
            if (!wrong.empty()) {
                unread.push_back({{"input", escaped(name)}, {"why", wrong}});
            }
        }
    };
    const std::size_t count = std::min<std::size_t>(std::thread::hardware_concurrency(), inputs.size());
    std::vector<std::future<void>> workers;
    while (workers.size() + 1 < count) {
        workers.push_back(std::async(std::launch::async, work));
    }
    work();
    for (std::future<void>& worker : workers) {
        worker.get();
    }
    std::sort(unread.begin(), unread.end());
    return unread;
}
