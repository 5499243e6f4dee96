#include "UnitTest.h"

namespace
{

class RemoteHead : public UnitTest
{
protected:
    void SetUp() override { registerCallbacks(); }

    static Lines packageIs(const std::string& installed, const std::string& candidate)
    {
        return packageChecked(policyCommand, installed, candidate);
    }
};

const Lines entry = {"log:"};
const Lines markerRemoved = {"system:rm /root/RESOURCES/tavren1stboot", "log:removedrm /root/RESOURCES/tavren1stboot"};
const Lines checkFailed = {"log:Failed to checkUpdate", "error:0"};
const Lines updated = {"result:1"};
const Lines noUpdate = {"result:0"};

TEST_F(RemoteHead, OpeningStepOnlyStopsTheApplication)
{
    UpdateManager::initRemoteHead();
    EXPECT_EQ(journal(), harlStopped());
}

TEST_F(RemoteHead, FailedMirrorRefreshRunsNoCheck)
{
    script(mirrorsCommand, {exits(100)});
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal(),
              (Lines{"log:", "log:", "log:Running command: apt update", "popen:apt update", "log:Exit code:100",
                     "log:NO_INTERNET_ERROR_CODE", "log:Update mirrors failed:", "error:1"}));
}

TEST_F(RemoteHead, UnreadPackageVersionsAreACheckError)
{
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal(), joined({entry,
                                 mirrorsOk(),
                                 {"log:apt-cache policy solvik4-rh", "log:Running command: apt-cache policy solvik4-rh",
                                  "popen:apt-cache policy solvik4-rh", "log:Exit code:0",
                                  "log:  ", "log:NWM_UM_CHECK_UPDATE_FAILED"},
                                 checkFailed}));
}

TEST_F(RemoteHead, ExitCode100OfThePackageCheckIsNotANetworkFailure)
{
    script(policyCommand, {exits(100, policy("1", "1"))});
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal().back(), "result:0");
}

TEST_F(RemoteHead, FailedPackageInstallEndsTheUpdate)
{
    scriptPackage(policyCommand, "1.2.0", "1.3.0");
    script(installCommand, {exits(100, "E: dpkg\n")});
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal(), joined({entry,
                                 mirrorsOk(),
                                 packageIs("1.2.0", "1.3.0"),
                                 {"log:", running(installCommand), opened(installCommand), "log:Exit code:100",
                                  "log:100E: dpkg\n", "log:update failed", "error:2"}}));
}

TEST_F(RemoteHead, FailedBoardInstallEndsTheUpdate)
{
    scriptPackage(policyCommand, "1.2.0", "1.3.0");
    scriptBoard("2.1.0", "2.2.0");
    script(uploadCommand, {exits(1)});
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal(), joined({entry,
                                 mirrorsOk(),
                                 packageIs("1.2.0", "1.3.0"),
                                 packageInstalled(installCommand),
                                 boardChecked("2.1.0", "2.2.0"),
                                 boardUploadFailed(),
                                 {"log:update QUORB failed", "error:3"}}));
}

TEST_F(RemoteHead, NothingToUpdateKeepsTheMarker)
{
    scriptPackage(policyCommand, "1.2.0", "1.2.0");
    scriptBoard("2.1.0", "2.1.0");
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal(),
              joined({entry, mirrorsOk(), packageIs("1.2.0", "1.2.0"), boardChecked("2.1.0", "2.1.0"), noUpdate}));
}

TEST_F(RemoteHead, UnreadableBoardIsToleratedWhenThePackageIsUpToDate)
{
    scriptPackage(policyCommand, "1.2.0", "1.2.0");
    script(boardVersionCommand, {exits(255)});
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal(), joined({entry, mirrorsOk(), packageIs("1.2.0", "1.2.0"), boardNotReadable(), noUpdate}));
}

TEST_F(RemoteHead, UnreadableBoardAfterAPackageUpdateIsACheckErrorAndKeepsTheMarker)
{
    scriptPackage(policyCommand, "1.2.0", "1.3.0");
    script(boardVersionCommand, {exits(255)});
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal(), joined({entry, mirrorsOk(), packageIs("1.2.0", "1.3.0"), packageInstalled(installCommand),
                                 boardNotReadable(), checkFailed}));
}

TEST_F(RemoteHead, PackageUpdateAloneRemovesTheMarker)
{
    scriptPackage(policyCommand, "1.2.0", "1.3.0");
    scriptBoard("2.1.0", "2.1.0");
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal(), joined({entry, mirrorsOk(), packageIs("1.2.0", "1.3.0"), packageInstalled(installCommand),
                                 boardChecked("2.1.0", "2.1.0"), markerRemoved, updated}));
}

TEST_F(RemoteHead, BoardUpdateAloneRemovesTheMarker)
{
    scriptPackage(policyCommand, "1.2.0", "1.2.0");
    scriptBoard("2.1.0", "2.2.0");
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal(), joined({entry, mirrorsOk(), packageIs("1.2.0", "1.2.0"), boardChecked("2.1.0", "2.2.0"),
                                 boardInstalled(), markerRemoved, updated}));
}

TEST_F(RemoteHead, PackageAndBoardAreUpdated)
{
    scriptPackage(policyCommand, "1.2.0", "1.3.0");
    scriptBoard("2.1.0", "2.2.0");
    UpdateManager::updateRemoteHead();
    EXPECT_EQ(journal(), joined({entry, mirrorsOk(), packageIs("1.2.0", "1.3.0"), packageInstalled(installCommand),
                                 boardChecked("2.1.0", "2.2.0"), boardInstalled(), markerRemoved, updated}));
}

using MarkerRemoval = With<RemoteHead>;
INSTANTIATE_TEST_SUITE_P(Statuses, MarkerRemoval,
                         testing::Values(Named<int>{"Removed", 0}, Named<int>{"Killed", 1},
                                         Named<int>{"AlreadyGone", 256}),
                         nameOf<Named<int>>);

TEST_P(MarkerRemoval, CountsAsDone)
{
    scriptPackage(policyCommand, "1.2.0", "1.3.0");
    scriptBoard("2.1.0", "2.1.0");
    script(markerCommand, {raw(value())});
    UpdateManager::updateRemoteHead();
    const Lines all = journal();
    EXPECT_EQ(Lines(all.end() - 3, all.end()), joined({markerRemoved, updated}));
}

TEST_F(RemoteHead, MarkerRemovalThatDoesNotStartIsNotLogged)
{
    scriptPackage(policyCommand, "1.2.0", "1.3.0");
    scriptBoard("2.1.0", "2.1.0");
    script(markerCommand, {raw(-1)});
    UpdateManager::updateRemoteHead();
    const Lines all = journal();
    EXPECT_EQ(Lines(all.end() - 3, all.end()),
              (Lines{"log:QUORB up to date", "system:rm /root/RESOURCES/tavren1stboot", "result:1"}));
}

TEST_F(RemoteHead, ClosingStepLeavesThirtySecondsThenGivesTheInstrumentBack)
{
    UpdateManager::deinitRemoteHead();
    EXPECT_EQ(
        journal(),
        joined({{"log:", "log:Giving users 30 Secs to view Pass/Fail LED status before completing update", "sleep:30"},
                harlStarted()}));
}

} // namespace
