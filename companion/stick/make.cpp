#include "stick/make.h"

#include "command.h"
#include "descriptor.h"
#include "findings.h"
#include "procedure.h"
#include "stick/archive.h"
#include "stick/folder.h"
#include "stick/signature.h"
#include "stick/stick_check.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <ostream>
#include <stdexcept>
#include <system_error>
#include <vector>

#include <fcntl.h>
#include <unistd.h>

namespace
{

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

const char versionPrefix[] = "quorb";
static_assert(sizeof versionPrefix - 1 == versionPrefixLength);
const std::string replaced = ".replaced-";      // before the name of a version folder
const std::uint64_t largestOnFat = 0xFFFFFFFF;  // bytes, of a file
const std::size_t block = std::size_t{1} << 20; // bytes
const std::uint64_t flushed = 4 * block;        // so that the progress is the medium's, not the memory's

[[noreturn]] void fail(const fs::path& path, const std::string& why)
{
    throw std::runtime_error(shown(path.string()) + ' ' + why);
}

[[noreturn]] void failWithErrno(const fs::path& path, const std::string& what)
{
    fail(path, what + ": " + std::generic_category().message(errno));
}

/// Shows how far the work is, once a second, and ends it when the program is to end.
class Progress
{
public:
    Progress(std::uint64_t total, bool visible, const HeldSignals& signals, std::ostream& errors)
        : mTotal(total), mVisible(visible), mSignals(signals), mErrors(errors)
    {
    }
    ~Progress()
    {
        if (mVisible) {
            mErrors << '\n';
        }
    }
    Progress(const Progress&) = delete;
    Progress& operator=(const Progress&) = delete;

