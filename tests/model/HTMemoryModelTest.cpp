#include "model/HTMemoryCategory.h"
#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"
#include "model/HTSharedPageList.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <functional>
#include <initializer_list>
#include <memory>
#include <utility>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;

// A shared mapping of `pages` pages from page `offsetPages` of an object, some dirty and swapped.
std::shared_ptr<HTMemoryRegion> region(uint64_t objectId, uint64_t offsetPages, uint64_t pages, uint64_t dirtyPages,
                                       uint64_t swappedPages = 0, uint8_t shareMode = SM_SHARED)
{
    auto made = std::make_shared<HTMemoryRegion>();
    made->setObject_id(objectId);
    made->setOffset(offsetPages * kPage);
    made->setSize(pages * kPage);
    made->setDirtySize(dirtyPages * kPage);
    made->setSwappedSize(swappedPages * kPage);
    made->setShare_mode(shareMode);
    made->setName("shared memory");
    return made;
}

// An object's totals: dirty, swapped, clean, reclaimable.
using Totals = std::array<uint64_t, 4>;
Totals totals(const HTMemoryObject& o)
{
    return {o.totalDirtySize(), o.totalSwappedSize(), o.totalCleanSize(), o.totalReclaimableSize()};
}

// An object of the regions, each mapped by the process of its pid (none when negative).
std::shared_ptr<HTMemoryObject>
objectOf(std::initializer_list<std::pair<std::shared_ptr<HTMemoryRegion>, int32_t>> regions)
{
    auto made = std::make_shared<HTMemoryObject>();
    for (const auto& [mapped, pid] : regions)
        pid < 0 ? made->addRegion(mapped, kPage) : made->addRegion(mapped, kPage, pid);
    return made;
}

// p1 maps two pages twice (and reports them twice), p2 the page after: three dirty pages, one swapped.
std::shared_ptr<HTMemoryObject> mappedTwiceByOne(int32_t p1 = 1, int32_t p2 = 2)
{
    return objectOf({{region(5, 0, 2, 2), p1}, {region(5, 0, 2, 2, 1), p1}, {region(5, 2, 1, 1), p2}});
}

// A finalised object of one "__TEXT" region with one dirty page.
std::shared_ptr<HTMemoryObject> textObject(uint64_t objectId, const char* path = "/usr/lib/libz.so")
{
    auto text = region(objectId, 0, 1, 1);
    text->setName("__TEXT");
    text->setDetailedName(path);
    auto made = objectOf({{text, -1}});
    made->finalize(false);
    return made;
}

}  // namespace

TEST(HTMemoryObject, TotalsCountEachPageOnce)
{
    auto object = objectOf({{region(5, 0, 4, 4), 1}, {region(5, 2, 4, 4), 1}});
    // Only a region's sub-ranges count once it has some.
    auto pieces = region(5, 16, 4, 4);
    pieces->addSubrange(16 * kPage, kPage, HTMemoryTotals{0, 0, kPage, 0, 0, 0}, kPage);
    object->addRegion(pieces, kPage, 1);
    EXPECT_EQ(pieces->subrangeList(), nullptr);
    // Without an object id a region names the object but counts nothing.
    object->addRegion(region(0, 0, 8, 8), kPage, 1);

    object->finalize(false);
    EXPECT_EQ(totals(*object), (Totals{6 * kPage, 0, kPage, 0}));
    EXPECT_EQ(object->memoryRegions().size(), 4u);
    EXPECT_EQ(object->rangeList(), nullptr);
    // A single process sees the object whole.
    EXPECT_FALSE(object->processMemoryRegions());
    EXPECT_EQ(object->viewForProcess(1, kPage, false, false), object);
}

TEST(HTMemoryObject, PerProcessMapIsKeptOnlyWhenItTellsSomething)
{
    auto object = std::make_shared<HTMemoryObject>();
    object->addRegion(region(5, 0, 1, 1, 0, SM_PRIVATE), kPage, 1);
    EXPECT_FALSE(object->processMemoryRegions()) << "a private region starts no map";
    object->addRegion(region(5, 0, 1, 1), kPage, 2);
    // Once the map exists every region is recorded, eligible or not.
    object->addRegion(region(5, 1, 1, 1, 0, SM_PRIVATE), kPage, 1);
    object->addRegion(region(5, 0, 1, 1), kPage);
    ASSERT_TRUE(object->processMemoryRegions());
    ASSERT_EQ(object->processMemoryRegions()->keys(), (std::vector<int32_t>{2, 1}));
    EXPECT_EQ(object->processMemoryRegions()->find(1)->size(), 1u);

    // Two processes, one region each: dropped when both equal the totals, kept when one differs.
    for (uint64_t secondDirty : {2, 1}) {
        auto two = objectOf({{region(5, 0, 2, 2), 1}, {region(5, 0, 2, secondDirty), 2}});
        two->finalize(false);
        EXPECT_EQ(bool(two->processMemoryRegions()), secondDirty != 2) << secondDirty << " dirty";
    }
}

