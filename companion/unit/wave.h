#pragma once

#include <cstdint>
#include <string>
#include <string_view>

/// What is wrong with the WAV file whose first bytes are `start`; empty when aplay(1) can play it to its end.
///
/// @param start  the first bytes, 64 KiB or the whole file
/// @param size   of the whole file (bytes)
std::string waveFault(std::string_view start, std::uint64_t size);
