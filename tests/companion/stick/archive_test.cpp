#include "stick/archive.h"

#include "descriptor.h"
#include "finding_lines.h"
#include "little_endian.h"
#include "stick/zip_file.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <sys/mman.h>
#include <unistd.h>

using testing::HasSubstr;

namespace
{

/// @param readable  of the medium (bytes)
Report check(const std::string& archive, std::size_t readable = SIZE_MAX)
{
    Report report("stick", "An archive");
    const Descriptor file(memfd_create("archive", MFD_CLOEXEC));
    const std::string there = archive.substr(0, readable);
    EXPECT_EQ(write(file.number(), there.data(), there.size()), static_cast<ssize_t>(there.size()));
    checkArchive(file.number(), archive.size(), "\"OSUpgrade.zip\"", report);
    return report;
}

/// Bytes that do not pack, as a file of the board might hold.
std::string noise(std::size_t size)
{
    std::string bytes;
    for (std::uint32_t state = 1; bytes.size() < size; state = state * 1664525 + 1013904223) {
        bytes += static_cast<char>(state >> 24U);
    }
    return bytes;
}

/// An archive whose directory repeats the record of one empty entry.
std::string archiveOfEntries(std::uint64_t entries)
{
    const std::string archive = zipArchive({{"a", ""}});
    const std::size_t start = archive.find("PK\x01\x02");
    const std::string record = archive.substr(start, archive.find("PK\x05\x06") - start);
    std::string directory;
    for (std::uint64_t count = 0; count < entries; ++count) {
        directory += record;
    }
    // The number of entries and the size need the 64-bit end record, APPNOTE.TXT 4.3.14.
    return archive.substr(0, start) + directory + "PK\x06\x06" + littleEndian(44, 8) + littleEndian(45, 2) +
           littleEndian(45, 2) + littleEndian(0, 8) + littleEndian(entries, 8) + littleEndian(entries, 8) +
           littleEndian(directory.size(), 8) + littleEndian(start, 8) + "PK\x06\x07" + littleEndian(0, 4) +
           littleEndian(start + directory.size(), 8) + littleEndian(1, 4) + "PK\x05\x06" + littleEndian(0, 4) +
           littleEndian(0xFFFF, 2) + littleEndian(0xFFFF, 2) + littleEndian(0xFFFFFFFF, 4) +
           littleEndian(0xFFFFFFFF, 4) + littleEndian(0, 2);
}

} // namespace

