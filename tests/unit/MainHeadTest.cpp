#include "UnitTest.h"

namespace
{

class MainHead : public UnitTest
{
protected:
    void SetUp() override { registerCallbacks(); }

    /// What the test of the TeamViewer marker leaves in the journal.
    static Lines teamViewerChecked(bool required)
    {
        const std::string query = teamViewerCheckCommand;
        if (required) {
            return {"log:Running command: " + query, "popen:" + query, "log:Exit code:0",
                    logged(std::string("Teamviewer path") + teamViewerMarker), "log:Teamviewer install is required"};
        }
        return {"log:Running command: " + query, "popen:" + query, "log:Exit code:2",
                "log:install Teamviewer flag doesnot exist"};
    }

    static void scriptTeamViewer(bool required)
    {
        script(teamViewerCheckCommand, {required ? exits(0, std::string(teamViewerMarker) + "\n") : exits(2)});
    }

    static void scriptUnit(const std::string& packageCandidate, const std::string& boardCandidate, bool teamViewer)
    {
        scriptPackage(dhPolicy, "1.2.0", packageCandidate);
        scriptBoard("2.1.0", boardCandidate);
        scriptTeamViewer(teamViewer);
    }

    static Lines packageIs(const std::string& candidate) { return packageChecked(dhPolicy, "1.2.0", candidate); }

    /// An installation of all three components, in which `command` ends with `answer`.
    static Lines installAll(const std::string& command, const platform::Answer& answer)
    {
        script(command, {answer});
        UpdateManager::updateMainHead(all);
        return journal();
    }

