#include "process/HTProcessGroup.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTProcess.h"

#include <gtest/gtest.h>

#include <memory>

namespace {

std::shared_ptr<HTProcess> processWithPid(int32_t pid)
{
    auto process = std::make_shared<HTProcess>(std::make_shared<HTFakePlatform>());
    process->setPid(pid);
    return process;
}

std::shared_ptr<HTProcessGroup> groupOf(std::initializer_list<int32_t> pids)
{
    auto group = std::make_shared<HTProcessGroup>();
    for (int32_t pid : pids) group->addProcess(processWithPid(pid));
    return group;
}

TEST(HTProcessGroupTest, HashAndDescriptionFollowTheMembers)
{
    EXPECT_EQ(HTProcessGroup().hash(), 19u);
    EXPECT_EQ(groupOf({5})->hash(), 698u);                     // 19 * 37 ^ 5
    EXPECT_EQ(groupOf({-1})->hashValue(), 703u ^ UINT64_MAX);  // the pid is sign-extended

    // A member comes once, whatever process object brings its pid.
    auto group = groupOf({5, 7, 5});
    EXPECT_EQ(group->count(), 2u);
    EXPECT_EQ(group->hash(), groupOf({5, 7})->hash());
    EXPECT_NE(group->hash(), groupOf({7, 5})->hash());
    EXPECT_EQ(group->description(), "HTProcessGroup{HTProcess[5], HTProcess[7]}");

    // Large groups index their members.
    auto large = groupOf({1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16, 17, 18, 19, 20, 3, 19});
    EXPECT_EQ(large->count(), 20u);
    EXPECT_TRUE(large->containsPid(20) && !large->containsPid(21));
}

TEST(HTProcessGroupTest, OpenGroupsCompareByMembersFrozenOnesByIdentity)
{
    auto frozen = groupOf({5, 7});
    frozen->freeze();
    auto open = groupOf({7, 5});
    EXPECT_TRUE(frozen->isEqual(*open));
    EXPECT_FALSE(frozen->isEqual(*groupOf({5})));
    EXPECT_FALSE(groupOf({5, 8})->isEqual(*open));

    auto twin = groupOf({5, 7});
    twin->freeze();
    EXPECT_TRUE(frozen->isEqual(*frozen));
    EXPECT_FALSE(frozen->isEqual(*twin));
    EXPECT_EQ(HTProcessGroup::copy(frozen), frozen);
}

TEST(HTProcessGroupDeathTest, MisuseOfFrozenAndOpenGroupsStops)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    auto frozen = groupOf({5});
    frozen->freeze();
    auto open = groupOf({5});
    EXPECT_DEATH(frozen->addProcess(processWithPid(6)), "HTProcessGroup.*!_immutable");
    EXPECT_DEATH(open->isEqual(*frozen), "HTProcessGroup.*self->_immutable");
    EXPECT_DEATH(HTProcessGroup::copy(open), "HTProcessGroup.*_immutable");
}

}  // namespace
