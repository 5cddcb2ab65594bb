#include "analysis/HTHeftSharingData.h"
#include "analysis/HTHeftTestSupport.h"
#include "analysis/HTMemoryObjectMap.h"
#include "model/HTMemoryCategory.h"
#include "model/HTMemoryObject.h"
#include "process/HTProcessGroup.h"

#include <gtest/gtest.h>

namespace {

using HTHeftRoutingTest = HTAnalysisTest;
using HTHeftProcessHeftTest = HTAnalysisTest;
using HTHeftSharingTest = HTAnalysisTest;

HTMemoryObject* objectOf(const HTProcess& process, size_t region)
{
    return process.memoryRegions().at(region)->memoryObject().get();
}

std::string pidsOf(const HTProcessGroup& group) { return pidsOf(group.processes()); }

TEST_F(HTHeftRoutingTest, ObjectIdsAreSharedWithinOneMapOnly)
{
    HTScriptedRegion text = dirtyPages(0x100, 1);
    text.segment = HTSegmentText;
    HTScriptedRegion linkedit = dirtyPages(0x200, 1);
    linkedit.segment = HTSegmentLinkEdit;
    HTScriptedRegion data = dirtyPages(0x200, 1);
    data.segment = HTSegmentOther;
    auto p10 = process(10, {dirtyPages(0x100, 1), text, linkedit});
    auto p20 = process(20, {dirtyPages(0x100, 1), text, data});
    auto heft = gathered({p10, p20});

    EXPECT_EQ(objectOf(*p10, 0), objectOf(*p20, 0));
    EXPECT_EQ(objectOf(*p10, 1), objectOf(*p20, 1));
    EXPECT_NE(objectOf(*p10, 0), objectOf(*p10, 1));  // __TEXT has a map of its own
    EXPECT_NE(objectOf(*p10, 2), objectOf(*p20, 2));  // so has __LINKEDIT; other segments do not
    ASSERT_EQ(heft->memoryObjects()->size(), 2u);
    EXPECT_EQ(heft->memoryObjects()->begin()->first, 0x100u);  // in the order first met
    EXPECT_EQ(heft->textMemoryObjects()->size(), 1u);
    EXPECT_EQ(heft->linkeditMemoryObjects()->size(), 1u);
    EXPECT_EQ(heft->memoryObjects()->find(0x200), objectOf(*p20, 2));
    EXPECT_TRUE(objectOf(*p20, 2)->accurateSizes());
    EXPECT_TRUE(HTProcess::globalErrors().empty());
}

TEST_F(HTHeftRoutingTest, TouchedCopyOnWriteMemoryBelongsToItsProcess)
{
    auto cow = [](uint64_t dirty, uint64_t swapped) {
        return HTScriptedRegion{.objectId = 0x300,
                                .dirty = dirty,
                                .swapped = swapped,
                                .clean = kPage - dirty - swapped,
                                .shareMode = SM_COW};
    };
    auto p10 = process(10, {cow(kPage, 0)});
    auto p20 = process(20, {cow(0, 0)});
    auto p30 = process(30, {cow(0, 0)});
    auto p40 = process(40, {cow(0, kPage)});
    auto heft = gathered({p10, p20, p30, p40});

    EXPECT_EQ(objectOf(*p20, 0), objectOf(*p30, 0));
    EXPECT_NE(objectOf(*p10, 0), objectOf(*p20, 0));
    EXPECT_NE(objectOf(*p40, 0), objectOf(*p20, 0));
    EXPECT_NE(objectOf(*p10, 0), objectOf(*p40, 0));
    EXPECT_EQ(heft->memoryObjects()->size(), 3u);
    EXPECT_EQ(heft->memoryObjects()->find(0x300 ^ (uint64_t{10} << 32)), objectOf(*p10, 0));
    EXPECT_EQ(objectOf(*p10, 0)->totalDirtySize(), kPage);
}

TEST_F(HTHeftRoutingTest, KeysZeroAndAllOnesAreNeverMerged)
{
    const uint64_t allOnes = UINT64_MAX;
    HTScriptedRegion cacheAtZero{.objectId = 5, .inSharedCache = true, .start = 0};
    HTScriptedRegion touchedAllOnes{.objectId = allOnes, .dirty = kPage, .shareMode = SM_COW};
    // A copy-on-write key that the pid mixes down to 0.
    HTScriptedRegion mixesToZero{.objectId = uint64_t{10} << 32, .dirty = kPage, .shareMode = SM_COW};
    HTScriptedRegion noId{.objectId = 0}, onesId{.objectId = allOnes};
    auto p10 = process(10, {noId, noId, onesId, onesId, cacheAtZero, cacheAtZero, touchedAllOnes, mixesToZero});
    auto p20 = process(20, {noId, onesId, cacheAtZero});
    auto heft = gathered({p10, p20});

    EXPECT_EQ(heft->uniqueMemoryObjects().size(), 11u);
    EXPECT_TRUE(heft->memoryObjects()->empty());
    EXPECT_TRUE(heft->sharedCache64MemoryObjects()->empty());
    EXPECT_NE(objectOf(*p10, 0), objectOf(*p10, 1));
    EXPECT_NE(objectOf(*p10, 2), objectOf(*p20, 1));
}

TEST_F(HTHeftRoutingTest, SharedCacheIsKeyedByAddressPerWordSize)
{
    HTScriptedRegion cache{.objectId = 5, .inSharedCache = true, .start = 0x70000000};
    HTScriptedRegion otherPiece{.objectId = 5, .inSharedCache = true, .start = 0x70004000};
    auto p10 = process(10, {cache, otherPiece});
    auto p20 = process(20, {cache}, /*is64bit=*/false);
    auto p30 = process(30, {cache});
    auto heft = gathered({p10, p20, p30});

    EXPECT_EQ(objectOf(*p10, 0), objectOf(*p30, 0));
    EXPECT_NE(objectOf(*p10, 0), objectOf(*p10, 1));
    EXPECT_NE(objectOf(*p10, 0), objectOf(*p20, 0));
    EXPECT_EQ(heft->sharedCache64MemoryObjects()->size(), 2u);
    EXPECT_EQ(heft->sharedCache32MemoryObjects()->size(), 1u);
    EXPECT_TRUE(heft->memoryObjects()->empty());
}

TEST_F(HTHeftRoutingTest, SwitchesDecideOwnersAndProcessViews)
{
    // p20 maps the object through two regions, which would give it a view of
    // its own; p10 owns it.
    HTScriptedRegion owned = dirtyPages(0x500, 1);
    owned.owned = true;
    HTScriptedRegion secondPage = dirtyPages(0x500, 1);
    secondPage.offset = kPage;
    auto run = [&](bool breakdown, bool sharingDisabled) {
        setBreakdown(breakdown);
        settings_.sharingAnalysisDisabled = sharingDisabled;
        auto p10 = process(10, {owned});
        auto p20 = process(20, {dirtyPages(0x500, 1), secondPage});
        auto heft = gathered({p10, p20});
        const HTMemoryObject& object = *objectOf(*p10, 0);
        return std::make_pair(object.ownerPid(), object.processMemoryRegions().has_value());
    };
    EXPECT_EQ(run(true, false), std::make_pair(10, true));
    EXPECT_EQ(run(false, false), std::make_pair(-1, true));
    EXPECT_EQ(run(true, true), std::make_pair(10, false));
}

TEST_F(HTHeftProcessHeftTest, HeftFollowsTheBreakdownSwitch)
{
    // p10 maps the same two dirty pages twice, and a swapped page; p20 maps
    // the first of the two pages.
    HTScriptedRegion swapped{.objectId = 2, .swapped = kPage};
    HTScriptedRegion firstPage = dirtyPages(1, 1);
    auto makeProcesses = [&] {
        auto p10 = process(10, {dirtyPages(1, 2), dirtyPages(1, 2), swapped});
        auto p20 = process(20, {firstPage});
        auto p25 = process(25, {dirtyPages(1, 2)});
        auto hidden = process(30, {dirtyPages(1, 2)});
        hidden->setHiddenFromDisplay(true);
        return HTHeft::ProcessList{p10, p20, p25, hidden};
    };

    // Without it every object counts once and whole in each process's heft.
    auto heft = gathered(makeProcesses());
    EXPECT_EQ(*heft->pidToHeft().find(10), 3 * kPage);
    EXPECT_EQ(*heft->pidToHeft().find(20), 2 * kPage);
    EXPECT_EQ(*heft->pidToHeft().find(25), 2 * kPage);
    EXPECT_FALSE(heft->pidToHeft().contains(30));
    // Equal hefts: larger pid first.
    auto order = heft->_processesBySortingHeft(heft->_notHiddenProcesses());
    EXPECT_EQ(pidsOf(order), "{10,25,20}");
    EXPECT_EQ(pidsOf(HTHeftProbe::_processesBySortingPidDesc(heft->processes())), "{30,25,20,10}");

    // With it each region counts as the kernel reported it.
    setBreakdown(true);
    heft = gathered(makeProcesses());
    EXPECT_EQ(*heft->pidToHeft().find(10), 5 * kPage);
    EXPECT_EQ(*heft->pidToHeft().find(20), 1 * kPage);
}

TEST_F(HTHeftSharingTest, GroupsAreUnifiedAndPrivateGroupsComeFirst)
{
    auto p10 = process(10, {dirtyPages(1, 1), dirtyPages(2, 1), dirtyPages(5, 1), dirtyPages(6, 1)});
    auto p20 = process(20, {dirtyPages(1, 1), dirtyPages(6, 1), dirtyPages(5, 1)});
    auto p30 = process(30, {dirtyPages(5, 1), dirtyPages(6, 1), dirtyPages(5, 1)});
    auto heft = gathered({p10, p20, p30});
    auto sharing = heft->_sharingData();

    auto groupsOf = [&](int32_t pid) {
        std::string text;
        for (const auto& group : *sharing->processToProcessGroups().find(pid)) {
            text += pidsOf(*group);
        }
        return text;
    };
    // The shared group {10,20} was met before p10's private one.
    EXPECT_EQ(groupsOf(10), "{10}{10,20}{10,20,30}");
    EXPECT_EQ(groupsOf(20), "{10,20}{10,20,30}");
    EXPECT_EQ(groupsOf(30), "{10,20,30}");

    // Objects with the same set of processes share one group instance.
    const auto& all = *sharing->processToProcessGroups().find(30);
    EXPECT_EQ(sharing->processToProcessGroups().find(10)->operator[](2), all[0]);
    const auto* objects = sharing->processGroupToObjects().find(*all[0]);
    ASSERT_NE(objects, nullptr);
    ASSERT_EQ(objects->size(), 2u);
    EXPECT_TRUE(objects->contains(objectOf(*p10, 2)));
    EXPECT_TRUE(objects->contains(objectOf(*p10, 3)));
    EXPECT_EQ(sharing->processGroupToObjects().size(), 3u);
}

TEST_F(HTHeftSharingTest, HiddenProcessesJoinOnlyThroughOwnedMemoryWithAFakeRegion)
{
    HTScriptedRegion owned = dirtyPages(1, 1);
    owned.owned = true;
    HTScriptedRegion ownedUnmapped = owned;
    ownedUnmapped.fake = true;
    HTScriptedRegion ownedMappedOnly = dirtyPages(2, 1);
    ownedMappedOnly.owned = true;

    auto groupsFor = [&](bool breakdown) {
        setBreakdown(breakdown);
        auto p10 = process(10, {owned, ownedUnmapped, ownedMappedOnly});
        auto hidden = process(40, {dirtyPages(1, 1), dirtyPages(2, 1), dirtyPages(3, 1)});
        hidden->setHiddenFromDisplay(true);
        auto heft = gathered({p10, hidden});
        auto sharing = heft->_sharingData();
        std::string text;
        for (const auto& [group, objects] : sharing->processGroupToObjects())
            text += pidsOf(*group) + std::to_string(objects.size());
        return text + (sharing->processToProcessGroups().contains(40) ? " 40 grouped" : "");
    };
    EXPECT_EQ(groupsFor(true), "{10,40}1{10}1 40 grouped");
    // Owners are known only in the breakdown mode.
    EXPECT_EQ(groupsFor(false), "{10}2");
}

TEST(HTMemoryObjectMapTest, FindsEveryKeyAndKeepsInsertionOrder)
{
    // Small keys all share one hash; large ones spread. The hint is too
    // small, so the table grows on the way.
    HTMemoryObjectMap map(4);
    std::vector<uint64_t> keys;
    for (uint64_t i = 1; i <= 500; ++i) keys.push_back(i <= 200 ? i : (i * 0x9E3779B97F4A7C15ull) | 1);
    std::vector<HTMemoryObject*> objects;
    for (uint64_t key : keys) objects.push_back(map.objectForKey(key).get());

    ASSERT_EQ(map.size(), keys.size());
    size_t i = 0;
    for (const auto& [key, object] : map) {
        EXPECT_EQ(key, keys[i]);
        EXPECT_EQ(map.find(key), objects[i++]);
    }
    EXPECT_EQ(map.objectForKey(keys[321]).get(), objects[321]);
    EXPECT_EQ(map.find(0x12345678), nullptr);
}

}  // namespace
