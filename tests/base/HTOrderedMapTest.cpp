#include "base/HTOrderedMap.h"
#include "base/HTPidMap.h"

#include <gtest/gtest.h>

#include <string>
#include <string_view>
#include <vector>

namespace {

struct ViewHash {
    using is_transparent = void;
    size_t operator()(std::string_view key) const { return std::hash<std::string_view>{}(key); }
};

}  // namespace

TEST(HTOrderedMap, KeepsInsertionOrderAndFindsKeysWhetherSmallOrLarge)
{
    // Grows past the size searched in place, then shrinks below it again.
    HTPidMap<std::string> map;
    for (int32_t pid = 100; pid > 70; --pid) {
        EXPECT_TRUE(map.set(pid, std::to_string(pid)));
        EXPECT_FALSE(map.set(100, "first"));
        for (int32_t present = 100; present >= pid; --present) ASSERT_TRUE(map.contains(present)) << present;
        EXPECT_EQ(map.find(pid - 1), nullptr);
    }
    EXPECT_EQ(*map.find(100), "first");
    EXPECT_EQ(map.keys().front(), 100);
    EXPECT_EQ(map.keys().back(), 71);

    for (int32_t pid = 71; pid <= 95; ++pid) EXPECT_TRUE(map.erase(pid));
    EXPECT_FALSE(map.erase(71));
    EXPECT_EQ(map.keys(), (std::vector<int32_t>{100, 99, 98, 97, 96}));
    EXPECT_EQ(*map.find(97), "97");
    EXPECT_TRUE(map.set(71, "back"));
    EXPECT_EQ(*map.find(71), "back");
}

TEST(HTOrderedMap, StringKeysAreFoundByViewOnEitherSideOfTheIndex)
{
    HTOrderedMap<std::string, int, ViewHash, std::equal_to<>> map;
    for (int i = 0; i < 20; ++i) {
        map.add("key" + std::to_string(i), i);
        for (int j = 0; j <= i; ++j) ASSERT_EQ(*map.find(std::string_view("key" + std::to_string(j))), j) << i;
        EXPECT_EQ(map.find(std::string_view("key")), nullptr);
    }
    EXPECT_EQ(map.begin()->first, "key0");
}
