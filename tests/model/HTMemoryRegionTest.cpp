#include "model/HTMemoryRegion.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <functional>
#include <memory>
#include <utility>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;

std::shared_ptr<HTMemoryRegion> region(uint64_t start, uint64_t size)
{
    auto made = std::make_shared<HTMemoryRegion>();
    made->setStart(start);
    made->setSize(size);
    return made;
}

// {eligibleForProcessView, eligibleForSubranges} of a two-page shared region
// with one dirty page, after `change`.
std::pair<bool, bool> eligibility(const std::function<void(HTMemoryRegion&)>& change)
{
    auto r = region(0x1000, 2 * kPage);
    r->setDirtySize(kPage);
    r->setShare_mode(SM_SHARED);
    r->setSegment(HTSegmentNoImage);
    change(*r);
    return {r->eligibleForProcessView(), r->eligibleForSubrangesUsingPageSize(kPage)};
}

}  // namespace

TEST(HTMemoryRegion, EndAndOrder)
{
    EXPECT_EQ(region(HTNoAddress, 5 * kPage)->end(), HTNoAddress);
    EXPECT_EQ(region(0x1000, 0x4000)->end(), 0x5000u);

    std::vector<std::shared_ptr<HTMemoryRegion>> regions{region(0x1000, 0x1000), region(0x1000, 0x3000),
                                                         region(0x800, 0x100)};
    std::sort(regions.begin(), regions.end(), [](const auto& a, const auto& b) { return a->compare(*b) < 0; });
    EXPECT_EQ(regions[0]->start(), 0x800u);
    EXPECT_EQ(regions[1]->size(), 0x3000u);
    EXPECT_EQ(regions[2]->compare(*region(0x1000, 0x1000)), 0);
}

TEST(HTMemoryRegion, Names)
{
    HTMemoryRegion r;
    r.setName("mapped file");
    r.setDetailedName("");
    EXPECT_EQ(r.fullName(), "mapped file");
    r.setDetailedName("x");
    EXPECT_EQ(r.fullName(), "mapped file x");

    EXPECT_EQ(HTMemoryRegion::categoryNameForTag(240), "app-specific tag 1");
    EXPECT_EQ(HTMemoryRegion::categoryNameForTag(255), "app-specific tag 16");
    EXPECT_EQ(HTMemoryRegion::categoryNameForTag(0), "untagged (\"VM_ALLOCATE\")");
    // Empty slots ask the region-type description, then fall through.
    EXPECT_EQ(HTMemoryRegion::categoryNameForTag(100), "shared memory");
    EXPECT_EQ(HTMemoryRegion::categoryNameForTag(99), "tag 99");
    EXPECT_EQ(HTMemoryRegion::categoryNameForTag(300), "tag 300");
    EXPECT_EQ(HTMemoryRegion::categoryNameForTag(0x80000000), "tag -2147483648");
    EXPECT_EQ(HTMemoryRegion::categoryNameForTag(HTFakeRegionTag), "Owned physical heft (unmapped)");
}

TEST(HTMemoryRegion, Eligibility)
{
    using Both = std::pair<bool, bool>;
    EXPECT_EQ(eligibility([](HTMemoryRegion&) {}), Both(true, true));
    // Memory private to its process by nature.
    EXPECT_EQ(eligibility([](HTMemoryRegion& r) { r.setUser_tag(HTFakeRegionTag); }), Both(false, false));
    EXPECT_EQ(eligibility([](HTMemoryRegion& r) { r.setInSharedCache(true); }), Both(false, false));
    for (uint8_t mode : {SM_PRIVATE, SM_EMPTY, SM_PRIVATE_ALIASED})
        EXPECT_EQ(eligibility([mode](HTMemoryRegion& r) { r.setShare_mode(mode); }), Both(false, false));
    for (uint8_t segment : {HTSegmentText, HTSegmentOther, HTSegmentLinkEdit})
        EXPECT_EQ(eligibility([segment](HTMemoryRegion& r) { r.setSegment(segment); }), Both(false, false));
    // Pages all of one kind, nothing at all, a single page, or owned memory.
    EXPECT_EQ(eligibility([](HTMemoryRegion& r) { r.setReclaimableSize(2 * kPage); }), Both(true, false));
    EXPECT_EQ(eligibility([](HTMemoryRegion& r) { r.setDirtySize(0); }), Both(true, false));
    EXPECT_EQ(eligibility([](HTMemoryRegion& r) { r.setSize(kPage); }), Both(true, false));
    EXPECT_EQ(eligibility([](HTMemoryRegion& r) { r.setOwnedExclusivelyByParentProcess(true); }), Both(true, false));
}
