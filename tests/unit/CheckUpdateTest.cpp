#include "UnitTest.h"

namespace
{

class CheckUpdate : public UnitTest
{
protected:
    bool check(const std::string& text, int code = 0, bool ignoreNoInternet = true)
    {
        script(policyCommand, {exits(code, text)});
        return UpdateManager::checkUpdate(ignoreNoInternet, policyCommand, installed, candidate, versionsFound);
    }

    /// The records after those of the start and the runner.
    static Lines parsed()
    {
        const Lines all = entries("log:");
        return {all.begin() + 3, all.end()};
    }

    std::string installed = "old";
    std::string candidate = "old";
    bool versionsFound = true;
};

TEST_F(CheckUpdate, NewerCandidateIsAnUpdate)
{
    EXPECT_TRUE(check("solvik4:\n  Installed: 1.2.0\n  Candidate: 1.3.0\n  Version table:\n"));
    EXPECT_EQ(installed, "1.2.0");
    EXPECT_EQ(candidate, "1.3.0");
    EXPECT_TRUE(versionsFound);
    EXPECT_EQ(journal(),
              (Lines{"log:apt-cache policy solvik4-rh", "log:Running command: apt-cache policy solvik4-rh",
                     "popen:apt-cache policy solvik4-rh", "log:Exit code:0", "log:solvik4:", "log:1.2.0", "log:1.3.0",
                     "log:  Version table:", "log:1.2.0  1.3.0", "log:NWM_UM_UPDATE_FOUND: 1.2.0 -> 1.3.0"}));
}

TEST_F(CheckUpdate, SameVersionIsNoUpdate)
{
    EXPECT_FALSE(check(policy("1.2.0", "1.2.0")));
    EXPECT_TRUE(versionsFound);
    EXPECT_EQ(journal().back(), "log:NWM_UM_NO_UPDATES 1.2.0 == 1.2.0");
}

TEST_F(CheckUpdate, OlderCandidateCountsAsUpdate)
{
    EXPECT_TRUE(check(policy("1.3.0", "1.2.0")));
    EXPECT_EQ(journal().back(), "log:NWM_UM_UPDATE_FOUND: 1.3.0 -> 1.2.0");
}

TEST_F(CheckUpdate, PackageThatIsNotInstalledCountsAsUpdate)
{
    EXPECT_TRUE(check(policy("(none)", "1.2.0")));
    EXPECT_EQ(journal().back(), "log:NWM_UM_UPDATE_FOUND: (none) -> 1.2.0");
}

TEST_F(CheckUpdate, MissingCandidateFails)
{
    EXPECT_FALSE(check("  Installed: 1.2.0\n"));
    EXPECT_FALSE(versionsFound);
    EXPECT_EQ(installed, "1.2.0");
    EXPECT_EQ(candidate, "");
    EXPECT_EQ(parsed(), (Lines{"1.2.0", "1.2.0  ", "NWM_UM_CHECK_UPDATE_FAILED"}));
}

TEST_F(CheckUpdate, MissingInstalledFails)
{
    EXPECT_FALSE(check("  Candidate: 1.2.0\n"));
    EXPECT_FALSE(versionsFound);
    EXPECT_EQ(installed, "");
    EXPECT_EQ(candidate, "1.2.0");
    EXPECT_EQ(parsed(), (Lines{"1.2.0", "  1.2.0", "NWM_UM_CHECK_UPDATE_FAILED"}));
}

TEST_F(CheckUpdate, UnknownPackageFails)
{
    EXPECT_FALSE(check(""));
    EXPECT_FALSE(versionsFound);
    EXPECT_EQ(installed, "");
    EXPECT_EQ(candidate, "");
    EXPECT_EQ(parsed(), (Lines{"  ", "NWM_UM_CHECK_UPDATE_FAILED"}));
}

TEST_F(CheckUpdate, EmptyValueFails)
{
    EXPECT_FALSE(check(policy("", "1.2.0")));
    EXPECT_FALSE(versionsFound);
}

TEST_F(CheckUpdate, QueryThatDoesNotStartFails)
{
    script(policyCommand, {doesNotStart()});
    EXPECT_FALSE(UpdateManager::checkUpdate(true, policyCommand, installed, candidate, versionsFound));
    EXPECT_FALSE(versionsFound);
    EXPECT_EQ(journal(), (Lines{"log:apt-cache policy solvik4-rh", "log:Running command: apt-cache policy solvik4-rh",
                                "popen:apt-cache policy solvik4-rh", "log:  ", "log:NWM_UM_CHECK_UPDATE_FAILED"}));
}

TEST_F(CheckUpdate, ExitCode100EndsTheCheckWhenItMeansNoConnection)
{
    EXPECT_FALSE(check(policy("1.2.0", "1.3.0"), 100, false));
    EXPECT_FALSE(versionsFound);
    EXPECT_EQ(installed, "");
    EXPECT_EQ(candidate, "");
    EXPECT_EQ(entries("log:"), (Lines{"apt-cache policy solvik4-rh", "Running command: apt-cache policy solvik4-rh",
                                      "Exit code:100", "NO_INTERNET_ERROR_CODE"}));
}

TEST_F(CheckUpdate, ExitCode100IsIgnoredOtherwise)
{
    EXPECT_TRUE(check(policy("1.2.0", "1.3.0"), 100, true));
    EXPECT_TRUE(versionsFound);
}

using CheckUpdateExit = With<CheckUpdate>;
INSTANTIATE_TEST_SUITE_P(Codes, CheckUpdateExit, testing::ValuesIn(otherCodes), nameOf<Named<int>>);

TEST_P(CheckUpdateExit, IsIgnored)
{
    EXPECT_TRUE(check(policy("1.2.0", "1.3.0"), value(), false));
    EXPECT_TRUE(versionsFound);
}

TEST_F(CheckUpdate, LineWithBothKeysSetsOnlyInstalled)
{
    EXPECT_FALSE(check("Candidate: 2 Installed: 1\n"));
    EXPECT_EQ(installed, "1");
    EXPECT_EQ(candidate, "");
    EXPECT_FALSE(check("Installed: 1 Candidate: 2\n"));
    EXPECT_EQ(installed, "1 Candidate: 2");
    EXPECT_EQ(candidate, "");
}

TEST_F(CheckUpdate, FirstKeyOfALineCounts)
{
    check("Installed: Installed: 1\nCandidate: Candidate: 2\n");
    EXPECT_EQ(installed, "Installed: 1");
    EXPECT_EQ(candidate, "Candidate: 2");
}

TEST_F(CheckUpdate, LastMatchingLineWins)
{
    EXPECT_FALSE(check("Installed: 1\nCandidate: 2\nInstalled: 3\nCandidate: 3\n"));
    EXPECT_EQ(installed, "3");
    EXPECT_EQ(candidate, "3");
}

TEST_F(CheckUpdate, KeyNeedsItsBlank)
{
    EXPECT_FALSE(check("Installed:1\nCandidate:2\n"));
    EXPECT_EQ(parsed(), (Lines{"Installed:1", "Candidate:2", "  ", "NWM_UM_CHECK_UPDATE_FAILED"}));
}

TEST_F(CheckUpdate, CarriageReturnBelongsToTheVersion)
{
    EXPECT_TRUE(check("Installed: 1.2.0\r\nCandidate: 1.2.0\n"));
    EXPECT_EQ(installed, "1.2.0\r");
    EXPECT_EQ(candidate, "1.2.0");
}

TEST_F(CheckUpdate, TrailingBlankBelongsToTheVersion)
{
    EXPECT_TRUE(check("Installed: 1.2.0 \nCandidate: 1.2.0\n"));
    EXPECT_EQ(installed, "1.2.0 ");
}

TEST_F(CheckUpdate, LastLineWithoutLineFeedIsRead)
{
    EXPECT_TRUE(check("Installed: 1\nCandidate: 2"));
    EXPECT_EQ(candidate, "2");
}

TEST_F(CheckUpdate, EmptyLinesAreLogged)
{
    check("\n\nInstalled: 1\n");
    EXPECT_EQ(parsed(), (Lines{"", "", "1", "1  ", "NWM_UM_CHECK_UPDATE_FAILED"}));
}

TEST_F(CheckUpdate, EarlierVersionsAreForgotten)
{
    installed = candidate = "1.2.0";
    versionsFound = true;
    EXPECT_FALSE(check("nothing\n"));
    EXPECT_EQ(installed, "");
    EXPECT_EQ(candidate, "");
    EXPECT_FALSE(versionsFound);
}

class UpdateMirrors : public UnitTest
{
};

TEST_F(UpdateMirrors, ZeroIsOk)
{
    script(mirrorsCommand, {exits(0, "Hit:1\nE: ignored\n")});
    EXPECT_TRUE(UpdateManager::updateMirrors());
    EXPECT_EQ(journal(), mirrorsOk());
}

TEST_F(UpdateMirrors, OneHundredIsNoConnection)
{
    script(mirrorsCommand, {exits(100)});
    EXPECT_FALSE(UpdateManager::updateMirrors());
    EXPECT_EQ(entries("log:"), (Lines{"", "Running command: apt update", "Exit code:100", "NO_INTERNET_ERROR_CODE"}));
}

using UpdateMirrorsExit = With<UpdateMirrors>;
INSTANTIATE_TEST_SUITE_P(Codes, UpdateMirrorsExit, testing::ValuesIn(otherCodes), nameOf<Named<int>>);

TEST_P(UpdateMirrorsExit, IsNotOk)
{
    script(mirrorsCommand, {exits(value())});
    EXPECT_FALSE(UpdateManager::updateMirrors());
    EXPECT_EQ(journal().back(), "log:NOT OK " + std::to_string(value()));
}

TEST_F(UpdateMirrors, RefreshThatDoesNotStartCountsAsOk)
{
    script(mirrorsCommand, {doesNotStart()});
    EXPECT_TRUE(UpdateManager::updateMirrors());
    EXPECT_EQ(journal(), (Lines{"log:", "log:Running command: apt update", "popen:apt update", "log:OK"}));
}

TEST_F(UpdateMirrors, EveryCallRunsTheSameCommandBuiltOnce)
{
    UpdateManager::updateMirrors();
    const void* first = platform::lastCommand();
    std::thread(UpdateManager::updateMirrors).join(); // a local text would be on another stack
    EXPECT_EQ(platform::lastCommand(), first);
    EXPECT_EQ(entries("popen:"), (Lines{"apt update", "apt update"}));
}

} // namespace
