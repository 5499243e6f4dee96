#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

/// An entry of a zip archive, APPNOTE.TXT 4.3. What is set instead of left out is what the archive claims wrongly.
struct ZipEntry
{
    std::string name;
    std::string content;
    std::uint16_t method = 8; ///< 8 deflate; with any other the content is stored as it is
    std::uint16_t flags = 0;
    std::optional<std::uint32_t> checksum = std::nullopt;
    std::optional<std::uint32_t> packedSize = std::nullopt;
    std::optional<std::uint32_t> unpackedSize = std::nullopt;
    std::optional<std::string> localName = std::nullopt; ///< in front of the data; as long as `name`
    std::uint32_t attributes = 0;                        ///< external ones: stat(2)'s mode in the upper half
};

/// The bytes of an archive with these entries.
std::string zipArchive(const std::vector<ZipEntry>& entries);

/// `content` packed by the method deflate.
std::string deflated(const std::string& content);
