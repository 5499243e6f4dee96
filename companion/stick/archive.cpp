#include "stick/archive.h"

#include <algorithm>
#include <array>
#include <memory>
#include <set>
#include <vector>

#include <minizip/unzip.h>
#include <sys/stat.h>
#include <unistd.h>
#include <zlib.h>

namespace
{

const std::size_t blockSize = std::size_t{1024} * 1024; // bytes
const std::uint64_t largestArchive = 4ULL << 30U;       // bytes; a file on a FAT stick is smaller
const std::uint64_t mostUnpacked = 4ULL << 30U;         // bytes of all entries together
const std::uint64_t mostEntries = 100'000;
const std::size_t mostName = 1024;        // bytes of an entry's name that are looked at
const std::uint64_t localHeader = 30;     // bytes of an entry's header in front of its name, APPNOTE 4.3.7
const std::uint64_t directoryHeader = 46; // bytes of its record in the directory in front of its name, 4.3.12
const std::uint64_t endRecord = 22;       // bytes behind the directory at least, 4.3.16

/// Faults of one kind: the first is shown, the others are counted.
struct Faults
{
    std::string first;
    std::uint64_t count = 0;

    /// @param offset  where in the archive the entry's data or its record is (bytes)
    void add(const std::string& entry, std::uint64_t offset, const std::string& text)
    {
        if (count++ == 0) {
            first = "the entry " + shown(entry) + " at offset " + std::to_string(offset) + ' ' + text;
        }
    }

    std::string text() const
    {
        return count == 1 ? first : first + ", and " + counted(count - 1, "further entry", "further entries");
    }
};

struct Entry
{
    std::string name;
    unz_file_info64 info = {};
};

/// Calls `visit` with every entry of the archive of `size` bytes until it returns false. False when the directory is
/// damaged.
template <typename Visit>
bool forEachEntry(unzFile archive, std::uint64_t size, Visit visit)
{
    int status = unzGoToFirstFile(archive);
    for (; status == UNZ_OK; status = unzGoToNextFile(archive)) {
        Entry entry;
        std::array<char, mostName> name{};
        if (unzGetCurrentFileInfo64(archive, &entry.info, name.data(), name.size(), nullptr, 0, nullptr, 0) != UNZ_OK) {
            return false;
        }
        const std::uint64_t behindHeader =
            entry.info.size_filename + entry.info.size_file_extra + entry.info.size_file_comment;
        if (unzGetOffset64(archive) + directoryHeader + behindHeader + endRecord > size) {
            return false;
        }
        entry.name.assign(name.data(), std::min<std::size_t>(entry.info.size_filename, name.size()));
        if (!visit(entry)) {
            return true;
        }
    }
    return status == UNZ_END_OF_LIST_OF_FILE;
}

/// True when unpacking the entry `name` as it stands would write outside the folder it is unpacked into.
bool leavesFolder(const std::string& name)
{
    std::string slashed = '/' + name + '/';
    std::replace(slashed.begin(), slashed.end(), '\\', '/');
    const bool drive = name.size() > 1 && name[1] == ':';
    return drive || startsWith(slashed, "//") || contains(slashed, "/../");
}

/// True when `name` is below one of `folders`.
bool liesBelow(const std::set<std::string>& folders, const std::string& name)
{
    for (std::size_t slash = name.find('/'); slash != std::string::npos; slash = name.find('/', slash + 1)) {
        if (folders.count(name.substr(0, slash)) > 0) {
            return true;
        }
    }
    return false;
}

/// The archive check: each operation adds to the report what it finds.
class ArchiveCheck
{
public:
    ArchiveCheck(int descriptor, std::uint64_t size, const std::string& name, Report& report)
        : mDescriptor(descriptor), mSize(size), mName(name), mReport(report), mBuffer(blockSize)
    {
    }

