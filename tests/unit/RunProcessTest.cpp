#include "UnitTest.h"

#include <csignal>

namespace
{

class RunProcess : public UnitTest
{
protected:
    std::string output = "from an earlier run";
};

TEST_F(RunProcess, SilentSuccessGivesZeroAndTwoRecords)
{
    EXPECT_EQ(UpdateManager::runProcess("true", output), 0);
    EXPECT_EQ(output, "");
    EXPECT_EQ(journal(), (Lines{"log:Running command: true", "popen:true", "log:Exit code:0"}));
    EXPECT_EQ(platform::records().at(0).file, "UpdateManager.cpp");
}

TEST_F(RunProcess, OutputKeepsItsLineEnds)
{
    script("apt update", {exits(100, "one\ntwo\n")});
    EXPECT_EQ(UpdateManager::runProcess("apt update", output), 100);
    EXPECT_EQ(output, "one\ntwo\n");
    EXPECT_EQ(journal().back(), "log:Exit code:100");
}

TEST_F(RunProcess, OutputWithoutALastLineEndIsWhole)
{
    script("x", {exits(0, "one\r\ntwo")});
    UpdateManager::runProcess("x", output);
    EXPECT_EQ(output, "one\r\ntwo");
}

TEST_F(RunProcess, ExitCodeKeepsEightBits)
{
    script("x", {exits(200)});
    EXPECT_EQ(UpdateManager::runProcess("x", output), 200);
}

using WithoutExitCode = With<RunProcess>;
INSTANTIATE_TEST_SUITE_P(Statuses, WithoutExitCode,
                         testing::Values(Named<int>{"Killed", SIGKILL}, Named<int>{"Crashed", SIGSEGV},
                                         Named<int>{"CrashedWithACore", SIGSEGV | 0x80},
                                         Named<int>{"PipeClosed", SIGPIPE}, Named<int>{"NoStatus", -1}),
                         nameOf<Named<int>>);

TEST_P(WithoutExitCode, CommandGivesZero)
{
    script("x", {{value(), "partial"}});
    EXPECT_EQ(UpdateManager::runProcess("x", output), 0);
    EXPECT_EQ(output, "partial");
    EXPECT_EQ(journal().back(), "log:Exit code:0");
}

TEST_F(RunProcess, CommandThatDoesNotStartGivesZeroAndNoFurtherRecord)
{
    script("x", {doesNotStart()});
    EXPECT_EQ(UpdateManager::runProcess("x", output), 0);
    EXPECT_EQ(output, "");
    EXPECT_EQ(journal(), (Lines{"log:Running command: x", "popen:x"}));
}

class LongLine : public RunProcess, public testing::WithParamInterface<std::size_t>
{
};
INSTANTIATE_TEST_SUITE_P(Lengths, LongLine, testing::Values(1022U, 1023U, 1024U, 1025U, 3072U, 100000U),
                         testing::PrintToStringParamName());

TEST_P(LongLine, ArrivesWhole)
{
    std::string line;
    for (std::size_t i = 0; i < GetParam(); ++i) {
        line += static_cast<char>('a' + i % 26);
    }
    script("x", {exits(0, line + "\nnext\n")});
    UpdateManager::runProcess("x", output);
    EXPECT_EQ(output, line + "\nnext\n");
}

class InstallUpdate : public UnitTest
{
};

TEST_F(InstallUpdate, SuccessLogsOnlyTheEntryAndTheRunnersRecords)
{
    script(installCommand, {exits(0, "Setting up\n")});
    EXPECT_TRUE(UpdateManager::installUpdate(installCommand));
    EXPECT_EQ(journal(), packageInstalled(installCommand));
}

TEST_F(InstallUpdate, FailureLogsCodeAndOutputBackToBack)
{
    script(installCommand, {exits(1, "E: broken\n")});
    EXPECT_FALSE(UpdateManager::installUpdate(installCommand));
    EXPECT_EQ(journal(), (Lines{"log:", "log:Running command: apt --assume-yes install solvik4-rh",
                                "popen:apt --assume-yes install solvik4-rh", "log:Exit code:1", "log:1E: broken\n"}));
}

TEST_F(InstallUpdate, InstallThatDoesNotStartCounts)
{
    script(installCommand, {doesNotStart()});
    EXPECT_TRUE(UpdateManager::installUpdate(installCommand));
}

TEST_F(InstallUpdate, KilledInstallCounts)
{
    script(installCommand, {raw(SIGKILL)});
    EXPECT_TRUE(UpdateManager::installUpdate(installCommand));
}

} // namespace
