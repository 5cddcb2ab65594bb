#include "model/HTMemoryCategory.h"
#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"

#include <gtest/gtest.h>

#include <memory>

namespace {

constexpr uint64_t kPage = 4096;

// A finalised object of one "__TEXT" region with one dirty page.
std::shared_ptr<HTMemoryObject> object(uint64_t objectId, const char* path = "/usr/lib/libz.so")
{
    auto r = std::make_shared<HTMemoryRegion>();
    r->setObject_id(objectId);
    r->setSize(kPage);
    r->setDirtySize(kPage);
    r->setName("__TEXT");
    r->setDetailedName(path);
    auto made = std::make_shared<HTMemoryObject>();
    made->addRegion(r, kPage);
    made->finalize(false);
    return made;
}

}  // namespace

TEST(HTMemoryCategory, EachObjectAndRegionCountsOnce)
{
    HTMemoryCategory category(HTSegmentText);
    EXPECT_EQ(category.name(), std::nullopt);
    auto first = object(1);
    category.addMemoryObject(first);
    category.addMemoryObject(first);
    EXPECT_EQ(category.totalDirtySize(), kPage);
    // A distinct object with the same totals counts in full.
    category.addMemoryObject(object(2));
    EXPECT_EQ(category.totalDirtySize(), 2 * kPage);
    EXPECT_EQ(category.totalRegions(), 2);
    // A copy is another object over the same regions: totals add, regions do not.
    category.addMemoryObject(first->copy());
    EXPECT_EQ(category.totalDirtySize(), 3 * kPage);
    EXPECT_EQ(category.totalRegions(), 2);
}

TEST(HTMemoryCategory, SummaryHasNoDetailedName)
{
    HTMemoryCategory detailed(HTSegmentText);
    detailed.addMemoryObject(object(1));
    EXPECT_EQ(detailed.detailedName(), "/usr/lib/libz.so");
    EXPECT_EQ(detailed.fullName(), "__TEXT /usr/lib/libz.so");

    HTMemoryCategory summary(HTSegmentText, true);
    summary.addMemoryObject(object(1));
    summary.addMemoryObject(object(2, "/usr/lib/libm.so"));
    EXPECT_EQ(summary.detailedName(), std::nullopt);
    EXPECT_EQ(summary.fullName(), "__TEXT");
}
