#include "unit/wave.h"

#include <algorithm>
#include <array>

namespace
{

/// The little-endian number of `length` bytes at `offset`, all of them within `bytes`.
std::uint32_t numberAt(std::string_view bytes, std::size_t offset, std::size_t length)
{
    std::uint32_t value = 0;
    for (std::size_t index = length; index-- > 0;) {
        value = value << 8U | static_cast<unsigned char>(bytes[offset + index]);
    }
    return value;
}

/// What is wrong with the format chunk, Multimedia Programming Interface and Data Specifications 1.0.
std::string formatFault(std::string_view chunk)
{
    static const std::array<std::uint32_t, 5> playable = {1 /* PCM */, 3 /* float */, 6 /* A-law */, 7 /* mu-law */,
                                                          0xFFFE /* extensible */};
    if (chunk.size() < 16) {
        return "its format is cut off";
    }
    const std::uint32_t format = numberAt(chunk, 0, 2);
    if (std::find(playable.begin(), playable.end(), format) == playable.end()) {
        return "its samples are compressed (format " + std::to_string(format) + ")";
    }
    if (numberAt(chunk, 2, 2) == 0 || numberAt(chunk, 4, 4) == 0 || numberAt(chunk, 14, 2) == 0) {
        return "its format has no channels, no sampling rate or no sample size";
    }
    return "";
}

} // namespace

std::string waveFault(std::string_view start, std::uint64_t size)
{
    const std::size_t headerLength = 8; // of a chunk: name and length
    if (size == 0) {
        return "it is empty";
    }
    if (start.size() < 12 || start.substr(0, 4) != "RIFF" || start.substr(8, 4) != "WAVE") {
        return "it is no WAV file";
    }
    bool formatFound = false;
    for (std::uint64_t offset = 12; offset + headerLength <= start.size();) {
        const auto at = static_cast<std::size_t>(offset);
        const std::string_view name = start.substr(at, 4);
        const std::uint64_t length = numberAt(start, at + 4, 4);
        const std::uint64_t body = offset + headerLength;
        if (name == "fmt ") {
            std::string fault = formatFault(start.substr(at + headerLength, static_cast<std::size_t>(length)));
            if (!fault.empty()) {
                return fault;
            }
            formatFound = true;
        }
        if (name == "data") {
            if (!formatFound) {
                return "it has no format";
            }
            if (length == 0) {
                return "it holds no sound";
            }
            return length > size - body ? "it is cut off: " + std::to_string(size - body) + " of " +
                                              std::to_string(length) + " bytes of sound are there"
                                        : "";
        }
        offset = body + length + length % 2; // chunks begin at even offsets
    }
    return "it holds no sound";
}
