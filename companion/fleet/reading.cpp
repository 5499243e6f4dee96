#include "fleet/reading.h"

#include "findings.h"
#include "log/catalogue.h"
#include "log/dress.h"
#include "log/source.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <memory>
#include <thread>
#include <unordered_map>

#include <endian.h>
#include <unistd.h>

namespace
{

namespace fs = std::filesystem;

const std::size_t blockSize = std::size_t{256} * 1024; // bytes

enum class Kind { TEXT, JOURNAL, ARCHIVE };

/// What is read at a time: a file, or the files that a journal is made of.
struct Input
{
    Kind kind;
    std::string name;
    std::vector<std::string> files;
};

Kind kindOf(const std::string& path)
{
    std::array<char, 8> start{};
    std::ifstream(path, std::ios::binary).read(start.data(), start.size());
    const std::string_view bytes(start.data(), start.size());
    return bytes == "LPKSHHRH" ? Kind::JOURNAL : startsWith(bytes, "\x1f\x8b") ? Kind::ARCHIVE : Kind::TEXT;
}

/// Adds a file. A journal that has grown goes on in a file of the same name, which ends in "@" and a number before
/// that.
void addFile(const std::string& path, std::vector<Input>& inputs)
{
    const Kind kind = path == "-" ? Kind::TEXT : kindOf(path);
    const std::string name = kind == Kind::JOURNAL ? path.substr(0, std::min(path.rfind('@'), path.rfind('.'))) : path;
    if (kind == Kind::JOURNAL && !inputs.empty() && inputs.back().kind == kind && inputs.back().name == name) {
        inputs.back().files.push_back(path);
        return;
    }
    inputs.push_back({kind, name, {path}});
}

std::vector<Input> inputsOf(const std::vector<std::string>& paths, std::vector<Unread>& unread)
{
    std::vector<Input> inputs;
    for (const std::string& path : paths) {
        std::error_code error;
        std::vector<std::string> files;
        if (fs::is_directory(path, error)) {
            fs::recursive_directory_iterator file(path, error);
            for (; !error && file != fs::recursive_directory_iterator(); file.increment(error)) {
                if (file->is_regular_file(error)) {
                    files.push_back(file->path());
                }
            }
            if (error) {
                unread.push_back({escaped(path), error.message()});
            }
            std::sort(files.begin(), files.end());
        } else {
            files.push_back(path);
        }
        for (const std::string& found : files) {
            addFile(found, inputs);
        }
    }
    return inputs;
}

/// How far the journal of a machine's boot has been read, by the clock that only goes forward.
struct Place
{
    std::uint64_t time = 0;  ///< us since the boot, of the latest entry
    std::uint64_t count = 0; ///< entries with this time
    std::uint64_t again = 0; ///< of them, how many came since the entries last went back
};

/// The runs of one unit in an input.
class UnitLog
{
public:
    /// @param whole  false once the input is known not to be
    UnitLog(std::string machine, std::string name, const bool& whole, Fleet& fleet)
        : mMachine(std::move(machine)), mName(std::move(name)), mWhole(whole), mFleet(fleet),
          mBuilder([this](Run& run) { take(run); }), mParser(mBuilder)
    {
    }

    LogParser& parser() { return mParser; }

    /// Notes where an entry comes from, before its text is read. False when it came before.
    bool enter(const JournalEntry& entry)
    {
        const std::uint64_t boot = entry.boot.empty() ? 0 : std::hash<std::string>()(entry.boot);
        if (!isNew(mPlaces[boot], std::strtoull(entry.monotonic.c_str(), nullptr, 10))) {
            mFleet.addRepeats(1);
            return false;
        }
        if (const Run* run = mBuilder.current(); run != nullptr && run->number != mNumber) {
            mNumber = run->number;
            mBegan = mTime;
            mBootOfRun = mBoot;
        }
        mTime = std::strtoll(entry.realtime.c_str(), nullptr, 10) / 1000000;
        mBoot = boot;
        mName = entry.host.empty() ? mName : escaped(entry.host);
        return true;
    }

    void finish()
    {
        mParser.finish();
        mBuilder.finish();
    }

private:
    static bool isNew(Place& place, std::uint64_t time)
    {
        if (time < place.time) {
            place.again = 0;
            return false;
        }
        place = time > place.time ? Place{time, 0, 0} : place;
        const bool known = place.again++ < place.count;
        place.count += known ? 0 : 1;
        return !known;
    }

    void take(Run& run)
    {
        if (!mWhole && run.ended == RunEnd::NOT_SEEN) {
            return;
        }
        const bool noted = run.number == mNumber;
        if (run.steps.empty() && run.service.has(ServiceEvent::NOT_ALLOWED)) { // it has no record of its own
            run.begin = run.end = noted ? mBegan : mTime;
        }
        explain(run);
        mFleet.add(mMachine, mName, run, noted ? mBootOfRun : mBoot);
    }

    std::string mMachine;
    std::string mName;
    const bool& mWhole;
    Fleet& mFleet;
    std::unordered_map<std::uint64_t, Place> mPlaces; // of each boot
    std::int64_t mTime = 0;                           // of the last entry, s
    std::uint64_t mBoot = 0;
    std::uint64_t mNumber = 0; // of the run that the two below belong to
    std::int64_t mBegan = 0;
    std::uint64_t mBootOfRun = 0;
    RunBuilder mBuilder;
    LogParser mParser;
};

/// Reads one input.
class InputReader
{
public:
    InputReader(const Input& input, Fleet& fleet)
        : mInput(input), mFleet(fleet), mOwn(escaped(input.name), escaped(input.name), mWhole, fleet),
          mDress(mOwn.parser())
    {
        mDress.divide([this](const JournalEntry& entry) { return parserFor(entry); });
    }

