#include "analysis/HTMemoryObjectMap.h"
#include "model/HTMemoryObject.h"

#include <gtest/gtest.h>

#include <vector>

TEST(HTMemoryObjectMapTest, FindsEveryKeyAndKeepsInsertionOrder)
{
    // Small keys all share one hash; large ones spread. The hint is too
    // small, so the table grows on the way.
    HTMemoryObjectMap map(4);
    std::vector<uint64_t> keys;
    std::vector<HTMemoryObject*> objects;
    for (uint64_t i = 1; i <= 500; ++i) {
        keys.push_back(i <= 200 ? i : (i * 0x9E3779B97F4A7C15ull) | 1);
        objects.push_back(map.objectForKey(keys.back()).get());
    }
    ASSERT_EQ(map.size(), keys.size());
    size_t i = 0;
    for (const auto& [key, object] : map) {
        EXPECT_EQ(key, keys[i]);
        EXPECT_EQ(map.find(key), objects[i++]);
    }
    EXPECT_EQ(map.objectForKey(keys[321]).get(), objects[321]);
    EXPECT_EQ(map.find(0x12345678), nullptr);
}