    void add(const char* step, std::uint64_t bytes)
    {
        if (mSignals.any()) {
            throw std::runtime_error("it was ended"); // not seen: the signal takes effect once all is cleared away
        }
        mDone += bytes;
        const auto now = Clock::now();
        if (!mVisible || (now - mShown < std::chrono::seconds(1) && mDone != mTotal)) {
            return;
        }
        mShown = now;
        const double seconds = std::max(std::chrono::duration<double>(now - mBegin).count(), 0.001);
        const auto rate = static_cast<std::uint64_t>(static_cast<double>(mDone) / seconds);
        mErrors << '\r' << step << ": " << mDone * 100 / mTotal << " %, " << rate / 1'000 << " kB/s, "
                << (mTotal - mDone) / std::max<std::uint64_t>(rate, 1) << " s left    " << std::flush;
    }

private:
    std::uint64_t mTotal;
    std::uint64_t mDone = 0;
    bool mVisible;
    const HeldSignals& mSignals;
    std::ostream& mErrors;
    Clock::time_point mBegin = Clock::now();
    Clock::time_point mShown;
};

std::ifstream openSource(const fs::path& path)
{
    std::ifstream file(path, std::ios::binary);
    if (!fs::is_regular_file(path)) {
        fail(path, fs::exists(path) ? "is no plain file." : "is missing.");
    }
    if (!file) {
        failWithErrno(path, "cannot be read");
    }
    return file;
}

/// The next block of the file, shorter at its end.
std::string nextBlock(std::ifstream& file, const fs::path& path)
{
    std::string bytes(block, '\0');
    file.read(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    if (file.bad()) {
        failWithErrno(path, "cannot be read");
    }
    bytes.resize(static_cast<std::size_t>(file.gcount()));
    return bytes;
}

void copyFile(const fs::path& from, const fs::path& to, mode_t mode, Progress& progress)
{
    std::ifstream source = openSource(from);
    const Descriptor target(open(to.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, mode));
    std::uint64_t pending = 0;
    for (std::string bytes; target && !(bytes = nextBlock(source, from)).empty();) {
        for (std::size_t done = 0; done < bytes.size();) {
            const ssize_t count = write(target.number(), bytes.data() + done, bytes.size() - done);
            if (count < 0 && errno != EINTR) {
                failWithErrno(to, "cannot be written");
            }
            done += static_cast<std::size_t>(std::max<ssize_t>(count, 0));
        }
        pending += bytes.size();
        if (pending >= flushed && fdatasync(target.number()) == 0) {
            pending = 0;
        }
        progress.add("Writing", bytes.size());
    }
    if (!target || fsync(target.number()) != 0) {
        failWithErrno(to, "cannot be written");
    }
}

/// Compares the two files, the second as the medium has it: its pages in memory are dropped first.
void compareFile(const fs::path& from, const fs::path& to, Progress& progress)
{
    const Descriptor written(open(to.c_str(), O_RDONLY | O_CLOEXEC));
    if (!written || posix_fadvise(written.number(), 0, 0, POSIX_FADV_DONTNEED) != 0) {
        failWithErrno(to, "cannot be read back");
    }
    std::ifstream source = openSource(from);
    std::ifstream target = openSource(to);
    for (std::string bytes; !(bytes = nextBlock(source, from)).empty();) {
        if (nextBlock(target, to) != bytes) {
            fail(to, "reads back differently: the stick is broken. Use another one.");
        }
        progress.add("Comparing", bytes.size());
    }
}

void flush(const fs::path& path)
{
    const Descriptor folder(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!folder || syncfs(folder.number()) != 0) {
        failWithErrno(path, "cannot be written to the end");
    }
}

/// What `stick` would find wrong with the version and the two files; FAT's limits are those of `stick make` itself.
void checkSources(const MakeOptions& options, Report& report)
{
    checkVersionName(versionPrefix + options.version, report);
    const std::string& version = options.version;
    if (version.find_first_of("\"*/:<>?\\|") != std::string::npos || (!version.empty() && version.back() == '.') ||
        version.find_first_not_of(' ') == std::string::npos || version.size() > 200) {
        fail(version, "cannot be in the name of a folder on a stick.");
    }
    openSource(options.archive);
    const std::uint64_t size = fs::file_size(options.archive);
    if (size == 0 || size > largestOnFat) {
        fail(options.archive, size == 0 ? "is empty." : "is larger than a file on a stick can be, 4 GiB.");
    }
    const Descriptor archive(open(options.archive.c_str(), O_RDONLY | O_CLOEXEC));
    checkArchive(archive.number(), size, shown(options.archive), report);
    std::ifstream script = openSource(options.script);
    checkScript(nextBlock(script, options.script), fs::file_size(options.script), shown(options.script), report);
}

bool isFlawless(const Report& report)
{
    return std::all_of(report.findings().begin(), report.findings().end(),
                       [](const Finding& finding) { return finding.severity == Severity::NOTE; });
}

/// The version folders that are to be replaced. Throws when they are not, or when something else is in the way.
std::vector<std::string> foldersInTheWay(const MakeOptions& options, const StickFolder& stick)
{
    for (const std::string path : {"debs", "debs/QUORB", boardFolder}) {
        const Node node = stick.node(path);
        if (node.kind != Node::FOLDER && (node.kind != Node::MISSING || node.present)) {
            fail(path, "on the stick is no folder. Remove it.");
        }
    }
    std::vector<std::string> folders;
    for (const std::string& name : stick.names(boardFolder).names) {
        if (name.front() == '.') {
            continue;
        }
        const std::string path = std::string(boardFolder) + '/' + name;
        if (stick.node(path).kind != Node::FOLDER) {
            fail(path, "is on the stick and would be taken for the version. Remove it.");
        }
        if (!options.replace) {
            fail(path, "is on the stick. Add --replace to replace it.");
        }
        folders.push_back(name);
    }
    const Node marker = stick.node("debs/installTV");
    if (options.teamViewer && marker.present && marker.kind != Node::FILE) {
        fail("debs/installTV", "on the stick is no plain file. Remove it.");
    }
    return folders;
}

/// Writes the version folder under a hidden name, compares it, and gives it its name.
void writeVersion(const MakeOptions& options, const std::vector<std::string>& old, std::ostream& errors)
{
    const fs::path folder = fs::path(options.target) / boardFolder;
    const std::string name = versionPrefix + options.version;
    const fs::path hidden = folder / (unfinishedPrefix + name);
    fs::create_directories(folder);
    for (const fs::directory_entry& entry : fs::directory_iterator(folder)) { // of a stick that was pulled out
        const std::string left = entry.path().filename();
        if (left.rfind(unfinishedPrefix, 0) == 0 || left.rfind(replaced, 0) == 0) {
            fs::remove_all(entry.path());
        }
    }
    const std::uint64_t bytes = fs::file_size(options.archive) + fs::file_size(options.script);
    if (fs::space(folder).available < bytes + block) {
        fail(options.target, "has no room for " + byteCount(bytes) + ". Remove something from it.");
    }
    const HeldSignals signals;
    try {
        for (const std::string& other : old) { // from here on until the end there is no version
            fs::rename(folder / other, folder / (replaced + other));
        }
        Progress progress(2 * bytes, options.progress, signals, errors);
        fs::create_directory(hidden);
        copyFile(options.archive, hidden / archiveName, 0644, progress);
        copyFile(options.script, hidden / scriptName, 0755, progress);
        flush(folder);
        compareFile(options.archive, hidden / archiveName, progress);
        compareFile(options.script, hidden / scriptName, progress);
        fs::remove(fs::path(options.target) / manifestName); // of what was there before
        fs::remove(fs::path(options.target) / signatureName);
        fs::rename(hidden, folder / name);
    } catch (const std::exception&) {
        std::error_code gone; // with the stick
        fs::remove_all(hidden, gone);
        for (const std::string& other : old) {
            fs::rename(folder / (replaced + other), folder / other, gone);
        }
        throw;
    }
    for (const std::string& other : old) {
        fs::remove_all(folder / (replaced + other));
    }
}

} // namespace

int makeStick(const MakeOptions& options, std::ostream& out, std::ostream& errors)
{
    try {
        Report sources("stick make", "What is to be written");
        checkSources(options, sources);
        if (!isFlawless(sources)) {
            sources.write(false, out);
            return Report::STATUS_NOT_FIT;
        }
        const StickFolder stick(options.target);
        if (stick.error() != 0) {
            fail(options.target, "cannot be opened: " + std::generic_category().message(stick.error()));
        }
        writeVersion(options, foldersInTheWay(options, stick), errors);
        if (options.teamViewer) {
            std::ofstream(fs::path(options.target) / "debs/installTV", std::ios::app);
        }
        if (!options.key.empty()) {
            signStick(options.target, options.version, options.oldest, options.key);
        }
        flush(options.target);
        Report report("stick", "The stick at " + shown(options.target));
        checkStick(stick, false, report);
        report.write(false, out);
        out << "\nWritten and compared. A stick's own cache can still lie: eject it, unplug it, plug it in again and "
               "run\n\n    harl-updater-tool stick "
            << escaped(options.target) << '\n';
        return report.status();
    } catch (const std::exception& error) {
        return refuse("stick", false, std::string("the stick is not made: ") + error.what(), out, errors);
    }
}