    /// What is wrong, in words; empty for nothing.
    std::string read()
    {
        std::string wrong = open();
        if (!wrong.empty()) {
            return wrong;
        }
        std::vector<char> block(blockSize);
        ssize_t length = 0;
        while ((length = TEMP_FAILURE_RETRY(::read(mSource.descriptor(), block.data(), block.size()))) > 0) {
            mDress.feed({block.data(), static_cast<std::size_t>(length)});
        }
        wrong = length < 0 ? std::strerror(errno) : "";
        mDress.finish();
        const int status = mSource.close(true);
        wrong = wrong.empty() ? whatIsWrong(status) : wrong;
        mWhole = wrong.empty();
        mOwn.finish();
        for (auto& [machine, log] : mLogs) {
            log->finish();
        }
        return wrong;
    }

private:
    std::string open()
    {
        if (mInput.kind == Kind::TEXT) {
            return mSource.openFile(mInput.files.front());
        }
        if (mInput.kind == Kind::ARCHIVE) { // its journal.txt and kept-logs/
            return mSource.openProgram({"tar", "--extract", "--gzip", "--to-stdout", "--wildcards", "--file",
                                        fs::absolute(mInput.files.front()), "harl-updater-report/[jk]*"},
                                       mInput.name, false);
        }
        mStated = entriesStated(); // before a receiver adds to them
        std::vector<std::string> arguments = {"journalctl", "--output=export", "--quiet"};
        for (const std::string& file : mInput.files) {
            arguments.push_back("--file=" + fs::absolute(file).string());
        }
        return mSource.openProgram(arguments, mInput.name, false);
    }

    LogParser* parserFor(const JournalEntry& entry)
    {
        ++mEntries;
        mWhole = mDress.undamaged();
        const bool manager = entry.program == "systemd" && entry.message.find("harl-updater") != std::string::npos;
        if (entry.program != "harl-updater" && !manager) {
            return nullptr;
        }
        if (entry.machine.empty()) {
            return &mOwn.parser();
        }
        std::unique_ptr<UnitLog>& log = mLogs[entry.machine];
        if (!log) {
            log = std::make_unique<UnitLog>(escaped(entry.machine), escaped(entry.machine), mWhole, mFleet);
        }
        return log->enter(entry) ? &log->parser() : nullptr;
    }

    /// @param status  of journalctl or tar
    std::string whatIsWrong(int status)
    {
        if (mInput.kind == Kind::ARCHIVE && status != 0) {
            return "not a whole archive of harl-updater-tool report";
        }
        if (mInput.kind == Kind::JOURNAL && (status != 0 || (mEntries < mStated && !isVerified()))) {
            return "a journal that is damaged or cut off: journalctl --verify --file=" + escaped(mInput.files.front());
        }
        if (!mDress.undamaged()) {
            return "damaged: not everything in it is a journal's entry";
        }
        if (mDress.tooLarge()) {
            return "the newest lines come first and are too many to be turned round: turn them with tac";
        }
        if (mDress.cut() && mInput.kind == Kind::TEXT) {
            return "cut off: it ends in the middle of a line or of an entry";
        }
        const bool hasRecord = mOwn.parser().records() > 0 || std::any_of(mLogs.begin(), mLogs.end(), [](auto& log) {
                                   return log.second->parser().records() > 0;
                               });
        return hasRecord || mInput.kind == Kind::JOURNAL ? "" : "no record of the updater in it";
    }

    /// How many entries the journal's files state. systemd, journal-def.h: n_entries, 64 bits, is at byte 152.
    std::uint64_t entriesStated() const
    {
        std::uint64_t sum = 0;
        for (const std::string& path : mInput.files) {
            std::uint64_t entries = 0;
            std::ifstream file(path, std::ios::binary);
            file.seekg(152).read(reinterpret_cast<char*>(&entries), sizeof entries);
            sum += le64toh(entries);
        }
        return sum;
    }

    /// True when journalctl finds the journal's files whole: fewer entries may be other files' again.
    bool isVerified() const
    {
        return std::all_of(mInput.files.begin(), mInput.files.end(), [](const std::string& file) {
            LogSource verification;
            const std::string wrong = verification.openProgram(
                {"journalctl", "--verify", "--quiet", "--file=" + fs::absolute(file).string()}, file, false);
            return wrong.empty() && verification.close(true) == 0;
        });
    }

    const Input& mInput;
    Fleet& mFleet;
    bool mWhole = true;
    std::uint64_t mEntries = 0;
    std::uint64_t mStated = 0;
    UnitLog mOwn; // of a log that names no machine
    std::unordered_map<std::string, std::unique_ptr<UnitLog>> mLogs;
    LogSource mSource;
    Dress mDress;
};

} // namespace

std::vector<Unread> readFleet(const std::vector<std::string>& paths, Fleet& fleet)
{
    std::vector<Unread> unread;
    const std::vector<Input> inputs = inputsOf(paths, unread);
    std::vector<std::string> wrong(inputs.size());
    std::atomic<std::size_t> next = 0;
    const auto work = [&] {
        for (std::size_t index = next++; index < inputs.size(); index = next++) {
            wrong[index] = InputReader(inputs[index], fleet).read();
        }
    };
    std::vector<std::future<void>> workers;
    for (unsigned worker = 1; worker < std::min<std::size_t>(std::thread::hardware_concurrency(), inputs.size());
         ++worker) {
        workers.push_back(std::async(std::launch::async, work));
    }
    work();
    for (std::future<void>& worker : workers) {
        worker.get();
    }
    for (std::size_t index = 0; index < inputs.size(); ++index) {
        if (!wrong[index].empty()) {
            unread.push_back({escaped(inputs[index].name), wrong[index]});
        }
    }
    return unread;
}