TEST(StickArchive, IntactArchiveIsFitWhateverItsMethods)
{
    const std::string big = noise(300'000);
    const std::string archive = zipArchive({{"folder/", "", 0},
                                            {"folder/a", big},
                                            {"folder/b", big, 0},
                                            {"zeros", std::string(500'000, '\0')},
                                            {"empty", ""}});
    const Report report = check(archive);
    EXPECT_EQ(findingsOf(report), Lines());
    EXPECT_EQ(factOf(report, "archive_bytes"), std::to_string(archive.size()));
    EXPECT_EQ(factOf(report, "archive_entries"), "5");
    EXPECT_EQ(factOf(report, "archive_declared_bytes"), "1100000");
    EXPECT_EQ(factOf(report, "board_bytes"), std::to_string(archive.size() + 1'100'000));
}

TEST(StickArchive, AnythingElseIsNoZip)
{
    for (const std::string& bytes : {std::string("x"), noise(100'000), std::string(100'000, '\0')}) {
        const Report report = check(bytes);
        EXPECT_EQ(findingsOf(report), Lines{"error archive-not-zip"});
        EXPECT_THAT(whatOf(report, "archive-not-zip"), HasSubstr("is no zip archive"));
    }
}

TEST(StickArchive, CopyThatIsCutOffIsIncomplete)
{
    const std::string archive = zipArchive({{"a", noise(100'000)}});
    const Report report = check(archive.substr(0, 60'000));
    EXPECT_EQ(findingsOf(report), Lines{"error archive-not-zip"});
    EXPECT_THAT(whatOf(report, "archive-not-zip"), HasSubstr("the copy is incomplete"));
}

TEST(StickArchive, ArchiveWithoutEntriesIsEmpty)
{
    EXPECT_EQ(findingsOf(check(zipArchive({}))), Lines{"error archive-empty"});
    EXPECT_EQ(findingsOf(check("in front of the archive" + zipArchive({}))), Lines{"error archive-empty"});
}

TEST(StickArchive, WrongChecksumIsNamedWithItsEntryAndOffset)
{
    const Report report = check(zipArchive({{"good", "good"}, {"bad", "bad", 0, 0, 0x12345678}}));
    EXPECT_EQ(findingsOf(report), Lines{"error archive-damaged"});
    EXPECT_THAT(whatOf(report, "archive-damaged"),
                HasSubstr("the entry \"bad\" at offset 73 does not have the checksum it declares"));
}

TEST(StickArchive, EveryFlippedBitOfTheDataIsFound)
{
    const std::string intact = zipArchive({{"a", noise(200)}});
    const std::size_t data = 30 + 1; // the entry's record and its name
    for (std::size_t offset = data; offset < data + 200; ++offset) {
        std::string archive = intact;
        archive[offset] = static_cast<char>(archive[offset] ^ 4);
        ASSERT_EQ(findingsOf(check(archive)), Lines{"error archive-damaged"}) << offset;
    }
}

TEST(StickArchive, DamagedEntriesAreCounted)
{
    const Report report = check(zipArchive({{"a", "a", 0, 0, 1}, {"b", "b", 0, 0, 1}, {"c", "c", 0, 0, 1}}));
    EXPECT_THAT(whatOf(report, "archive-damaged"), HasSubstr("and 2 further entries"));
}

TEST(StickArchive, OneFurtherEntryIsCountedInTheSingular)
{
    const Report report = check(zipArchive({{"a", "a", 0, 0, 1}, {"b", "b", 0, 0, 1}}));
    EXPECT_THAT(whatOf(report, "archive-damaged"), HasSubstr("and 1 further entry."));
}

TEST(StickArchive, EntryThatHoldsLessThanItDeclaresIsDamaged)
{
    const Report report = check(zipArchive({{"a", "abc", 8, 0, {}, {}, 4}}));
    EXPECT_THAT(whatOf(report, "archive-damaged"), HasSubstr("declares 4 bytes but holds 3 bytes"));
    const Report oneByte = check(zipArchive({{"a", "a", 8, 0, {}, {}, 4}}));
    EXPECT_THAT(whatOf(oneByte, "archive-damaged"), HasSubstr("declares 4 bytes but holds 1 byte"));
}

TEST(StickArchive, DamagedHeaderOfAnEntryIsFound)
{
    std::string archive = zipArchive({{"a", "abc"}});
    archive[0] = 'X';
    EXPECT_THAT(whatOf(check(archive), "archive-damaged"), HasSubstr("has a damaged header"));
}

TEST(StickArchive, DamagedDirectoryIsFound)
{
    std::string archive = zipArchive({{"a", "abc"}, {"b", "abc"}, {"c", "abc"}});
    for (const char* intact : {"2 entries", "1 entry"}) { // the last record is damaged, then the one before
        archive[archive.rfind("PK\x01\x02")] = 'X';
        const Report report = check(archive);
        EXPECT_EQ(findingsOf(report), Lines{"error archive-damaged"});
        EXPECT_THAT(whatOf(report, "archive-damaged"),
                    HasSubstr("its directory is damaged after " + std::string(intact)));
    }
}

TEST(StickArchive, DirectoryThatRunsBeyondItsEndIsDamaged)
{
    const std::string archive = zipArchive({{"a", "abc"}});
    for (const std::size_t length : {30, 32}) { // of the further fields, and of the comment, after APPNOTE.TXT 4.3.12
        std::string damaged = archive;
        damaged[damaged.find("PK\x01\x02") + length] = 1;
        const Report report = check(damaged);
        EXPECT_EQ(findingsOf(report), Lines{"error archive-damaged"});
        EXPECT_THAT(whatOf(report, "archive-damaged"), HasSubstr("its directory is damaged after 0 entries"));
    }
}

TEST(StickArchive, EncryptedOrUnknownEntriesAreNotTested)
{
    EXPECT_EQ(findingsOf(check(zipArchive({{"a", "abc", 8, 1}}))), Lines{"unchecked archive-untested"});
    const Report report = check(zipArchive({{"a", "abc", 14}}));
    EXPECT_EQ(report.status(), Report::STATUS_UNCHECKED);
    EXPECT_THAT(whatOf(report, "archive-untested"), HasSubstr("is packed by method 14"));
}

TEST(StickArchive, EntriesThatLeaveTheFolderAreFound)
{
    for (const std::string name : {"/etc/passwd", "../up", "a/../../up", "..", "a\\..\\up", "C:\\up", "C:", "\\up"}) {
        EXPECT_EQ(findingsOf(check(zipArchive({{name, "x"}}))), Lines{"error archive-entry-path"}) << name;
    }
    for (const std::string name : {"a..b", "a/..b/c", "a/b..", "..."}) {
        EXPECT_EQ(findingsOf(check(zipArchive({{name, "x"}}))), Lines()) << name;
    }
}

TEST(StickArchive, NameOfAnEntryIsShownEscaped)
{
    const Report report = check(zipArchive({{"/\x1b[2J\n\xff", "x"}}));
    EXPECT_THAT(whatOf(report, "archive-entry-path"), HasSubstr("\"/\\x1b[2J\\n\\xff\""));
}

TEST(StickArchive, UnreadableMediumIsNamedWithTheOffset)
{
    const std::string archive = zipArchive({{"a", noise(3'000'000)}});
    for (const std::size_t readable : {std::size_t{0}, std::size_t{1'500'000}, archive.size() - 1}) {
        const Report report = check(archive, readable);
        EXPECT_EQ(findingsOf(report), Lines{"error archive-unreadable"}) << readable;
        EXPECT_THAT(whatOf(report, "archive-unreadable"), HasSubstr("at offset " + std::to_string(readable) + ":"));
    }
}

TEST(StickArchive, BombThatDeclaresItsSizeIsNotUnpacked)
{
    const Report report =
        check(zipArchive({{"a", "x", 8, 0, {}, {}, 0xFFFFFFF0}, {"b", "x", 8, 0, {}, {}, 0xFFFFFFF0}}));
    EXPECT_EQ(findingsOf(report), Lines{"error archive-bomb"});
    const Report most = check(zipArchive({{"a", "x", 8, 0, {}, {}, 0x80000000}, {"b", "x", 8, 0, {}, {}, 0x80000000}}));
    EXPECT_EQ(findingsOf(most), Lines{"error archive-damaged"});
}

TEST(StickArchive, EntryThatDeclaresLittleIsNotUnpackedBeyondThat)
{
    const std::string zeros(50'000'000, '\0');
    EXPECT_EQ(findingsOf(check(zipArchive({{"a", zeros, 8, 0, {}, {}, 10}}))), Lines{"error archive-damaged"});
}

TEST(StickArchive, EntriesThatShareTheirDataAreABomb)
{
    const Report report = check(zipArchive({{"a", "abc", 0, 0, {}, 3'000'000}, {"b", "abc", 0, 0, {}, 3'000'000}}));
    EXPECT_EQ(findingsOf(report), Lines{"error archive-bomb"});
}

TEST(StickArchive, EntryAsLargeAsTheArchiveIsDamaged)
{
    const auto size = static_cast<std::uint32_t>(zipArchive({{"a", "abc", 0}}).size());
    EXPECT_EQ(findingsOf(check(zipArchive({{"a", "abc", 0, 0, {}, size}}))), Lines{"error archive-damaged"});
    EXPECT_EQ(findingsOf(check(zipArchive({{"a", "abc", 0, 0, {}, size + 1}}))), Lines{"error archive-bomb"});
}

TEST(StickArchive, TooManyEntriesAreABomb)
{
    EXPECT_EQ(findingsOf(check(archiveOfEntries(100'000))), Lines());
    const Report report = check(archiveOfEntries(100'002));
    EXPECT_EQ(findingsOf(report), Lines{"error archive-bomb"});
    EXPECT_THAT(whatOf(report, "archive-bomb"), HasSubstr("more than 100,000 entries"));
    EXPECT_EQ(factOf(report, "archive_entries"), "100001") << "the rest is not looked at";
}

TEST(StickArchive, MoreThanFourGigabytesAreNotTested)
{
    Report report("stick", "An archive");
    checkArchive(-1, (4ULL << 30U) + 1, "\"OSUpgrade.zip\"", report);
    EXPECT_EQ(findingsOf(report), Lines{"error archive-too-large"});
}

TEST(StickArchive, AFewBytesInFrontOfTheFirstEntryAreAWarning)
{
    const Report report = check("MZ" + zipArchive({{"a", "abc"}}));
    EXPECT_EQ(findingsOf(report), Lines{"warning archive-prefix"});
    EXPECT_THAT(whatOf(report, "archive-prefix"), HasSubstr("2 bytes in front of its first entry"));
    EXPECT_EQ(findingsOf(check("M" + zipArchive({{"a", "abc"}}))), Lines{"warning archive-prefix"});
}

TEST(StickArchive, EntryBelowASymbolicLinkOfTheArchiveIsAnError)
{
    ZipEntry link{"App", "/etc"};
    link.attributes = 0120777U << 16U;
    EXPECT_EQ(findingsOf(check(zipArchive({link, {"Appendix", "abc"}}))), Lines());
    const Report report = check(zipArchive({link, {"App/passwd", "abc"}}));
    EXPECT_EQ(findingsOf(report), Lines{"error archive-entry-path"});
    EXPECT_THAT(whatOf(report, "archive-entry-path"), HasSubstr("\"App/passwd\" at offset"));
}

TEST(StickArchive, EntryOfAnotherNameInFrontOfItsDataIsDamaged)
{
    ZipEntry entry{"version", "abc"};
    entry.localName = "etc.txt";
    const Report report = check(zipArchive({entry}));
    EXPECT_EQ(findingsOf(report), Lines{"error archive-damaged"});
    EXPECT_THAT(whatOf(report, "archive-damaged"), HasSubstr("is named \"etc.txt\" in front of its data"));
}

TEST(StickArchive, OfANameOnly1024BytesAreLookedAt)
{
    for (const std::size_t length : {1024U, 1025U}) {
        ZipEntry entry{std::string(length, 'a'), "abc"};
        entry.localName = 'b' + std::string(length - 1, 'a');
        EXPECT_EQ(findingsOf(check(zipArchive({entry}))), length > 1024 ? Lines() : Lines{"error archive-damaged"});
    }
}
