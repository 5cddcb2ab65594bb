#include "base/HTPointerIndex.h"

#include <gtest/gtest.h>

#include <vector>

TEST(HTPointerIndex, NumbersPointersInFirstOfferedOrderAcrossGrowth)
{
    // Far more pointers than the smallest table holds, each offered twice.
    std::vector<int> things(1000);
    HTPointerIndex index(4);
    EXPECT_FALSE(index.contains(&things[0]));
    for (uint32_t i = 0; i < things.size(); ++i) {
        EXPECT_EQ(index.insert(&things[i]), std::make_pair(i, true));
        EXPECT_EQ(index.insert(&things[i / 2]), std::make_pair(i / 2, false));
    }
    EXPECT_EQ(index.size(), things.size());
    for (const int& thing : things) EXPECT_TRUE(index.contains(&thing));
    int other = 0;
    EXPECT_FALSE(index.contains(&other));
}
