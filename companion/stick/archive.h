#pragma once

#include "findings.h"

#include <cstdint>

/// Reads the whole archive and unpacks every entry to nowhere, which tests its checksum and size.
///
/// Work and memory are bounded whatever the archive claims: it is not tested when it is larger than 4 GiB, has more
/// than 100,000 entries, or declares to unpack to more than 4 GiB; no entry is unpacked beyond what it declares. Sizes
/// are facts of `report`, faults its findings.
///
/// @param descriptor  of a plain file, open for reading
/// @param size        of the file (bytes)
/// @param name        the archive's name for messages, printable
void checkArchive(int descriptor, std::uint64_t size, const std::string& name, Report& report);
