#include "UnitTest.h"

#include <cerrno>

namespace
{

class Services : public UnitTest
{
};

using StopStatus = With<Services>;
INSTANTIATE_TEST_SUITE_P(Success, StopStatus, testing::Values(Named<int>{"Exit0", 0}), nameOf<Named<int>>);
INSTANTIATE_TEST_SUITE_P(Failures, StopStatus, testing::ValuesIn(failedStatuses), nameOf<Named<int>>);

TEST_P(StopStatus, OfHARLIsLogged)
{
    script("systemctl stop harl", {raw(value())});
    UpdateManager::stopHARL();
    EXPECT_EQ(journal(), (Lines{"log:", "system:systemctl stop harl", "log:" + std::to_string(value())}));
}

TEST_P(StopStatus, OfTheUpdaterIsLogged)
{
    script("systemctl stop harl-updater", {raw(value())});
    UpdateManager::stopUpdater();
    EXPECT_EQ(journal(), (Lines{"log:", "system:systemctl stop harl-updater", "log:" + std::to_string(value())}));
}

TEST_F(Services, SecondStopBehavesLikeTheFirst)
{
    UpdateManager::stopHARL();
    UpdateManager::stopHARL();
    EXPECT_EQ(journal(), joined({harlStopped(), harlStopped()}));
}

TEST_F(Services, StartHARLReleasesTheStickStartsTheApplicationWaitsAndStopsTheUpdater)
{
    UpdateManager::startHARL();
    EXPECT_EQ(journal(), harlStarted());
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
