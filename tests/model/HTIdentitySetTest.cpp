#include "model/HTIdentitySet.h"

#include <gtest/gtest.h>

#include <memory>
#include <vector>

TEST(HTIdentitySet, KeepsFirstInsertionOrderAndRefusesTheSameInstance)
{
    // Enough objects to pass from searching in place to the hash index,
    // each offered twice: before and after the switch.
    std::vector<std::shared_ptr<int>> objects;
    for (int i = 0; i < 40; ++i) objects.push_back(std::make_shared<int>(i % 3));
    HTIdentitySet<int> set;
    for (size_t i = 0; i < objects.size(); ++i) {
        EXPECT_TRUE(set.insert(objects[i])) << i;
        EXPECT_FALSE(set.insert(objects[i / 2])) << i;
        EXPECT_TRUE(set.contains(objects[i].get()));
    }
    EXPECT_EQ(set.size(), objects.size());
    // Equal values are still different instances.
    EXPECT_FALSE(set.contains(std::make_shared<int>(0).get()));
    size_t at = 0;
    for (const auto& item : set) EXPECT_EQ(item, objects[at++]);

    HTIdentitySet<int> other;
    other.insert(objects[5]);
    other.insert(std::make_shared<int>(7));
    set.unite(other);
    EXPECT_EQ(set.size(), objects.size() + 1);
}
