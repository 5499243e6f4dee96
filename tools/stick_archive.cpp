#include "stick_archive.h"

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

const std::uint64_t largestArchive = 4ULL << 30U;  // bytes; a file on a FAT stick is smaller
const std::uint64_t largestUnpacked = 4ULL << 30U; // bytes
const std::uint64_t mostEntries = 100'000;
const std::uint64_t suspiciousRatio = 100; // unpacked to packed; software packs to a half or a tenth
const std::uint64_t suspiciousSize = 1'000'000'000;

const char* const damagedEffect =
    "copies the archive without looking into it. The board then fails to unpack it: only the script's status in the "
    "log tells so, and after 13 minutes the update counts as done.";
const char* const copyAgain =
    "Copy the archive to the stick again, release the stick before pulling it out, and run this check again.";

/// Hands `source` to the zip library, with a window that spares the medium its reads of single bytes.
class Window
{
public:
    explicit Window(const ArchiveSource& source) : mSource(source), mBytes(64 * 1024) {}

    std::size_t read(char* buffer, std::size_t length)
    {
        std::size_t done = 0;
        while (done < length && mPosition < mSource.size) {
            if (mPosition < mStart || mPosition >= mStart + mLength) {
                mStart = mPosition;
                const auto wanted = std::min<std::uint64_t>(mBytes.size(), mSource.size - mStart);
                mLength = mSource.read(mStart, mBytes.data(), static_cast<std::size_t>(wanted));
                if (mLength == 0) {
                    mFailed = true;
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
    bool failed() const { return mFailed; }

private:
    const ArchiveSource& mSource;
    std::vector<char> mBytes;
    std::uint64_t mStart = 0;
    std::size_t mLength = 0;
    std::uint64_t mPosition = 0;
    bool mFailed = false;
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
    functions.zerror_file = [](voidpf opaque, voidpf) -> int { return static_cast<Window*>(opaque)->failed() ? 1 : 0; };
    return functions;
}

using Archive = std::unique_ptr<void, int (*)(unzFile)>;

/// Faults of one kind: the first is shown, the others are counted.
struct Faults
{
    std::string first;
    std::uint64_t count = 0;

    void add(const std::string& entry, const std::string& text)
    {
        if (count++ == 0) {
            first = "entry " + entry + ' ' + text;
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

/// What unpacking an entry gave.
struct Unpacked
{
    std::uint64_t bytes = 0;
    uLong checksum = crc32(0, nullptr, 0);
    bool complete = false; ///< The packed data ended where its own end mark and its length say.
};

/// Unpacks the archive's open entry, at most `limit` bytes, into nothing.
///
/// The library itself stops at the declared size and so would not see an entry that holds more than it declares.
Unpacked unpackOpenEntry(unzFile archive, bool deflated, std::uint64_t limit)
{
    Unpacked result;
    std::vector<Bytef> packed(64 * 1024);
    std::vector<Bytef> plain(64 * 1024);
    z_stream stream = {};
    if (deflated && inflateInit2(&stream, -MAX_WBITS) != Z_OK) {
        throw std::bad_alloc();
    }
    const std::unique_ptr<z_stream, int (*)(z_stream*)> closer(deflated ? &stream : nullptr, inflateEnd);
    const auto take = [&](const Bytef* bytes, std::size_t count) {
        result.bytes += count;
        result.checksum = crc32(result.checksum, bytes, static_cast<uInt>(count));
    };

    int status = Z_OK;
    int count = 0;
    while (result.bytes <= limit &&
           (count = unzReadCurrentFile(archive, packed.data(), static_cast<unsigned>(packed.size()))) > 0) {
        if (!deflated) {
            take(packed.data(), static_cast<std::size_t>(count));
            continue;
        }
        if (status == Z_STREAM_END) {
            return result; // more packed data behind its end mark
        }
        stream.next_in = packed.data();
        stream.avail_in = static_cast<uInt>(count);
        do {
            stream.next_out = plain.data();
            stream.avail_out = static_cast<uInt>(plain.size());
            status = inflate(&stream, Z_NO_FLUSH);
            take(plain.data(), plain.size() - stream.avail_out);
        } while (status == Z_OK && stream.avail_out == 0 && result.bytes <= limit);
        if (status == Z_BUF_ERROR) {
            status = Z_OK; // nothing left to do with this piece
        }
        if (status != Z_OK && (status != Z_STREAM_END || stream.avail_in > 0)) {
            return result;
        }
    }
    result.complete = count == 0 && (!deflated || status == Z_STREAM_END);
    return result;
}

/// Reads the archive once from end to end. The offset of the first byte that could not be read, if any.
std::optional<std::uint64_t> firstUnreadable(const ArchiveSource& source)
{
    std::vector<char> buffer(1024 * 1024);
    for (std::uint64_t offset = 0; offset < source.size;) {
        const auto wanted = static_cast<std::size_t>(std::min<std::uint64_t>(buffer.size(), source.size - offset));
        const std::size_t count = source.read(offset, buffer.data(), wanted);
        offset += count;
        if (count < wanted) {
            return offset;
        }
    }
    return std::nullopt;
}

bool beginsLikeZip(const ArchiveSource& source)
{
    std::array<char, 4> magic{};
    return source.size >= magic.size() && source.read(0, magic.data(), magic.size()) == magic.size() &&
           std::memcmp(magic.data(), "PK\x03\x04", magic.size()) == 0;
}

} // namespace

void checkArchive(const ArchiveSource& source, const std::string& name, Report& report)
{
    report.addFact("archive_bytes", "Archive", name + ", " + byteCount(source.size), source.size);
    if (source.size > largestArchive) {
        report.add({Severity::ERROR, "archive-too-large",
                    name + " has " + byteCount(source.size) + ", more than the " + byteCount(largestArchive) +
                        " that are tested.",
                    "tries to copy all of it to the board, 20 times when that fails.",
                    "Put the board's own upgrade archive on the stick."});
        return;
    }
    if (const auto offset = firstUnreadable(source)) {
        report.add({Severity::ERROR, "archive-unreadable",
                    name + " cannot be read at offset " + std::to_string(*offset) + ": the stick is damaged.",
                    "tries the upload 20 times, gives up and shows the fail pattern; the board stays as it is.",
                    "Use another stick."});
        return;
    }

    Window window(source);
    zlib_filefunc64_def functions = libraryFunctions(window);
    const Archive archive(unzOpen2_64(name.c_str(), &functions), unzClose);
    if (!archive) {
        const bool cut = beginsLikeZip(source);
        report.add(
            {Severity::ERROR, "archive-not-zip",
             name + (cut ? " begins like a zip archive but its end is missing or damaged: the copy is incomplete."
                         : " is no zip archive."),
             damagedEffect, cut ? copyAgain : "Put the board's own upgrade archive on the stick."});
        return;
    }

    std::uint64_t entries = 0;
    std::uint64_t packedBytes = 0;
    std::uint64_t declaredBytes = 0;
    Faults leaving;
    const auto addUp = [](std::uint64_t& sum, std::uint64_t value) {
        sum = value > UINT64_MAX - sum ? UINT64_MAX : sum + value;
    };
    const bool directoryIntact = forEachEntry(archive.get(), [&](const Entry& entry) {
        addUp(packedBytes, entry.info.compressed_size);
        addUp(declaredBytes, entry.info.uncompressed_size);
        if (leavesFolder(entry.name)) {
            leaving.add(shown(entry.name), "lies outside the folder it is unpacked into");
        }
        return ++entries <= mostEntries;
    });
    report.addFact("archive_entries", "Entries", std::to_string(entries), entries);
    report.addFact("archive_declared_bytes", "Declared size", byteCount(declaredBytes) + " unpacked", declaredBytes);
    if (leaving.count > 0) {
        report.add({Severity::ERROR, "archive-entry-path", name + ": " + leaving.text() + '.',
                    "copies the archive without looking into it; the board may unpack over files of its system.",
                    "Put the board's own upgrade archive on the stick."});
    }
    if (!directoryIntact) {
        report.add(
            {Severity::ERROR, "archive-damaged",
             name + ": the directory of the archive is damaged behind " + counted(entries, "entry", "entries") + '.',
             damagedEffect, copyAgain});
        return;
    }
    if (entries == 0) {
        report.add({Severity::ERROR, "archive-empty", name + " has no entries.",
                    "copies it; nothing is installed on the board, and after 13 minutes the update counts as done.",
                    "Put the board's own upgrade archive on the stick."});
        return;
    }
    if (entries > mostEntries) {
        report.add(
            {Severity::ERROR, "archive-bomb",
             name + " has more than " + counted(mostEntries, "entry", "entries") + ": its contents were not tested.",
             "copies it without looking into it.", "Put the board's own upgrade archive on the stick."});
        return;
    }
    if (declaredBytes > largestUnpacked || packedBytes > source.size) {
        report.add({Severity::ERROR, "archive-bomb",
                    name + " declares " + byteCount(declaredBytes) + " unpacked, " + byteCount(packedBytes) +
                        " packed, in an archive of " + byteCount(source.size) + ": its contents were not tested.",
                    "copies it without looking into it; unpacking it would fill the board.",
                    "Put the board's own upgrade archive on the stick."});
        return;
    }

    Faults damaged;
    Faults untested;
    std::uint64_t unpackedBytes = 0;
    forEachEntry(archive.get(), [&](const Entry& entry) {
        const std::string entryName = shown(entry.name);
        const bool deflated = entry.info.compression_method == Z_DEFLATED;
        if ((entry.info.flag & 1U) != 0) {
            untested.add(entryName, "is encrypted");
            return true;
        }
        if (!deflated && entry.info.compression_method != 0) {
            untested.add(entryName, "is packed by method " + std::to_string(entry.info.compression_method));
            return true;
        }
        int method = 0;
        int level = 0;
        if (unzOpenCurrentFile2(archive.get(), &method, &level, 1) != UNZ_OK) {
            damaged.add(entryName, "has a damaged header");
            return true;
        }
        const Unpacked unpacked = unpackOpenEntry(archive.get(), deflated, largestUnpacked - unpackedBytes);
        unzCloseCurrentFile(archive.get());
        unpackedBytes += unpacked.bytes;
        if (unpackedBytes > largestUnpacked) {
            return false;
        }
        if (unpacked.bytes != entry.info.uncompressed_size) {
            damaged.add(entryName, "declares " + byteCount(entry.info.uncompressed_size) + " but holds " +
                                       byteCount(unpacked.bytes));
        } else if (unpacked.checksum != entry.info.crc) {
            damaged.add(entryName, "has the checksum " + hexadecimal(unpacked.checksum) + " instead of " +
                                       hexadecimal(entry.info.crc));
        } else if (!unpacked.complete) {
            damaged.add(entryName, "has damaged data");
        }
        return true;
    });

    report.addFact("archive_unpacked_bytes", "Real size", byteCount(unpackedBytes) + " unpacked", unpackedBytes);
    if (unpackedBytes > largestUnpacked) {
        report.add({Severity::ERROR, "archive-bomb",
                    name + " declares " + byteCount(declaredBytes) + " unpacked but holds more than " +
                        byteCount(largestUnpacked) + ": the test ended there.",
                    "copies it without looking into it; unpacking it would fill the board.",
                    "Put the board's own upgrade archive on the stick."});
        return;
    }
    if (damaged.count > 0) {
        report.add({Severity::ERROR, "archive-damaged", name + ": " + damaged.text() + '.', damagedEffect, copyAgain});
    }
    if (untested.count > 0) {
        report.add({Severity::UNCHECKED, "archive-untested", name + ": " + untested.text() + ", and cannot be tested.",
                    "copies it without looking into it.",
                    "Pack the archive without encryption, by the method deflate, or test it where it was made."});
    }
    if (unpackedBytes > suspiciousSize && unpackedBytes / suspiciousRatio > source.size) {
        report.add({Severity::WARNING, "archive-ratio",
                    name + " unpacks to " + std::to_string(unpackedBytes / source.size) + " times its size.",
                    "copies it without looking into it; unpacking it may fill the board.",
                    "Make sure that this is the board's own upgrade archive."});
    }
    const std::uint64_t boardBytes = source.size + unpackedBytes;
    report.addFact("board_bytes", "Needed on the board",
                   byteCount(boardBytes) + ": the archive and everything in it side by side", boardBytes);
}
