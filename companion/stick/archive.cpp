#include "stick/archive.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstring>
#include <memory>
#include <optional>
#include <vector>

#include <minizip/unzip.h>
#include <zlib.h>

namespace
{

const std::size_t blockSize = std::size_t{64} * 1024; // bytes
const std::uint64_t largestArchive = 4ULL << 30U;     // bytes; a file on a FAT stick is smaller
const std::uint64_t mostEntries = 100'000;
const std::uint64_t suspiciousRatio = 100;        // unpacked to packed; software packs to a half or a tenth
const std::uint64_t suspiciousSize = 100'000'000; // bytes

const char* const damagedEffect =
    "copies the archive without looking into it. The board then fails to unpack it: only the script's status in the "
    "log tells so, and after 13 minutes the update counts as done.";
const char* const copyAgain =
    "Copy the archive to the stick again, release the stick before pulling it out, and run this check again.";
const char* const anotherArchive = "Put the board's own upgrade archive on the stick.";
const char* const bombEffect = "copies it without looking into it; unpacking it would fill the board.";

/// Hands `source` to the zip library, with a window that spares the medium its reads of single bytes.
class Window
{
public:
    explicit Window(const ArchiveSource& source) : mSource(source), mBytes(blockSize) {}

    std::size_t read(char* buffer, std::size_t length)
    {
        std::size_t done = 0;
        while (done < length && mPosition < mSource.size) {
            if (mPosition < mStart || mPosition >= mStart + mLength) {
                mStart = mPosition;
                const auto wanted = std::min<std::uint64_t>(mBytes.size(), mSource.size - mStart);
                mLength = mSource.read(mStart, mBytes.data(), static_cast<std::size_t>(wanted));
                if (mLength == 0) {
                    mFailedAt = mStart;
                    break;
                }
            }
            const auto from = static_cast<std::size_t>(mPosition - mStart);
            const std::size_t count = std::min(length - done, mLength - from);
            std::memcpy(buffer + done, mBytes.data() + from, count);
            done += count;
            mPosition += count;
        }
        return done;
    }

    bool seek(std::uint64_t offset, int origin)
    {
        const std::uint64_t base = origin == ZLIB_FILEFUNC_SEEK_CUR   ? mPosition
                                   : origin == ZLIB_FILEFUNC_SEEK_END ? mSource.size
                                                                      : 0;
        if (offset > mSource.size - std::min(base, mSource.size)) {
            return false;
        }
        mPosition = base + offset;
        return true;
    }

    std::uint64_t position() const { return mPosition; }

