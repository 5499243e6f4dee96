#include "UnitTest.h"

#include <cerrno>

namespace
{

class Services : public UnitTest
{
};

TEST_F(Services, StopHARLLogsTheRawStatus)
{
    for (const int status : {0, 256, 5 * 256, 15, -1}) {
        platform::reset();
        script("systemctl stop harl", {raw(status)});
        UpdateManager::stopHARL();
        EXPECT_EQ(journal(), (Lines{"log:", "system:systemctl stop harl", "log:" + std::to_string(status)}));
        EXPECT_EQ(platform::records().at(0).function, "static void UpdateManager::stopHARL()");
    }
}

TEST_F(Services, SecondStopBehavesLikeTheFirst)
{
    UpdateManager::stopHARL();
    UpdateManager::stopHARL();
    EXPECT_EQ(journal(), joined({harlStopped(), harlStopped()}));
}

TEST_F(Services, StopUpdaterLogsTheRawStatus)
{
    for (const int status : {0, 256, 15, -1}) {
        platform::reset();
        script("systemctl stop harl-updater", {raw(status)});
        UpdateManager::stopUpdater();
        EXPECT_EQ(journal(), (Lines{"log:", "system:systemctl stop harl-updater", "log:" + std::to_string(status)}));
        EXPECT_EQ(platform::records().at(0).function, "static void UpdateManager::stopUpdater()");
    }
}

TEST_F(Services, StartHARLReleasesTheStickStartsTheApplicationWaitsAndStopsTheUpdater)
{
    UpdateManager::startHARL();
    EXPECT_EQ(journal(), harlStarted());
    EXPECT_EQ(platform::records().at(0).function, "static void UpdateManager::startHARL()");
}

TEST_F(Services, StartHARLCarriesOnWhenEveryCommandFails)
{
    script("umount /root/USB_MOUNT/", {exits(32)});
    script("systemctl start harl", {exits(5)});
    script("systemctl stop harl-updater", {raw(-1)});
    UpdateManager::startHARL();
    EXPECT_EQ(journal(), (Lines{"log:", "system:umount /root/USB_MOUNT/", "log:8192", "system:systemctl start harl",
                                "log:1280", "sleep:10", "log:", "system:systemctl stop harl-updater", "log:-1"}));
}

TEST_F(Services, SignalDoesNotShortenTheTenSeconds)
{
    int calls = 0;
    platform::scriptSleep([&calls](const timespec*, timespec* remaining) {
        if (++calls == 2) {
            return 0;
        }
        *remaining = {4, 0};
        errno = EINTR;
        return -1;
    });
    UpdateManager::startHARL();
    EXPECT_EQ(entries("sleep:"), (Lines{"10", "4"}));
    EXPECT_EQ(entries("system:").back(), "systemctl stop harl-updater");
}

} // namespace
