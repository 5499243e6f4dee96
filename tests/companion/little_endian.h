#pragma once

#include <cstdint>
#include <string>

/// The lowest `length` bytes of `value`, the lowest first, as zip archives and WAV files write their numbers.
inline std::string littleEndian(std::uint64_t value, int length)
{
    std::string bytes;
    for (int index = 0; index < length; ++index, value >>= 8U) {
        bytes += static_cast<char>(value & 0xFFU);
    }
    return bytes;
}
