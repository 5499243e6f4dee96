#include "UnitTest.h"

namespace
{

class CheckTVUpdate : public UnitTest
{
protected:
    bool check(const platform::Answer& answer)
    {
        script(teamViewerCheckCommand, {answer});
        return UpdateManager::checkTVUpdate(ok);
    }

    /// The records after those of the runner.
    static std::string lastMessages()
    {
        std::string text;
        for (const std::string& message : entries("log:")) {
            text += message + "|";
        }
        return text;
    }

    bool ok = false;
};

TEST_F(CheckTVUpdate, PlainFileRequestsTheInstallation)
{
    EXPECT_TRUE(check(exits(0, "/root/USB_MOUNT/debs/installTV\n")));
    EXPECT_TRUE(ok);
    EXPECT_EQ(journal(),
              (Lines{"log:Running command: ls /root/USB_MOUNT/debs/installTV",
                     "popen:ls /root/USB_MOUNT/debs/installTV", "log:Exit code:0",
                     "log:Teamviewer path/root/USB_MOUNT/debs/installTV", "log:Teamviewer install is required"}));
}

TEST_F(CheckTVUpdate, OutputWithoutLineFeedEqualsThePath)
{
    EXPECT_TRUE(check(exits(0, teamViewerMarker)));
    EXPECT_TRUE(ok);
}

TEST_F(CheckTVUpdate, OnlyTheFirstLineCounts)
{
    EXPECT_TRUE(check(exits(0, std::string(teamViewerMarker) + "\nmore\n")));
    EXPECT_FALSE(check(exits(0, std::string("more\n") + teamViewerMarker + "\n")));
}

using OtherListing = With<CheckTVUpdate, const char*>;
INSTANTIATE_TEST_SUITE_P(Listings, OtherListing,
                         testing::Values(Named<const char*>{"EmptyDirectory", ""},
                                         Named<const char*>{"DirectoryWithAFile", "file\n"},
                                         Named<const char*>{"OtherCase", "/root/USB_MOUNT/debs/installtv\n"},
                                         Named<const char*>{"Blank", "/root/USB_MOUNT/debs/installTV \n"}),
                         nameOf<Named<const char*>>);

TEST_P(OtherListing, RequestsNothing)
{
    EXPECT_FALSE(check(exits(0, value())));
    EXPECT_TRUE(ok);
    EXPECT_EQ(lastMessages(), "Running command: ls /root/USB_MOUNT/debs/installTV|Exit code:0|"
                              "Teamviewer path/root/USB_MOUNT/debs/installTV|No need to install Teamviewer|");
}

TEST_F(CheckTVUpdate, MissingMarkerRequestsNothing)
{
    EXPECT_FALSE(check(exits(2, std::string(teamViewerMarker) + "\n")));
    EXPECT_TRUE(ok);
    EXPECT_EQ(lastMessages(), "Running command: ls /root/USB_MOUNT/debs/installTV|Exit code:2|"
                              "install Teamviewer flag doesnot exist|");
}

class OtherExit : public CheckTVUpdate, public testing::WithParamInterface<int>
{
};
INSTANTIATE_TEST_SUITE_P(Codes, OtherExit, testing::Values(1, 3, 100, 127, 255), testing::PrintToStringParamName());

TEST_P(OtherExit, CannotBeTrusted)
{
    ok = true;
    EXPECT_FALSE(check(exits(GetParam(), std::string(teamViewerMarker) + "\n")));
    EXPECT_FALSE(ok);
    EXPECT_EQ(journal().back(), "log:Failed to check if TV install is needed");
    EXPECT_EQ(entries("log:").size(), 3U);
}

TEST_F(CheckTVUpdate, ShellThatDoesNotStartRequestsNothing)
{
    EXPECT_FALSE(check(doesNotStart()));
    EXPECT_TRUE(ok);
    EXPECT_EQ(lastMessages(), "Running command: ls /root/USB_MOUNT/debs/installTV|"
                              "Teamviewer path/root/USB_MOUNT/debs/installTV|No need to install Teamviewer|");
}

class InstallTVUpdate : public UnitTest
{
};

using TeamViewerStatus = With<InstallTVUpdate>;
INSTANTIATE_TEST_SUITE_P(Success, TeamViewerStatus, testing::Values(Named<int>{"Exit0", 0}), nameOf<Named<int>>);
INSTANTIATE_TEST_SUITE_P(Failures, TeamViewerStatus, testing::ValuesIn(failedStatuses), nameOf<Named<int>>);

TEST_P(TeamViewerStatus, IsLoggedAndNeverAFailure)
{
    script(teamViewerScriptCommand, {raw(value())});
    EXPECT_TRUE(UpdateManager::installTVUpdate());
    EXPECT_EQ(journal(), (Lines{"log:", "log:/root/RESOURCES/teamviewer_updatescript.sh",
                                "system:/root/RESOURCES/teamviewer_updatescript.sh",
                                "log:Install script ended with code: " + std::to_string(value())}));
}

} // namespace
