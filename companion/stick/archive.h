#pragma once

#include "findings.h"

#include <cstddef>
#include <cstdint>
#include <functional>

/// The bytes of an archive, wherever they are.
struct ArchiveSource
{
    std::uint64_t size; ///< bytes

    /// Reads `length` bytes from `offset` on, both within `size`. Less than `length` means that the medium failed
    /// behind the bytes returned.
    std::function<std::size_t(std::uint64_t offset, char* buffer, std::size_t length)> read;
};

/// Reads the whole archive and tests every entry's checksum and sizes, unpacking nothing to any disk.
///
/// Work and memory are bounded whatever the archive claims: it is not tested when it is larger than 4 GiB, has more
/// than 100,000 entries, or unpacks to more than `mostUnpacked`. Sizes are facts of `report`, faults its findings.
///
/// @param name          the archive's name for messages, printable
/// @param mostUnpacked  of all entries together (bytes)
void checkArchive(const ArchiveSource& source, const std::string& name, Report& report,
                  std::uint64_t mostUnpacked = 4ULL << 30U);