    /// The offset of the first byte that could not be read, if any.
    std::optional<std::uint64_t> failedAt() const { return mFailedAt; }

private:
    const ArchiveSource& mSource;
    std::vector<char> mBytes;
    std::uint64_t mStart = 0;
    std::size_t mLength = 0;
    std::uint64_t mPosition = 0;
    std::optional<std::uint64_t> mFailedAt;
};

zlib_filefunc64_def libraryFunctions(Window& window)
{
    zlib_filefunc64_def functions = {};
    functions.opaque = &window;
    functions.zopen64_file = [](voidpf opaque, const void*, int) -> voidpf { return opaque; };
    functions.zread_file = [](voidpf opaque, voidpf, void* buffer, uLong size) -> uLong {
        return static_cast<uLong>(static_cast<Window*>(opaque)->read(static_cast<char*>(buffer), size));
    };
    functions.zwrite_file = [](voidpf, voidpf, const void*, uLong) -> uLong { return 0; };
    functions.ztell64_file = [](voidpf opaque, voidpf) -> ZPOS64_T { return static_cast<Window*>(opaque)->position(); };
    functions.zseek64_file = [](voidpf opaque, voidpf, ZPOS64_T offset, int origin) -> long {
        return static_cast<Window*>(opaque)->seek(offset, origin) ? 0 : -1;
    };
    functions.zclose_file = [](voidpf, voidpf) -> int { return 0; };
    functions.zerror_file = [](voidpf opaque, voidpf) -> int {
        return static_cast<Window*>(opaque)->failedAt() ? 1 : 0;
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

/// The archive's current entry; nothing when its record is damaged.
std::optional<Entry> currentEntry(unzFile archive)
{
    Entry entry;
    std::array<char, 1024> name{};
    if (unzGetCurrentFileInfo64(archive, &entry.info, name.data(), name.size(), nullptr, 0, nullptr, 0) != UNZ_OK) {
        return std::nullopt;
    }
    entry.name.assign(name.data(), std::min<std::size_t>(entry.info.size_filename, name.size()));
    return entry;
}

/// Calls `visit` with every entry until it returns false. False when the directory is damaged.
template <typename Visit>
bool forEachEntry(unzFile archive, Visit visit)
{
    int status = unzGoToFirstFile(archive);
    while (status == UNZ_OK) {
        const std::optional<Entry> entry = currentEntry(archive);
        if (!entry) {
            return false;
        }
        if (!visit(*entry)) {
            return true;
        }
        status = unzGoToNextFile(archive);
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
        : mSource(source), mName(name), mReport(report), mMostUnpacked(mostUnpacked), mWindow(source)
    {
    }

    void run()
    {
        mReport.addFact("archive_bytes", "Archive", mName + ", " + byteCount(mSource.size), mSource.size);
        if (mSource.size > largestArchive) {
            add(Severity::ERROR, "archive-too-large",
                " has " + byteCount(mSource.size) + ", more than the " + byteCount(largestArchive) +
                    " that are tested.",
                "tries to copy all of it to the board, 20 times when that fails.", anotherArchive);
            return;
        }
        if (open() && checkDirectory() && checkClaims() && readWhole()) {
            testEntries();
            reportContents();
        }
    }

private:
    void add(Severity severity, const char* check, const std::string& what, const char* effect, const char* remedy)
    {
        mReport.add({severity, check, mName + what, effect, remedy});
    }

    void addUnreadable(std::uint64_t offset)
    {
        add(Severity::ERROR, "archive-unreadable",
            " cannot be read at offset " + std::to_string(offset) + ": the stick is damaged.",
            "tries the upload 20 times when the board has another version, gives up and shows the fail pattern; the "
            "board stays as it is.",
            "Use another stick.");
    }

    void addEmpty()
    {
        add(Severity::ERROR, "archive-empty", " has no entries.",
            "copies it; nothing is installed on the board, and after 13 minutes the update counts as done.",
            anotherArchive);
    }

    /// Opens the archive. False when it is none or an empty one.
    bool open()
    {
        zlib_filefunc64_def functions = libraryFunctions(mWindow);
        mArchive.reset(unzOpen2_64(mName.c_str(), &functions));
        unz_global_info64 info = {};
        if (mArchive && unzGetGlobalInfo64(mArchive.get(), &info) == UNZ_OK) {
            if (info.number_entry == 0) {
                addEmpty();
            }
            return info.number_entry > 0;
        }
        std::string magic(static_cast<std::size_t>(std::min<std::uint64_t>(mSource.size, 4)), '\0');
        magic.resize(mSource.read(0, magic.data(), magic.size()));
        if (const auto offset = mWindow.failedAt()) {
            addUnreadable(*offset);
        } else if (magic == "PK\x05\x06") {
            addEmpty(); // the library takes the end record at offset 0 for none
        } else if (magic == "PK\x03\x04") {
            add(Severity::ERROR, "archive-not-zip",
                " begins like a zip archive but its end is missing or damaged: the copy is incomplete.", damagedEffect,
                copyAgain);
        } else {
            add(Severity::ERROR, "archive-not-zip", " is no zip archive.", damagedEffect, anotherArchive);
        }
        return false;
    }

    /// Adds up what the directory of the archive declares. False when it is damaged.
    bool checkDirectory()
    {
        Faults leaving;
        const bool intact = forEachEntry(mArchive.get(), [&](const Entry& entry) {
            addUp(mPackedBytes, entry.info.compressed_size);
            addUp(mDeclaredBytes, entry.info.uncompressed_size);
            if (leavesFolder(entry.name)) {
                leaving.add(entry.name, unzGetOffset64(mArchive.get()), "lies outside the folder it is unpacked into");
            }
            return ++mEntries <= mostEntries;
        });
        mReport.addFact("archive_entries", "Entries", std::to_string(mEntries), mEntries);
        mReport.addFact("archive_declared_bytes", "Declared size", byteCount(mDeclaredBytes) + " unpacked",
                        mDeclaredBytes);
        if (leaving.count > 0) {
            add(Severity::ERROR, "archive-entry-path", ": " + leaving.text() + '.',
                "copies the archive without looking into it; the board may unpack over files of its system.",
                anotherArchive);
        }
        if (const auto offset = mWindow.failedAt()) {
            addUnreadable(*offset);
            return false;
        }
        if (!intact) {
            add(Severity::ERROR, "archive-damaged",
                ": its directory is damaged at offset " + std::to_string(unzGetOffset64(mArchive.get())) + ", behind " +
                    counted(mEntries, "entry", "entries") + '.',
                damagedEffect, copyAgain);
        }
        return intact;
    }

    /// Judges what the directory declares. False when it is too much to unpack.
    bool checkClaims()
    {
        if (mEntries > mostEntries) {
            add(Severity::ERROR, "archive-bomb",
                " has more than " + counted(mostEntries, "entry", "entries") + ": its contents were not tested.",
                "copies it without looking into it.", anotherArchive);
            return false;
        }
        if (mDeclaredBytes > mMostUnpacked || mPackedBytes > mSource.size) {
            add(Severity::ERROR, "archive-bomb",
                " declares " + byteCount(mDeclaredBytes) + " unpacked, " + byteCount(mPackedBytes) +
                    " packed, in an archive of " + byteCount(mSource.size) + ": its contents were not tested.",
                bombEffect, anotherArchive);
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
        const std::uint64_t limit = mMostUnpacked - mUnpackedBytes;
        const Unpacked unpacked = deflated ? inflateEntry(archive, limit) : readStored(archive, limit);
        unzCloseCurrentFile(archive);
        mUnpackedBytes += unpacked.bytes;
        if (unpacked.bytes != entry.info.uncompressed_size) {
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

    void reportContents()
    {
        mReport.addFact("archive_unpacked_bytes", "Real size", byteCount(mUnpackedBytes) + " unpacked", mUnpackedBytes);
        if (mUnpackedBytes > mMostUnpacked) {
            add(Severity::ERROR, "archive-bomb",
                " declares " + byteCount(mDeclaredBytes) + " unpacked but holds more than " + byteCount(mMostUnpacked) +
                    ": the test ended there.",
                bombEffect, anotherArchive);
            return;
        }
        if (mDamaged.count > 0) {
            add(Severity::ERROR, "archive-damaged", ": " + mDamaged.text() + '.', damagedEffect, copyAgain);
        }
        if (mUntested.count > 0) {
            add(Severity::UNCHECKED, "archive-untested", ": " + mUntested.text() + ", and cannot be tested.",
                "copies it without looking into it.",
                "Pack the archive without encryption, by the method deflate, or test it where it was made.");
        }
        if (mUnpackedBytes > suspiciousSize && mUnpackedBytes / suspiciousRatio > mSource.size) {
            add(Severity::WARNING, "archive-ratio",
                " unpacks to " + std::to_string(mUnpackedBytes / mSource.size) + " times its size.",
                "copies it without looking into it; unpacking it may fill the board.",
                "Make sure that this is the board's own upgrade archive.");
        }
        const std::uint64_t padding = mSource.size - mPackedBytes;
        if (padding > suspiciousSize) {
            add(Severity::WARNING, "archive-padding", " holds " + byteCount(padding) + " that belong to no entry.",
                "copies all of it, which takes its time and may fill the board.", anotherArchive);
        }
        const std::uint64_t boardBytes = mSource.size + mUnpackedBytes;
        mReport.addFact("board_bytes", "Needed on the board",
                        byteCount(boardBytes) + ": the archive and everything in it side by side", boardBytes);
    }

    const ArchiveSource& mSource;
    const std::string& mName;
    Report& mReport;
    std::uint64_t mMostUnpacked;
    Window mWindow;
    std::unique_ptr<void, int (*)(unzFile)> mArchive{nullptr, unzClose};
    std::uint64_t mEntries = 0;
    std::uint64_t mPackedBytes = 0;
    std::uint64_t mDeclaredBytes = 0;
    std::uint64_t mUnpackedBytes = 0;
    Faults mDamaged;
    Faults mUntested;
};

} // namespace

void checkArchive(const ArchiveSource& source, const std::string& name, Report& report, std::uint64_t mostUnpacked)
{
    ArchiveCheck(source, name, report, mostUnpacked).run();
}
