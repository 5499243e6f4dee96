#include "unit/wave.h"

#include "unit/standin.h"

#include <gtest/gtest.h>

namespace
{

std::string faultOf(const std::string& file)
{
    return waveFault(file, file.size());
}

/// A WAV file with `bytes` in place of those at `offset`.
std::string patched(std::size_t offset, const std::string& bytes)
{
    return waveFile(100).replace(offset, bytes.size(), bytes);
}

} // namespace

TEST(UnitWave, WholeFileIsPlayable)
{
    EXPECT_EQ(faultOf(waveFile(1)), "");
    EXPECT_EQ(faultOf(waveFile(100'000)), "");
}

TEST(UnitWave, StartOfALongFileIsEnough)
{
    const std::string file = waveFile(200'000);
    EXPECT_EQ(waveFault(file.substr(0, 65'536), file.size()), "");
}

TEST(UnitWave, OtherChunksArePassedOver)
{
    const std::string file = waveFile(100);
    const std::string odd = std::string("LIST\3\0\0\0abc\0", 12);
    EXPECT_EQ(faultOf(file.substr(0, 36) + odd + file.substr(36)), "");
}

TEST(UnitWave, EmptyFileHoldsNothing)
{
    EXPECT_EQ(faultOf(""), "it is empty");
}

TEST(UnitWave, OtherFilesAreNoWaves)
{
    EXPECT_EQ(faultOf("RIFF"), "it is no WAV file");
    EXPECT_EQ(faultOf(patched(8, "AVI ")), "it is no WAV file");
}

TEST(UnitWave, CompressedSamplesAreNotPlayable)
{
    EXPECT_EQ(faultOf(patched(20, "\x55")), "its samples are compressed (format 85)");
}

TEST(UnitWave, FormatWithoutChannelsRateOrSizeIsNotPlayable)
{
    const std::string fault = "its format has no channels, no sampling rate or no sample size";
    EXPECT_EQ(faultOf(patched(22, std::string(2, '\0'))), fault);
    EXPECT_EQ(faultOf(patched(24, std::string(4, '\0'))), fault);
    EXPECT_EQ(faultOf(patched(34, std::string(2, '\0'))), fault);
}

TEST(UnitWave, EveryCutIsFound)
{
    const std::string file = waveFile(100);
    for (std::size_t length = 0; length < file.size(); ++length) {
        EXPECT_NE(faultOf(file.substr(0, length)), "") << length;
    }
    EXPECT_EQ(faultOf(file.substr(0, 60)), "it is cut off: 16 of 100 bytes of sound are there");
}

TEST(UnitWave, FileWithoutSoundOrFormatIsFound)
{
    EXPECT_EQ(faultOf(waveFile(0)), "it holds no sound");
    EXPECT_EQ(faultOf(patched(36, "fact")), "it holds no sound");
    EXPECT_EQ(faultOf(patched(12, "junk")), "it has no format");
}
