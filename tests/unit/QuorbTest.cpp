#include "UnitTest.h"

#include <cerrno>

namespace
{

class CheckQuorbUpdate : public UnitTest
{
protected:
    bool check(const std::string& versionFile, const std::string& listing)
    {
        script(boardVersionCommand, {exits(0, versionFile)});
        script(stickVersionCommand, {exits(0, listing)});
        return UpdateManager::checkQuorbUpdate(installed, candidate, versionsFound);
    }

    std::string installed = "old";
    std::string candidate = "old";
    bool versionsFound = true;
};

TEST_F(CheckQuorbUpdate, SameVersionIsUpToDate)
{
    EXPECT_FALSE(check("Brimvale\t2.1.0\r\n", "quorb2.1.0\n"));
    EXPECT_TRUE(versionsFound);
    EXPECT_EQ(installed, "2.1.0");
    EXPECT_EQ(candidate, "2.1.0");
    EXPECT_EQ(journal(), boardChecked("2.1.0", "2.1.0"));
    EXPECT_EQ(journal().back(), "log:QUORB up to date");
}

TEST_F(CheckQuorbUpdate, OtherVersionIsAnUpdate)
{
    EXPECT_TRUE(check("Brimvale\t2.1.0\r\n", "quorb2.2.0\n"));
    EXPECT_TRUE(versionsFound);
    EXPECT_EQ(journal(), boardChecked("2.1.0", "2.2.0"));
    EXPECT_EQ(journal().back(), "log:Update found: 2.1.0 -> 2.2.0");
}

TEST_F(CheckQuorbUpdate, OlderDirectoryCountsAsUpdate)
{
    EXPECT_TRUE(check("Brimvale\t2.1.0\r\n", "quorb2.0.0\n"));
}

TEST_F(CheckQuorbUpdate, UnreachableBoardFailsWithoutAListing)
{
    script(boardVersionCommand, {exits(255, "Brimvale\t2.1.0\r\n")});
    EXPECT_FALSE(UpdateManager::checkQuorbUpdate(installed, candidate, versionsFound));
    EXPECT_FALSE(versionsFound);
    EXPECT_EQ(installed, "");
    EXPECT_EQ(candidate, "");
    EXPECT_EQ(journal(), boardNotReadable());
}

TEST_F(CheckQuorbUpdate, ExitCode100IsAPlainFailure)
{
    script(boardVersionCommand, {exits(100)});
    EXPECT_FALSE(UpdateManager::checkQuorbUpdate(installed, candidate, versionsFound));
    EXPECT_EQ(journal().back(), "log:Failed to checkUpdate");
}

TEST_F(CheckQuorbUpdate, MissingStickFailsAndKeepsTheInstalledVersion)
{
    script(boardVersionCommand, {exits(0, "Brimvale\t2.1.0\r\n")});
    script(stickVersionCommand, {exits(2, "quorb2.2.0\n")});
    EXPECT_FALSE(UpdateManager::checkQuorbUpdate(installed, candidate, versionsFound));
    EXPECT_FALSE(versionsFound);
    EXPECT_EQ(installed, "2.1.0");
    EXPECT_EQ(candidate, "");
    EXPECT_EQ(entries("log:"), (Lines{std::string("Running command: ") + boardVersionCommand, "Exit code:0", "2.1.0\r",
                                      std::string("Running command: ") + stickVersionCommand, "Exit code:2",
                                      "Failed to check candidate QUORB version"}));
}

TEST_F(CheckQuorbUpdate, OnlyTheFirstDirectoryCounts)
{
    EXPECT_FALSE(check("Brimvale\t2.1.0\r\n", "quorb2.1.0\nquorb2.2.0\n"));
    EXPECT_EQ(candidate, "2.1.0");
    EXPECT_FALSE(check("Brimvale\t2.1.0\r\n", "old\nquorb2.2.0\n")); // a name shorter than the prefix
    EXPECT_EQ(candidate, "");
}

TEST_F(CheckQuorbUpdate, ListingWithoutLineFeedIsUsedWhole)
{
    EXPECT_TRUE(check("Brimvale\t2.1.0\r\n", "quorb2.2.0"));
    EXPECT_EQ(candidate, "2.2.0");
}

using ShortDirectoryName = With<CheckQuorbUpdate, std::string>;
INSTANTIATE_TEST_SUITE_P(Names, ShortDirectoryName,
                         testing::Values(Named<std::string>{"None", ""}, Named<std::string>{"q", "q"},
                                         Named<std::string>{"quor", "quor"}, Named<std::string>{"quorb", "quorb"}),
                         nameOf<Named<std::string>>);

TEST_P(ShortDirectoryName, Fails)
{
    EXPECT_FALSE(check("Brimvale\t2.1.0\r\n", value() + "\n"));
    EXPECT_EQ(candidate, "");
    EXPECT_FALSE(versionsFound);
    const Lines log = entries("log:");
    EXPECT_EQ(Lines(log.end() - 2, log.end()), (Lines{"2.1.0  ", "Failed to checkUpdate"}));
}

TEST_F(CheckQuorbUpdate, SixCharactersLeaveAVersionOfOne)
{
    EXPECT_TRUE(check("Brimvale\t2.1.0\r\n", "quorb3\n"));
    EXPECT_EQ(candidate, "3");
}

TEST_F(CheckQuorbUpdate, KeyNeedsItsTab)
{
    EXPECT_FALSE(check("Brimvale 2.1.0\r\n", "quorb2.2.0\n"));
    EXPECT_FALSE(versionsFound);
    EXPECT_EQ(installed, "");
    EXPECT_EQ(entries("log:"), (Lines{std::string("Running command: ") + boardVersionCommand, "Exit code:0",
                                      "Brimvale 2.1.0\r", std::string("Running command: ") + stickVersionCommand,
                                      "Exit code:0", "  2.2.0", "Failed to checkUpdate"}));
}

TEST_F(CheckQuorbUpdate, AnotherMatchingLineHelps)
{
    EXPECT_TRUE(check("Brimvale 2.1.0\r\nthe Brimvale\t2.0.0\r\n", "quorb2.2.0\n"));
    EXPECT_EQ(installed, "2.0.0");
}

TEST_F(CheckQuorbUpdate, LastMatchingLineWins)
{
    EXPECT_FALSE(check("Brimvale\t2.1.0\nBrimvale\t2.2.0\n", "quorb2.2.0\n"));
    EXPECT_EQ(installed, "2.2.0");
}

TEST_F(CheckQuorbUpdate, VersionEndsAtItsFirstCarriageReturn)
{
    EXPECT_FALSE(check("Brimvale\t2.1.0\rmore\r\n", "quorb2.1.0\n"));
    EXPECT_EQ(installed, "2.1.0");
}

TEST_F(CheckQuorbUpdate, VersionWithoutCarriageReturnIsUsedWhole)
{
    EXPECT_FALSE(check("Brimvale\t2.1.0", "quorb2.1.0\n"));
    EXPECT_EQ(installed, "2.1.0");
}

TEST_F(CheckQuorbUpdate, CommandsThatDoNotStartFail)
{
    script(boardVersionCommand, {doesNotStart()});
    script(stickVersionCommand, {doesNotStart()});
    EXPECT_FALSE(UpdateManager::checkQuorbUpdate(installed, candidate, versionsFound));
    EXPECT_FALSE(versionsFound);
    EXPECT_EQ(journal().back(), "log:Failed to checkUpdate");
}

class UploadQuorb : public UnitTest
{
};

TEST_F(UploadQuorb, FirstAttemptSucceeds)
{
    EXPECT_TRUE(UpdateManager::uploadQuorbFiles());
    EXPECT_EQ(journal(), (Lines{logged(uploadCommand), ran(uploadCommand)}));
}

TEST_F(UploadQuorb, TwentiethAttemptSucceeds)
{
    std::vector<platform::Answer> answers(19, exits(1));
    answers.push_back(exits(0));
    script(uploadCommand, answers);
    EXPECT_TRUE(UpdateManager::uploadQuorbFiles());
    EXPECT_EQ(entries("system:"), Lines(20, uploadCommand));
    Lines log = {uploadCommand};
    log.insert(log.end(), 19, "Uploading failed. Trying again. ");
    EXPECT_EQ(entries("log:"), log);
}

TEST_F(UploadQuorb, TwentyFailuresGiveUp)
{
    std::vector<platform::Answer> answers(20, exits(1));
    answers.push_back(exits(0));
    script(uploadCommand, answers);
    EXPECT_FALSE(UpdateManager::uploadQuorbFiles());
    const Lines all = boardUploadFailed();
    EXPECT_EQ(journal(), Lines(all.begin() + 1, all.end() - 1));
}

using UploadQuorbStatus = With<UploadQuorb>;
INSTANTIATE_TEST_SUITE_P(Statuses, UploadQuorbStatus, testing::ValuesIn(failedStatuses), nameOf<Named<int>>);

TEST_P(UploadQuorbStatus, IsAFailedAttempt)
{
    script(uploadCommand, {raw(value()), exits(0)});
    EXPECT_TRUE(UpdateManager::uploadQuorbFiles());
    EXPECT_EQ(entries("system:"), Lines(2, uploadCommand));
}

class InstallQuorb : public UnitTest
{
};

TEST_F(InstallQuorb, UploadsRunsTheScriptAndWaitsThirteenMinutes)
{
    EXPECT_TRUE(UpdateManager::installQuorbUpdate());
    EXPECT_EQ(journal(), boardInstalled());
}

TEST_F(InstallQuorb, FailedUploadRunsNoScriptAndDoesNotWait)
{
    script(uploadCommand, {exits(1)});
    EXPECT_FALSE(UpdateManager::installQuorbUpdate());
    EXPECT_EQ(journal(), boardUploadFailed());
}

using BoardScriptStatus = With<InstallQuorb>;
INSTANTIATE_TEST_SUITE_P(Statuses, BoardScriptStatus, testing::ValuesIn(failedStatuses), nameOf<Named<int>>);

TEST_P(BoardScriptStatus, IsOnlyLogged)
{
    script(boardScriptCommand, {raw(value())});
    EXPECT_TRUE(UpdateManager::installQuorbUpdate());
    EXPECT_EQ(journal(), boardInstalled(std::to_string(value())));
}

TEST_F(InstallQuorb, SignalDoesNotShortenTheWait)
{
    int calls = 0;
    platform::scriptSleep([&calls](const timespec*, timespec* remaining) {
        if (++calls == 3) {
            return 0;
        }
        *remaining = {calls == 1 ? 500 : 20, 7};
        errno = EINTR;
        return -1;
    });
    EXPECT_TRUE(UpdateManager::installQuorbUpdate());
    EXPECT_EQ(entries("sleep:"), (Lines{"780", "500.7", "20.7"}));
}

TEST_F(InstallQuorb, OtherSleepFailureEndsTheWait)
{
    platform::scriptSleep([](const timespec*, timespec*) {
        errno = EINVAL;
        return -1;
    });
    EXPECT_TRUE(UpdateManager::installQuorbUpdate());
    EXPECT_EQ(entries("sleep:"), (Lines{"780"}));
    EXPECT_EQ(journal().back(), "log:Sleeping for 13mins ended up");
}

TEST_F(InstallQuorb, VerificationIsAPlaceholder)
{
    EXPECT_TRUE(UpdateManager::instance()->verifyQuorb());
    EXPECT_EQ(journal(), Lines{});
}

} // namespace