    void run()
    {
        mReport.addFact("archive_bytes", "Archive", mName + ", " + byteCount(mSize), mSize);
        mReport.define({{"archive", mName}, {"size", byteCount(mSize)}});
        if (mSize > largestArchive) {
            mReport.add("archive-too-large", {{"most", byteCount(largestArchive)}});
            return;
        }
        if (readWhole() && open() && checkDirectory()) {
            forEachEntry(mArchive.get(), mSize, [&](const Entry& entry) {
                testEntry(entry);
                return true;
            });
            reportContents();
        }
    }

private:
    /// Reads up to `length` bytes from `offset` on; fewer when the medium fails or the file has become shorter.
    std::string readAt(std::uint64_t offset, std::size_t length) const
    {
        std::string bytes(length, '\0');
        const ssize_t count = pread(mDescriptor, bytes.data(), length, static_cast<off_t>(offset));
        bytes.resize(static_cast<std::size_t>(std::max<ssize_t>(count, 0)));
        return bytes;
    }

    /// Reads the archive from end to end, as the upload does. False when it cannot be read.
    bool readWhole()
    {
        for (std::uint64_t offset = 0; offset < mSize; offset += blockSize) {
            const std::uint64_t end = offset + readAt(offset, blockSize).size();
            if (end < std::min<std::uint64_t>(mSize, offset + blockSize)) {
                mReport.add("archive-unreadable", {{"offset", std::to_string(end)}});
                return false;
            }
        }
        return true;
    }

    /// Opens the archive. False when it is none or an empty one.
    bool open()
    {
        mArchive.reset(unzOpen64(("/proc/self/fd/" + std::to_string(mDescriptor)).c_str()));
        unz_global_info64 info = {};
        const std::string magic = readAt(0, 4);
        const bool opened = mArchive && unzGetGlobalInfo64(mArchive.get(), &info) == UNZ_OK;
        if (opened ? info.number_entry == 0 : magic == "PK\x05\x06") { // at offset 0 the library takes it for none
            mReport.add("archive-empty");
        } else if (!opened) {
            mReport.add(magic == "PK\x03\x04" ? "archive-not-zip.cut" : "archive-not-zip");
        }
        return info.number_entry > 0;
    }

    /// Adds up what the directory of the archive declares. False when it is damaged, or too much to unpack.
    bool checkDirectory()
    {
        Faults leaving;
        std::set<std::string> links;
        const bool intact = forEachEntry(mArchive.get(), mSize, [&](const Entry& entry) {
            mPackedBytes += std::min<std::uint64_t>(entry.info.compressed_size, UINT64_MAX - mPackedBytes);
            mDeclaredBytes += std::min<std::uint64_t>(entry.info.uncompressed_size, UINT64_MAX - mDeclaredBytes);
            if (leavesFolder(entry.name)) {
                leaving.add(entry.name, unzGetOffset64(mArchive.get()), "lies outside the folder it is unpacked into");
            } else if (liesBelow(links, entry.name)) {
                leaving.add(entry.name, unzGetOffset64(mArchive.get()), "lies below a symbolic link of the archive");
            }
            if (S_ISLNK(entry.info.external_fa >> 16U)) { // where Info-ZIP keeps stat(2)'s mode
                links.insert(entry.name);
            }
            return ++mEntries <= mostEntries;
        });
        mReport.addFact("archive_entries", "Entries", std::to_string(mEntries), mEntries);
        mReport.addFact("archive_declared_bytes", "Declared size", byteCount(mDeclaredBytes) + " unpacked",
                        mDeclaredBytes);
        if (leaving.count > 0) {
            mReport.add("archive-entry-path", {{"entries", leaving.text()}});
        }
        if (!intact) {
            mReport.add("archive-damaged",
                        {{"entries", "its directory is damaged after " + counted(mEntries, "entry", "entries")}});
        } else if (mEntries > mostEntries) {
            mReport.add("archive-bomb.entries", {{"most", counted(mostEntries, "entry", "entries")}});
        } else if (mDeclaredBytes > mostUnpacked || mPackedBytes > mSize) {
            mReport.add("archive-bomb.declared",
                        {{"declared", byteCount(mDeclaredBytes)}, {"packed", byteCount(mPackedBytes)}});
        } else {
            return true;
        }
        return false;
    }

