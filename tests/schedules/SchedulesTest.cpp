/// The real classes in every order in which their threads can meet, up to two preemptions and two cycles of flashing.

#include "Run.h"

#include <gtest/gtest.h>

#include <cstdio>

namespace
{

class Update : public testing::TestWithParam<Ending>
{
};

TEST_P(Update, ShowsItsOutcomeInEverySchedule)
{
    const Found found = exploreUpdate(GetParam());
    std::printf("%ld schedules; update ahead of the main thread: flashing stopped before its start %ld, notification "
                "before the wait %ld, no return %ld, of these in the wait for the flashing %ld\n",
                found.schedules, found.late, found.lost, found.hangs, found.stuck);
    EXPECT_EQ(found.finding, "");
    EXPECT_GT(found.schedules, 1000);
    EXPECT_GT(found.lost, 0) << "the bare wait is not explored";
    EXPECT_EQ(found.hangs, found.lost + found.stuck);
}

std::string nameOf(const testing::TestParamInfo<Ending>& info)
{
    const char* const names[] = {"NothingToUpdate", "Updated", "ReadFailure", "InstallFailure"};
    return names[static_cast<int>(info.param)];
}

INSTANTIATE_TEST_SUITE_P(Endings, Update,
                         testing::Values(Ending::NothingToUpdate, Ending::Updated, Ending::ReadFailure,
                                         Ending::InstallFailure),
                         nameOf);

TEST(Flashing, StartsStopsIsWaitedForAndStartsAgainInEverySchedule)
{
    const Found found = exploreFlashing();
    std::printf("%ld schedules; rounds stopped before the thread's first look: %ld\n", found.schedules, found.late);
    EXPECT_EQ(found.finding, "");
    EXPECT_GT(found.schedules, 1000);
    EXPECT_GT(found.late, 0);
}

} // namespace