TEST(HTMemoryObject, ViewsOfProcessesWithRegionsOfTheirOwn)
{
    auto pageCounted = mappedTwiceByOne();
    pageCounted->finalize(false);
    EXPECT_EQ(totals(*pageCounted), (Totals{3 * kPage, kPage, 0, 0}));

    // With the switch on no process is charged less than its regions say.
    auto object = mappedTwiceByOne();
    object->finalize(true);
    EXPECT_EQ(totals(*object), (Totals{4 * kPage, kPage, 0, 0}));

    // p1's regions report per-region heft: its view sums them as reported.
    auto view1 = object->viewForProcess(1, kPage, true, true);
    EXPECT_EQ(view1->totalDirtySize(), 4 * kPage);
    EXPECT_EQ(view1->memoryRegions().size(), 2u);
    EXPECT_EQ(object->viewForProcess(2, kPage, true, true)->totalDirtySize(), kPage);
    EXPECT_EQ(object->viewForProcess(3, kPage, true, true), object) << "no list of its own";
}

TEST(HTMemoryObject, TotalsAreNeverBelowWhatOneProcessSees)
{
    // p2 reports one dirty page in four; p1, after it, one dirty and one clean page in each half. The range
    // list can only bound the union (one page of each), yet p1's own view holds two of each.
    auto object = std::make_shared<HTMemoryObject>();
    object->addRegion(region(5, 0, 4, 1), kPage, 2);
    for (uint64_t half : {0, 2}) {
        auto mapped = region(5, half, 2, 1);
        mapped->setCleanNonSpecSize(kPage);
        object->addRegion(mapped, kPage, 1);
    }
    object->finalize(false);
    EXPECT_EQ(totals(*object), (Totals{2 * kPage, 0, 2 * kPage, 0}));
    EXPECT_EQ(totals(*object->viewForProcess(1, kPage, false, false)), (Totals{2 * kPage, 0, 2 * kPage, 0}));
}

TEST(HTMemoryObject, OwnedMemoryIsCleanToOtherProcesses)
{
    auto object = std::make_shared<HTMemoryObject>();
    auto mapped = region(5, 0, 4, 2, 1);
    mapped->setCleanNonSpecSize(kPage);
    mapped->setReclaimableSize(kPage);
    mapped->setWired(true);
    object->addRegion(mapped, kPage, 7);
    object->setOwnerPid(7);
    object->finalize(false);

    EXPECT_EQ(object->viewForProcess(7, kPage, false, false), object);
    auto seen = object->viewForProcess(9, kPage, false, false);
    EXPECT_EQ(totals(*seen), (Totals{0, 0, 4 * kPage, 0}));
    EXPECT_EQ(&seen->memoryRegions(), &object->memoryRegions()) << "a copy shares the region set";

    // Outside a kept per-process map a process sees the object whole, owned or not.
    auto kept = mappedTwiceByOne(1, 7);
    kept->setOwnerPid(7);
    kept->finalize(false);
    EXPECT_EQ(kept->viewForProcess(9, kPage, false, false), kept);
}

TEST(HTMemoryObject, NamesComeFromTheCanonicalRegion)
{
    auto fake = region(5, 0, 1, 1);
    fake->setUser_tag(HTFakeRegionTag);
    fake->setName("Owned physical heft (unmapped)");
    auto mapped = region(5, 0, 1, 1);
    mapped->setName("mapped file");
    mapped->setDetailedName("/tmp/data");
    EXPECT_EQ(objectOf({})->name(), std::nullopt);
    auto owned = objectOf({{fake, -1}, {mapped, -1}});
    owned->setOwnerPid(7);
    owned->finalize(false);
    EXPECT_EQ(fake->fullName(), "mapped file /tmp/data");

    // Shared-cache objects are named by an image piece, not an unused area.
    auto unused = region(0, 0, 1, 0);
    unused->setInSharedCache(true);
    unused->setUnusedSharedCacheRegion(true);
    auto piece = region(0, 1, 1, 0);
    piece->setInSharedCache(true);
    piece->setName("__TEXT");
    EXPECT_EQ(objectOf({{unused, -1}, {piece, -1}})->name(), "__TEXT");
}

TEST(HTMemoryObject, MisuseStopsTheProgram)
{
    auto object = std::make_shared<HTMemoryObject>();
    EXPECT_DEATH(object->copy(), "HTMemoryObject");
    object->finalize(false);
    EXPECT_DEATH(object->finalize(false), "HTMemoryObject");
    EXPECT_DEATH(object->addRegion(region(5, 0, 1, 0), kPage), "HTMemoryObject");
}

