#include "fleet/reading.h"

#include "findings.h"
#include "log/catalogue.h"
#include "log/dress.h"
#include "log/source.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <memory>
#include <thread>
#include <unordered_map>

#include <unistd.h>

namespace
{

namespace fs = std::filesystem;

const std::size_t blockSize = std::size_t{256} * 1024; // bytes
const std::size_t mostBoots = 64;                      // of a machine, whose place in the journal is kept

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
        if (!fs::is_directory(path, error)) {
            addFile(path, inputs);
            continue;
        }
        std::vector<std::string> files;
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
        for (const std::string& found : files) {
            addFile(found, inputs);
        }
    }
    return inputs;
}

template <typename Number>
Number numberIn(const std::string& text, int base = 10)
{
    Number number = 0;
    std::from_chars(text.data(), text.data() + text.size(), number, base);
    return number;
}

/// How far a machine's journal has been read, by the clock that only goes forward.
struct Place
{
    std::uint64_t boot = 0;
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
        const auto boot = numberIn<std::uint64_t>(entry.boot.substr(0, 16), 16) ^
                          numberIn<std::uint64_t>(entry.boot.substr(std::min<std::size_t>(16, entry.boot.size())), 16);
        if (!isNew(boot, numberIn<std::uint64_t>(entry.monotonic))) {
            mFleet.addRepeats(1);
            return false;
        }
        if (const Run* run = mBuilder.current(); run != nullptr && run->number != mNumber) {
            mNumber = run->number;
            mBegan = mTime;
            mBootOfRun = mBoot;
        }
        mTime = numberIn<std::int64_t>(entry.realtime) / 1000000;
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
    bool isNew(std::uint64_t boot, std::uint64_t time)
    {
        auto place = std::find_if(mPlaces.rbegin(), mPlaces.rend(), [&](const Place& one) { return one.boot == boot; });
        if (place == mPlaces.rend()) {
            mPlaces.erase(mPlaces.begin(), mPlaces.begin() + (mPlaces.size() < mostBoots ? 0 : 1));
            mPlaces.push_back({boot, time, 1, 1});
            return true;
        }
        if (time < place->time) {
            place->again = 0;
            return false;
        }
        if (time > place->time) {
            *place = {boot, time, 1, 1};
            return true;
        }
        const bool known = place->again++ < place->count;
        place->count += known ? 0 : 1;
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
    std::vector<Place> mPlaces;
    std::int64_t mTime = 0; // of the last entry, s
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
        const bool opened = wrong.empty();
        std::vector<char> block(opened ? blockSize : 0);
        ssize_t length = opened ? 1 : 0;
        while (length > 0) {
            length = ::read(mSource.descriptor(), block.data(), block.size());
            if (length < 0 && errno == EINTR) {
                length = 1;
                continue;
            }
            wrong = length < 0 ? std::strerror(errno) : "";
            mDress.feed({block.data(), static_cast<std::size_t>(std::max<ssize_t>(length, 0))});
        }
        mDress.finish();
        if (opened && wrong.empty()) {
            wrong = whatIsWrong(mSource.close(true));
        }
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
        if (mInput.kind == Kind::JOURNAL && (status != 0 || (mEntries < entriesStated() && !isVerified()))) {
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
            std::array<unsigned char, 160> header{};
            std::ifstream(path, std::ios::binary).read(reinterpret_cast<char*>(header.data()), header.size());
            for (std::size_t byte = 0; byte < 8; ++byte) {
                sum += std::uint64_t{header[152 + byte]} << (8 * byte);
            }
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
