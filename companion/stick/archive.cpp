#include "stick/archive.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <memory>
#include <optional>
#include <set>
#include <vector>

#include <minizip/unzip.h>
#include <sys/stat.h>
#include <zlib.h>

namespace
{

const std::size_t blockSize = std::size_t{64} * 1024; // bytes
const std::uint64_t largestArchive = 4ULL << 30U;     // bytes; a file on a FAT stick is smaller
const std::uint64_t mostEntries = 100'000;
const std::size_t mostName = 1024;                // bytes of an entry's name that are looked at
const std::uint64_t localHeader = 30;             // bytes of an entry's header in front of its name, APPNOTE 4.3.7
const std::uint64_t suspiciousRatio = 100;        // unpacked to packed; software packs to a half or a tenth
const std::uint64_t suspiciousSize = 100'000'000; // bytes

/// The source as a stream, whose buffer spares the medium the zip library's reads of single bytes.
struct Stream
{
    const ArchiveSource& source;
    std::uint64_t position = 0;
    std::optional<std::uint64_t> failedAt; ///< the offset of the first byte that could not be read

    static ssize_t read(void* cookie, char* buffer, std::size_t length)
    {
        auto& stream = *static_cast<Stream*>(cookie);
        const std::uint64_t rest = stream.source.size - stream.position;
        const auto wanted = static_cast<std::size_t>(std::min<std::uint64_t>(length, rest));
        const std::size_t count = stream.source.read(stream.position, buffer, wanted);
        stream.position += count;
        if (count == 0 && wanted > 0) {
            stream.failedAt = stream.position;
            return -1;
        }
        return static_cast<ssize_t>(count);
    }