TEST(HTMemoryCategory, EachObjectAndRegionCountsOnce)
{
    HTMemoryCategory category(HTSegmentText);
    EXPECT_EQ(category.name(), std::nullopt);
    auto first = textObject(1);
    category.addMemoryObject(first);
    category.addMemoryObject(first);
    EXPECT_EQ(category.totalDirtySize(), kPage);
    // A distinct object with the same totals counts in full.
    category.addMemoryObject(textObject(2));
    EXPECT_EQ(category.totalDirtySize(), 2 * kPage);
    EXPECT_EQ(category.totalRegions(), 2);
    // A copy is another object over the same regions: totals add, regions do not.
    category.addMemoryObject(first->copy());
    EXPECT_EQ(category.totalDirtySize(), 3 * kPage);
    EXPECT_EQ(category.totalRegions(), 2);
    EXPECT_EQ(category.detailedName(), "/usr/lib/libz.so");
    EXPECT_EQ(category.fullName(), "__TEXT /usr/lib/libz.so");

    // A summary has no detailed name.
    HTMemoryCategory summary(HTSegmentText, true);
    summary.addMemoryObject(textObject(1));
    summary.addMemoryObject(textObject(2, "/usr/lib/libm.so"));
    EXPECT_EQ(summary.detailedName(), std::nullopt);
    EXPECT_EQ(summary.fullName(), "__TEXT");
}

TEST(HTMemoryRegion, EndOrderAndNames)
{
    auto spanning = [](uint64_t start, uint64_t size) {
        auto made = region(5, 0, 0, 0);
        made->setStart(start);
        made->setSize(size);
        return made;
    };
    EXPECT_EQ(spanning(HTNoAddress, 5 * kPage)->end(), HTNoAddress);
    EXPECT_EQ(spanning(0x1000, 0x4000)->end(), 0x5000u);
    std::vector<std::shared_ptr<HTMemoryRegion>> regions{spanning(0x1000, 0x1000), spanning(0x1000, 0x3000),
                                                         spanning(0x800, 0x100)};
    std::sort(regions.begin(), regions.end(), [](const auto& a, const auto& b) { return a->compare(*b) < 0; });
    EXPECT_EQ(regions[0]->start(), 0x800u);
    EXPECT_EQ(regions[1]->size(), 0x3000u);
    EXPECT_EQ(regions[2]->compare(*spanning(0x1000, 0x1000)), 0);

    HTMemoryRegion r;
    r.setName("mapped file");
    r.setDetailedName("");
    EXPECT_EQ(r.fullName(), "mapped file");
    r.setDetailedName("x");
    EXPECT_EQ(r.fullName(), "mapped file x");
    // Empty slots ask the region-type description, then fall through.
    const std::pair<uint32_t, const char*> tags[] = {{240, "app-specific tag 1"},
                                                     {255, "app-specific tag 16"},
                                                     {0, "untagged (\"VM_ALLOCATE\")"},
                                                     {100, "shared memory"},
                                                     {99, "tag 99"},
                                                     {300, "tag 300"},
                                                     {0x80000000, "tag -2147483648"},
                                                     {HTFakeRegionTag, "Owned physical heft (unmapped)"}};
    for (auto [tag, name] : tags) EXPECT_EQ(HTMemoryRegion::categoryNameForTag(tag), name) << tag;
}

TEST(HTMemoryRegion, Eligibility)
{
    // {eligibleForProcessView, eligibleForSubranges} of a two-page shared region, one page dirty, after `change`.
    using Both = std::pair<bool, bool>;
    auto eligibility = [](const std::function<void(HTMemoryRegion&)>& change) {
        auto r = region(5, 0, 2, 1);
        r->setSegment(HTSegmentNoImage);
        change(*r);
        return Both(r->eligibleForProcessView(), r->eligibleForSubrangesUsingPageSize(kPage));
    };
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

// Unidentified pages added a run at a time make the runs that adding them
// page by page makes.
TEST(HTSharedPageList, UnidentifiedRunsJoinAsSinglePagesWould)
{
    using Spec = std::array<uint32_t, 4>;  // {first page, count, identity (0 for none), kind}
    const std::vector<Spec> adds = {{0, 3, 0, 1}, {3, 2, 0, 1},  {5, 1, 42, 1},
                                    {6, 4, 0, 1}, {10, 1, 0, 4}, {12, 2, 0, 4}};
    HTSharedPageList whole, single;
    for (auto [first, count, identity, kind] : adds) {
        if (identity == 0) whole.addUnidentifiedPages(first, count, HTPageKind(kind));
        for (uint32_t page = first; page < first + count; ++page) {
            if (identity != 0) whole.addPage(page, HTPageKind(kind), identity);
            single.addPage(page, HTPageKind(kind), identity);
        }
    }
    auto specs = [](const HTSharedPageList& list) {
        std::vector<Spec> found;
        for (const auto& run : list.runs())
            found.push_back({run.firstPage, run.count, run.firstIdentity, uint32_t(run.kind)});
        return found;
    };
    EXPECT_EQ(specs(whole), specs(single));
    EXPECT_EQ(specs(whole).size(), 5u);
}
