#include "stick/zip_file.h"

#include "little_endian.h"

#include <stdexcept>

#include <zlib.h>

namespace
{

uLong checksumOf(const std::string& content)
{
    return crc32(0, reinterpret_cast<const Bytef*>(content.data()), static_cast<uInt>(content.size()));
}

/// The fields that the record in front of an entry's data and the one in the directory share.
std::string commonFields(const ZipEntry& entry, std::size_t packedSize)
{
    std::string fields;
    fields += littleEndian(20, 2); // version needed
    fields += littleEndian(entry.flags, 2);
    fields += littleEndian(entry.method, 2);
    fields += littleEndian(0, 4); // time and date
    fields += littleEndian(entry.checksum.value_or(static_cast<std::uint32_t>(checksumOf(entry.content))), 4);
    fields += littleEndian(entry.packedSize.value_or(static_cast<std::uint32_t>(packedSize)), 4);
    fields += littleEndian(entry.unpackedSize.value_or(static_cast<std::uint32_t>(entry.content.size())), 4);
    fields += littleEndian(entry.name.size(), 2);
    fields += littleEndian(0, 2); // length of the extra field
    return fields;
}

} // namespace

std::string zipArchive(const std::vector<ZipEntry>& entries)
{
    std::string archive;
    std::string directory;
    for (const ZipEntry& entry : entries) {
        const std::string data = entry.method == 8 ? deflated(entry.content) : entry.content;
        const std::string fields = commonFields(entry, data.size());
        directory += "PK\x01\x02";
        directory += littleEndian(20, 2); // version made by
        directory += fields;
        directory += littleEndian(0, 6); // comment, disk, internal attributes
        directory += littleEndian(entry.attributes, 4);
        directory += littleEndian(archive.size(), 4);
        directory += entry.name;
        archive += "PK\x03\x04";
        archive += fields;
        archive += entry.localName.value_or(entry.name);
        archive += data;
    }
    const std::size_t start = archive.size();
    archive += directory + "PK\x05\x06";
    archive += littleEndian(0, 4); // disks
    archive += littleEndian(entries.size(), 2);
    archive += littleEndian(entries.size(), 2);
    archive += littleEndian(directory.size(), 4);
    archive += littleEndian(start, 4);
    archive += littleEndian(0, 2); // comment
    return archive;
}

std::string deflated(const std::string& content)
{
    z_stream stream = {};
    if (deflateInit2(&stream, Z_BEST_COMPRESSION, Z_DEFLATED, -MAX_WBITS, 9, Z_DEFAULT_STRATEGY) != Z_OK) {
        throw std::bad_alloc();
    }
    std::string packed(deflateBound(&stream, static_cast<uLong>(content.size())), '\0');
    stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(content.data()));
    stream.avail_in = static_cast<uInt>(content.size());
    stream.next_out = reinterpret_cast<Bytef*>(packed.data());
    stream.avail_out = static_cast<uInt>(packed.size());
    deflate(&stream, Z_FINISH);
    packed.resize(stream.total_out);
    deflateEnd(&stream);
    return packed;
}
