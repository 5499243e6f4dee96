/// One fault in the product, which the exploration must find. SOURCE_FAULT names it.

#include "Run.h"

#include <gtest/gtest.h>

#include <cstdio>

TEST(SeededFault, IsFound)
{
    const Found found = exploreUpdate(Ending::Updated);
    std::printf("%s: found in schedule %ld\n", SOURCE_FAULT, found.schedules);
    EXPECT_EQ(found.finding, FINDING);
}