    static int seek(void* cookie, off64_t* offset, int origin)
    {
        auto& stream = *static_cast<Stream*>(cookie);
        const std::uint64_t base = origin == SEEK_CUR ? stream.position : origin == SEEK_END ? stream.source.size : 0;
        const auto target = static_cast<off64_t>(base) + *offset;
        if (target < 0 || static_cast<std::uint64_t>(target) > stream.source.size) {
            return -1;
        }
        *offset = target;
        stream.position = static_cast<std::uint64_t>(target);
        return 0;
    }
};

/// The zip library's own functions for files, but for opening one: that is the Stream at `opaque`.
zlib_filefunc64_def libraryFunctions(Stream& stream)
{
    zlib_filefunc64_def functions = {};
    fill_fopen64_filefunc(&functions);
    functions.opaque = &stream;
    functions.zopen64_file = [](voidpf opaque, const void*, int) -> voidpf {
        std::FILE* const file = fopencookie(opaque, "rb", {Stream::read, nullptr, Stream::seek, nullptr});
        if (file != nullptr) {
            std::setvbuf(file, nullptr, _IOFBF, blockSize);
        }
        return file;
    };
    return functions;
}

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

/// Calls `visit` with every entry until it returns false. False when the directory is damaged.
template <typename Visit>
bool forEachEntry(unzFile archive, Visit visit)
{
    int status = unzGoToFirstFile(archive);
    for (; status == UNZ_OK; status = unzGoToNextFile(archive)) {
        Entry entry;
        std::array<char, mostName> name{};
        if (unzGetCurrentFileInfo64(archive, &entry.info, name.data(), name.size(), nullptr, 0, nullptr, 0) != UNZ_OK) {
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
    return drive || slashed.rfind("//", 0) == 0 || slashed.find("/../") != std::string::npos;
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

std::string hexadecimal(uLong value)
{
    std::array<char, 20> buffer{};
    std::snprintf(buffer.data(), buffer.size(), "%08lx", value);
    return buffer.data();
}

void addUp(std::uint64_t& sum, std::uint64_t value)
{
    sum = value > UINT64_MAX - sum ? UINT64_MAX : sum + value;
}

/// What unpacking an entry gave.
struct Unpacked
{
    std::uint64_t bytes = 0;
    uLong checksum = crc32(0, nullptr, 0);
    bool complete = false; ///< The packed data ended where its own end mark and its length say.

    void add(const Bytef* data, std::size_t count)
    {
        bytes += count;
        checksum = crc32(checksum, data, static_cast<uInt>(count));
    }
};

/// The next packed bytes of the archive's open entry: their number, 0 at its end, negative on an error.
int readPacked(unzFile archive, std::vector<Bytef>& buffer)
{
    return unzReadCurrentFile(archive, buffer.data(), static_cast<unsigned>(buffer.size()));
}

/// Reads the archive's open entry that is not packed, at most about `limit` bytes.
Unpacked readStored(unzFile archive, std::uint64_t limit)
{
    Unpacked result;
    std::vector<Bytef> plain(blockSize);
    int count = 0;
    while (result.bytes <= limit && (count = readPacked(archive, plain)) > 0) {
        result.add(plain.data(), static_cast<std::size_t>(count));
    }
    result.complete = count == 0;
    return result;
}

/// Unpacks the archive's open entry, at most about `limit` bytes, into nothing.
///
/// The zip library's own reading stops at the declared size and so would not see an entry that holds more.
Unpacked inflateEntry(unzFile archive, std::uint64_t limit)
{
    Unpacked result;
    std::vector<Bytef> packed(blockSize);
    std::vector<Bytef> plain(blockSize);
    z_stream stream = {};
    if (inflateInit2(&stream, -MAX_WBITS) != Z_OK) {
        throw std::bad_alloc();
    }
    const std::unique_ptr<z_stream, int (*)(z_stream*)> closer(&stream, inflateEnd);

    int status = Z_OK;
    while (status == Z_OK && result.bytes <= limit) {
        if (stream.avail_in == 0) {
            stream.next_in = packed.data();
            stream.avail_in = static_cast<uInt>(std::max(readPacked(archive, packed), 0));
        }
        stream.next_out = plain.data();
        stream.avail_out = static_cast<uInt>(plain.size());
        status = inflate(&stream, Z_NO_FLUSH); // without input: what it still holds, then Z_BUF_ERROR
        result.add(plain.data(), plain.size() - stream.avail_out);
    }
    result.complete = status == Z_STREAM_END && stream.avail_in == 0 && readPacked(archive, packed) == 0;
    return result;
}

/// The archive check: each operation adds to the report what it finds.
class ArchiveCheck
{
public:
    ArchiveCheck(const ArchiveSource& source, const std::string& name, Report& report, std::uint64_t mostUnpacked)
        : mSource(source), mName(name), mReport(report), mMostUnpacked(mostUnpacked), mStream{source, 0, {}}
    {
    }

    void run()
    {
        mReport.addFact("archive_bytes", "Archive", mName + ", " + byteCount(mSource.size), mSource.size);
        mReport.define({{"archive", mName}, {"size", byteCount(mSource.size)}});
        if (mSource.size > largestArchive) {
            mReport.add("archive-too-large", {{"most", byteCount(largestArchive)}});
            return;
        }
        if (open() && checkDirectory() && checkClaims() && readWhole()) {
            testEntries();
            reportContents();
        }
    }

private:
    void addUnreadable(std::uint64_t offset)
    {
        mReport.add("archive-unreadable", {{"offset", std::to_string(offset)}});
    }

    /// Opens the archive. False when it is none or an empty one.
    bool open()
    {
        zlib_filefunc64_def functions = libraryFunctions(mStream);
        mArchive.reset(unzOpen2_64(mName.c_str(), &functions));
        unz_global_info64 info = {};
        if (mArchive && unzGetGlobalInfo64(mArchive.get(), &info) == UNZ_OK) {
            if (info.number_entry == 0) {
                mReport.add("archive-empty");
            }
            return info.number_entry > 0;
        }
        std::string magic(static_cast<std::size_t>(std::min<std::uint64_t>(mSource.size, 4)), '\0');
        magic.resize(mSource.read(0, magic.data(), magic.size()));
        if (mStream.failedAt) {
            addUnreadable(*mStream.failedAt);
        } else { // the library takes an end record at offset 0 for none
            mReport.add(magic == "PK\x05\x06"   ? "archive-empty"
                        : magic == "PK\x03\x04" ? "archive-not-zip.cut"
                                                : "archive-not-zip");
        }
        return false;
    }

    /// Adds up what the directory of the archive declares. False when it is damaged.
    bool checkDirectory()
    {
        Faults leaving;
        std::set<std::string> links;
        const bool intact = forEachEntry(mArchive.get(), [&](const Entry& entry) {
            addUp(mPackedBytes, entry.info.compressed_size);
            addUp(mDeclaredBytes, entry.info.uncompressed_size);
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
        if (mStream.failedAt) {
            addUnreadable(*mStream.failedAt);
            return false;
        }
        if (!intact) {
            mReport.add("archive-damaged", {{"entries", "its directory is damaged at offset " +
                                                            std::to_string(unzGetOffset64(mArchive.get())) +
                                                            ", behind " + counted(mEntries, "entry", "entries")}});
        }
        return intact;
    }

    /// Judges what the directory declares. False when it is too much to unpack.
    bool checkClaims()
    {
        if (mEntries > mostEntries) {
            mReport.add("archive-bomb.entries", {{"most", counted(mostEntries, "entry", "entries")}});
            return false;
        }
        if (mDeclaredBytes > mMostUnpacked || mPackedBytes > mSource.size) {
            mReport.add("archive-bomb.declared",
                        {{"declared", byteCount(mDeclaredBytes)}, {"packed", byteCount(mPackedBytes)}});
            return false;
        }
        return true;
    }

    /// Reads the archive from end to end, as the upload does.
    bool readWhole()
    {
        std::vector<char> buffer(16 * blockSize);
        for (std::uint64_t offset = 0; offset < mSource.size;) {
            const auto wanted = static_cast<std::size_t>(std::min<std::uint64_t>(buffer.size(), mSource.size - offset));
            const std::size_t count = mSource.read(offset, buffer.data(), wanted);
            offset += count;
            if (count < wanted) {
                addUnreadable(offset);
                return false;
            }
        }
        return true;
    }

    /// Unpacks every entry, until all of them hold more than is tested.
    void testEntries()
    {
        forEachEntry(mArchive.get(), [&](const Entry& entry) {
            testEntry(entry);
            return mUnpackedBytes <= mMostUnpacked;
        });
    }

    void testEntry(const Entry& entry)
    {
        unzFile archive = mArchive.get();
        const bool deflated = entry.info.compression_method == Z_DEFLATED;
        const std::uint64_t record = unzGetOffset64(archive);
        if ((entry.info.flag & 1U) != 0) {
            mUntested.add(entry.name, record, "is encrypted");
            return;
        }
        if (!deflated && entry.info.compression_method != 0) {
            mUntested.add(entry.name, record, "is packed by method " + std::to_string(entry.info.compression_method));
            return;
        }
        int method = 0;
        int level = 0;
        if (unzOpenCurrentFile2(archive, &method, &level, 1) != UNZ_OK) {
            mDamaged.add(entry.name, record, "has a damaged header");
            return;
        }
        const std::uint64_t data = unzGetCurrentFileZStreamPos64(archive);
        const std::string local = localName(entry, data);
        const std::uint64_t limit = mMostUnpacked - mUnpackedBytes;
        const Unpacked unpacked = deflated ? inflateEntry(archive, limit) : readStored(archive, limit);
        unzCloseCurrentFile(archive);
        mUnpackedBytes += unpacked.bytes;
        if (local != entry.name && entry.info.size_filename <= mostName) {
            mDamaged.add(entry.name, data, "is named " + shown(local) + " in front of its data");
        } else if (unpacked.bytes != entry.info.uncompressed_size) {
            mDamaged.add(entry.name, data,
                         "declares " + byteCount(entry.info.uncompressed_size) + " but holds " +
                             byteCount(unpacked.bytes));
        } else if (unpacked.checksum != entry.info.crc) {
            mDamaged.add(entry.name, data,
                         "has the checksum " + hexadecimal(unpacked.checksum) + " instead of " +
                             hexadecimal(entry.info.crc));
        } else if (!unpacked.complete) {
            mDamaged.add(entry.name, data, "has damaged data");
        }
    }

    /// The name in the header of the archive's open entry, in front of its data; notes where the first one begins.
    std::string localName(const Entry& entry, std::uint64_t data)
    {
        const std::uint64_t length = std::min<std::uint64_t>(entry.info.size_filename, mostName);
        const int extra = unzGetLocalExtrafield(mArchive.get(), nullptr, 0);
        const std::uint64_t behind = entry.info.size_filename + static_cast<std::uint64_t>(std::max(extra, 0));
        mFirstEntry = std::min(mFirstEntry, data - std::min(data, behind + localHeader));
        std::string name(static_cast<std::size_t>(length), '\0');
        name.resize(mSource.read(data - std::min(data, behind), name.data(), name.size()));
        return name;
    }

    void reportContents()
    {
        mReport.addFact("archive_unpacked_bytes", "Real size", byteCount(mUnpackedBytes) + " unpacked", mUnpackedBytes);
        if (mUnpackedBytes > mMostUnpacked) {
            mReport.add("archive-bomb.real",
                        {{"declared", byteCount(mDeclaredBytes)}, {"most", byteCount(mMostUnpacked)}});
            return;
        }
        if (mDamaged.count > 0) {
            mReport.add("archive-damaged", {{"entries", mDamaged.text()}});
        }
        if (mUntested.count > 0) {
            mReport.add("archive-untested", {{"entries", mUntested.text()}});
        }
        if (mUnpackedBytes > suspiciousSize && mUnpackedBytes / suspiciousRatio > mSource.size) {
            mReport.add("archive-ratio", {{"ratio", std::to_string(mUnpackedBytes / mSource.size)}});
        }
        const std::uint64_t padding = mSource.size - mPackedBytes;
        if (padding > suspiciousSize) {
            mReport.add("archive-padding", {{"padding", byteCount(padding)}});
        }
        if (mFirstEntry > 0 && mFirstEntry < mSource.size) {
            mReport.add("archive-prefix", {{"prefix", byteCount(mFirstEntry)}});
        }
        const std::uint64_t boardBytes = mSource.size + mUnpackedBytes;
        mReport.addFact("board_bytes", "Needed on the board",
                        byteCount(boardBytes) + ": the archive and everything in it side by side", boardBytes);
    }

    const ArchiveSource& mSource;
    const std::string& mName;
    Report& mReport;
    std::uint64_t mMostUnpacked;
    Stream mStream;
    std::unique_ptr<void, int (*)(unzFile)> mArchive{nullptr, unzClose};
    std::uint64_t mEntries = 0;
    std::uint64_t mPackedBytes = 0;
    std::uint64_t mDeclaredBytes = 0;
    std::uint64_t mUnpackedBytes = 0;
    std::uint64_t mFirstEntry = UINT64_MAX; // offset of its header
    Faults mDamaged;
    Faults mUntested;
};

} // namespace

void checkArchive(const ArchiveSource& source, const std::string& name, Report& report, std::uint64_t mostUnpacked)
{
    ArchiveCheck(source, name, report, mostUnpacked).run();
}