    static constexpr const char* dhPolicy = "apt-cache policy solvik4-dh";
    static constexpr const char* dhInstall = "apt --assume-yes install solvik4-dh";
    static const std::vector<UpdateManager::UpdateComponent> all;
};

const std::vector<UpdateManager::UpdateComponent> MainHead::all = {
    {UpdateManager::COMPONENT_PACKAGE, "Solvik IV", "1.2.0", "1.3.0"},
    {UpdateManager::COMPONENT_QUORB, "QUORB", "2.1.0", "2.2.0"},
    {UpdateManager::COMPONENT_TEAMVIEWER, "TV", "1", "2"},
};

const Lines entry = {"log:"};
const Lines checkFailed = {"log:Failed to checkUpdate", "error:0"};
const Lines goingToInstallTeamViewer = {"log:going to install TV"};
const Lines markerRemoved = {"system:rm /root/RESOURCES/tavren1stboot", "log:removedrm /root/RESOURCES/tavren1stboot"};
const Lines packageStep = {"log:now call install MAIN udate0", "log:now call install DH udate"};
const Lines boardStep = {"log:now call install MAIN udate1", "log:now call install QUORB udate"};
const Lines teamViewerStep = {"log:now call install MAIN udate2", "log:now call install TV udate"};
const Lines finished = {"log:update maainhead finished", "result:1"};

Lines teamViewerInstalled(const std::string& status)
{
    return {"log:", logged(teamViewerScriptCommand), ran(teamViewerScriptCommand),
            "log:Install script ended with code: " + status};
}

TEST_F(MainHead, FailedMirrorRefreshRunsNoCheck)
{
    script(mirrorsCommand, {exits(100)});
    UpdateManager::initMainHead();
    EXPECT_EQ(journal(), joined({entry,
                                 harlStopped(),
                                 {"log:", "log:Running command: apt update", "popen:apt update", "log:Exit code:100",
                                  "log:NO_INTERNET_ERROR_CODE", "log:Update mirrors failed:", "error:1"}}));
}

TEST_F(MainHead, UnreadPackageVersionsAreACheckError)
{
    scriptPackage(dhPolicy, "", "1.3.0");
    UpdateManager::initMainHead();
    EXPECT_EQ(journal(), joined({entry,
                                 harlStopped(),
                                 mirrorsOk(),
                                 {logged(dhPolicy), running(dhPolicy), opened(dhPolicy), "log:Exit code:0",
                                  "log:solvik4:", "log:", "log:1.3.0", "log:  Version table:", "log:  1.3.0",
                                  "log:NWM_UM_CHECK_UPDATE_FAILED"},
                                 checkFailed}));
}

TEST_F(MainHead, ExitCode100OfThePackageCheckIsNotANetworkFailure)
{
    scriptUnit("1.2.0", "2.1.0", false);
    script(dhPolicy, {exits(100, policy("1.2.0", "1.2.0"))});
    UpdateManager::initMainHead();
    EXPECT_EQ(journal().back(), "result:0");
}

TEST_F(MainHead, UnreadableBoardIsACheckErrorEvenWithoutAPackageUpdate)
{
    scriptUnit("1.2.0", "2.1.0", false);
    script(boardVersionCommand, {exits(255)});
    UpdateManager::initMainHead();
    EXPECT_EQ(journal(),
              joined({entry, harlStopped(), mirrorsOk(), packageIs("1.2.0"), boardNotReadable(), checkFailed}));
}

TEST_F(MainHead, FailedTeamViewerTestIsACheckError)
{
    scriptUnit("1.3.0", "2.2.0", false);
    script(teamViewerCheckCommand, {exits(1)});
    UpdateManager::initMainHead();
    EXPECT_EQ(journal(), joined({entry,
                                 harlStopped(),
                                 mirrorsOk(),
                                 packageIs("1.3.0"),
                                 boardChecked("2.1.0", "2.2.0"),
                                 {running(teamViewerCheckCommand), opened(teamViewerCheckCommand), "log:Exit code:1",
                                  "log:Failed to check if TV install is needed"},
                                 checkFailed}));
}

TEST_F(MainHead, NothingToUpdateRemovesTheMarker)
{
    scriptUnit("1.2.0", "2.1.0", false);
    UpdateManager::initMainHead();
    EXPECT_EQ(journal(), joined({entry,
                                 harlStopped(),
                                 mirrorsOk(),
                                 packageIs("1.2.0"),
                                 boardChecked("2.1.0", "2.1.0"),
                                 teamViewerChecked(false),
                                 markerRemoved,
                                 {"result:0"}}));
}

TEST_F(MainHead, RequiredTeamViewerAloneIsOffered)
{
    scriptUnit("1.2.0", "2.1.0", true);
    UpdateManager::initMainHead();
    EXPECT_EQ(journal(), joined({entry,
                                 harlStopped(),
                                 mirrorsOk(),
                                 packageIs("1.2.0"),
                                 boardChecked("2.1.0", "2.1.0"),
                                 teamViewerChecked(true),
                                 goingToInstallTeamViewer,
                                 markerRemoved,
                                 {"found:{2,TV,1,2}"}}));
}

TEST_F(MainHead, PackageAloneIsOffered)
{
    scriptUnit("1.3.0", "2.1.0", false);
    UpdateManager::initMainHead();
    EXPECT_EQ(journal().back(), "found:{0,Solvik IV,1.2.0,1.3.0}");
}

TEST_F(MainHead, PackageIsOfferedBeforeTheBoard)
{
    scriptUnit("1.3.0", "2.2.0", false);
    UpdateManager::initMainHead();
    EXPECT_EQ(journal(), joined({entry,
                                 harlStopped(),
                                 mirrorsOk(),
                                 packageIs("1.3.0"),
                                 boardChecked("2.1.0", "2.2.0"),
                                 teamViewerChecked(false),
                                 markerRemoved,
                                 {"found:{0,Solvik IV,1.2.0,1.3.0}{1,QUORB,2.1.0,2.2.0}"}}));
}

TEST_F(MainHead, AllThreeAreOfferedInTheirOrder)
{
    scriptUnit("1.3.0", "2.2.0", true);
    UpdateManager::initMainHead();
    EXPECT_EQ(journal().back(), "found:{0,Solvik IV,1.2.0,1.3.0}{1,QUORB,2.1.0,2.2.0}{2,TV,1,2}");
}

TEST_F(MainHead, MarkerThatIsAlreadyGoneCountsAsRemoved)
{
    scriptUnit("1.2.0", "2.1.0", false);
    script(markerCommand, {exits(1)});
    UpdateManager::initMainHead();
    const Lines lines = journal();
    EXPECT_EQ(Lines(lines.end() - 3, lines.end()), joined({markerRemoved, {"result:0"}}));
}

TEST_F(MainHead, MarkerRemovalThatDoesNotStartIsNotLogged)
{
    scriptUnit("1.2.0", "2.1.0", false);
    script(markerCommand, {raw(-1)});
    UpdateManager::initMainHead();
    const Lines lines = journal();
    EXPECT_EQ(Lines(lines.end() - 2, lines.end()), (Lines{"system:rm /root/RESOURCES/tavren1stboot", "result:0"}));
}

TEST_F(MainHead, EmptyListCountsAsUpdated)
{
    UpdateManager::updateMainHead({});
    EXPECT_EQ(journal(), joined({entry, finished}));
}

TEST_F(MainHead, ComponentsAreInstalledInTheOrderOfTheList)
{
    UpdateManager::updateMainHead({all[2], all[0], all[1]});
    EXPECT_EQ(journal(), joined({entry, teamViewerStep, teamViewerInstalled("0"), packageStep,
                                 packageInstalled(dhInstall), boardStep, boardInstalled(), finished}));
}

TEST_F(MainHead, UnknownKindsArePassedOver)
{
    UpdateManager::updateMainHead({{5, "", "", ""}, {-1, "", "", ""}});
    EXPECT_EQ(journal(),
              joined({entry, {"log:now call install MAIN udate5", "log:now call install MAIN udate-1"}, finished}));
}

TEST_F(MainHead, FailedPackageInstallLeavesTheRestUninstalled)
{
    EXPECT_EQ(
        installAll(dhInstall, exits(100, "E: dpkg\n")),
        joined({entry,
                packageStep,
                {"log:", running(dhInstall), opened(dhInstall), "log:Exit code:100", "log:100E: dpkg\n", "error:2"}}));
}

TEST_F(MainHead, FailedBoardInstallLeavesTeamViewerUninstalled)
{
    EXPECT_EQ(installAll(uploadCommand, exits(1)),
              joined({entry, packageStep, packageInstalled(dhInstall), boardStep, boardUploadFailed(), {"error:3"}}));
}

TEST_F(MainHead, FailingTeamViewerScriptCountsAsUpdated)
{
    EXPECT_EQ(installAll(teamViewerScriptCommand, exits(3)),
              joined({entry, packageStep, packageInstalled(dhInstall), boardStep, boardInstalled(), teamViewerStep,
                      teamViewerInstalled("768"), finished}));
}

TEST_F(MainHead, ClosingStepGivesTheInstrumentBackWithoutAPause)
{
    UpdateManager::deinitMainHead();
    EXPECT_EQ(journal(), harlStarted());
}

} // namespace