    void testEntry(const Entry& entry)
    {
        unzFile archive = mArchive.get();
        const std::uint64_t record = unzGetOffset64(archive);
        if ((entry.info.flag & 1U) != 0) {
            mUntested.add(entry.name, record, "is encrypted");
            return;
        }
        if (entry.info.compression_method != Z_DEFLATED && entry.info.compression_method != 0) {
            mUntested.add(entry.name, record, "is packed by method " + std::to_string(entry.info.compression_method));
            return;
        }
        if (unzOpenCurrentFile(archive) != UNZ_OK) {
            mDamaged.add(entry.name, record, "has a damaged header");
            return;
        }
        const std::uint64_t data = unzGetCurrentFileZStreamPos64(archive);
        const std::string local = localName(entry, data);
        std::uint64_t bytes = 0;
        int count = 0;
        while ((count = unzReadCurrentFile(archive, mBuffer.data(), static_cast<unsigned>(mBuffer.size()))) > 0) {
            bytes += static_cast<std::uint64_t>(count);
        }
        const bool sound = unzCloseCurrentFile(archive) == UNZ_OK;
        if (local != entry.name && entry.info.size_filename <= mostName) {
            mDamaged.add(entry.name, data, "is named " + shown(local) + " in front of its data");
        } else if (count == 0 && bytes != entry.info.uncompressed_size) {
            mDamaged.add(entry.name, data,
                         "declares " + byteCount(entry.info.uncompressed_size) + " but holds " + byteCount(bytes));
        } else if (count < 0 || !sound) {
            mDamaged.add(entry.name, data, count < 0 ? "has damaged data" : "does not have the checksum it declares");
        }
    }

    /// The name in the header of the archive's open entry, in front of its data; notes where the first one begins.
    std::string localName(const Entry& entry, std::uint64_t data)
    {
        const std::uint64_t length = std::min<std::uint64_t>(entry.info.size_filename, mostName);
        const int extra = unzGetLocalExtrafield(mArchive.get(), nullptr, 0);
        const std::uint64_t behind = entry.info.size_filename + static_cast<std::uint64_t>(std::max(extra, 0));
        mFirstEntry = std::min(mFirstEntry, data - std::min(data, behind + localHeader));
        return readAt(data - std::min(data, behind), static_cast<std::size_t>(length));
    }

    void reportContents()
    {
        if (mDamaged.count > 0) {
            mReport.add("archive-damaged", {{"entries", mDamaged.text()}});
        }
        if (mUntested.count > 0) {
            mReport.add("archive-untested", {{"entries", mUntested.text()}});
        }
        if (mFirstEntry > 0 && mFirstEntry < mSize) {
            mReport.add("archive-prefix", {{"prefix", byteCount(mFirstEntry)}});
        }
        const std::uint64_t boardBytes = mSize + mDeclaredBytes;
        mReport.addFact("board_bytes", "Needed on the board",
                        byteCount(boardBytes) + ": the archive and everything in it side by side", boardBytes);
    }

    int mDescriptor;
    std::uint64_t mSize;
    const std::string& mName;
    Report& mReport;
    std::vector<char> mBuffer;
    std::unique_ptr<void, int (*)(unzFile)> mArchive{nullptr, unzClose};
    std::uint64_t mEntries = 0;
    std::uint64_t mPackedBytes = 0;
    std::uint64_t mDeclaredBytes = 0;
    std::uint64_t mFirstEntry = UINT64_MAX; // offset of its header
    Faults mDamaged;
    Faults mUntested;
};

} // namespace

void checkArchive(int descriptor, std::uint64_t size, const std::string& name, Report& report)
{
    ArchiveCheck(descriptor, size, name, report).run();
}
