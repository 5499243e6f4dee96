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
    EXPECT_EQ(platform::records().back().function, "static bool UpdateManager::checkTVUpdate(bool&)");
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

TEST_F(CheckTVUpdate, DirectoryRequestsNothing)
{
    for (const char* listing :
         {"", "file\n", "/root/USB_MOUNT/debs/installtv\n", "/root/USB_MOUNT/debs/installTV \n"}) {
        platform::reset();
        ok = false;
        EXPECT_FALSE(check(exits(0, listing)));
        EXPECT_TRUE(ok);
        EXPECT_EQ(lastMessages(), "Running command: ls /root/USB_MOUNT/debs/installTV|Exit code:0|"
                                  "Teamviewer path/root/USB_MOUNT/debs/installTV|No need to install Teamviewer|");
    }
}

TEST_F(CheckTVUpdate, MissingMarkerRequestsNothing)
{
    EXPECT_FALSE(check(exits(2, std::string(teamViewerMarker) + "\n")));
    EXPECT_TRUE(ok);
    EXPECT_EQ(lastMessages(), "Running command: ls /root/USB_MOUNT/debs/installTV|Exit code:2|"
                              "install Teamviewer flag doesnot exist|");
}

TEST_F(CheckTVUpdate, AnyOtherExitCodeCannotBeTrusted)
{
    for (const int code : {1, 3, 100, 127, 255}) {
        platform::reset();
        ok = true;
        EXPECT_FALSE(check(exits(code, std::string(teamViewerMarker) + "\n")));
        EXPECT_FALSE(ok);
        EXPECT_EQ(journal().back(), "log:Failed to check if TV install is needed");
        EXPECT_EQ(entries("log:").size(), 3U);
    }
}

TEST_F(CheckTVUpdate, ShellThatDoesNotStartRequestsNothing)
{
    EXPECT_FALSE(check({0, "", false, {}}));
    EXPECT_TRUE(ok);
    EXPECT_EQ(lastMessages(), "Running command: ls /root/USB_MOUNT/debs/installTV|"
                              "Teamviewer path/root/USB_MOUNT/debs/installTV|No need to install Teamviewer|");
}

class InstallTVUpdate : public UnitTest
{
};

TEST_F(InstallTVUpdate, RawStatusIsLoggedAndNeverAFailure)
{
    for (const int status : {0, 5 * 256, 127 * 256, 9, -1}) {
        platform::reset();
        script(teamViewerScriptCommand, {raw(status)});
        EXPECT_TRUE(UpdateManager::installTVUpdate());
        EXPECT_EQ(journal(), (Lines{"log:", "log:/root/RESOURCES/teamviewer_updatescript.sh",
                                    "system:/root/RESOURCES/teamviewer_updatescript.sh",
                                    "log:Install script ended with code: " + std::to_string(status)}));
        EXPECT_EQ(platform::records().back().function, "static bool UpdateManager::installTVUpdate()");
    }
}

} // namespace
