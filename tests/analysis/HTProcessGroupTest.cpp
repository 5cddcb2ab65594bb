#include "process/HTProcessGroup.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTProcess.h"

#include <gtest/gtest.h>

#include <memory>

TEST(HTProcessGroupTest, MembersComeOnceInTheOrderAdded)
{
    auto platform = std::make_shared<HTFakePlatform>();
    auto group = std::make_shared<HTProcessGroup>();
    // Large groups index their members: the pids past the sixteenth are
    // found through the index.
    for (int32_t pid : {5, 7, 5, 1, 2, 3, 4, 6, 8, 9, 10, 11, 12, 13, 14, 15, 16, 17, 18, 7, 17}) {
        auto process = std::make_shared<HTProcess>(platform);
        process->setPid(pid);
        group->addProcess(process);
    }
    ASSERT_EQ(group->count(), 18u);
    EXPECT_EQ(group->processes()[0]->pid(), 5);
    EXPECT_EQ(group->processes()[1]->pid(), 7);
    EXPECT_TRUE(group->containsPid(18));
    EXPECT_FALSE(group->containsPid(19));
}
