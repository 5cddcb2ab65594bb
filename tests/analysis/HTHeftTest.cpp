#include "analysis/HTHeftTestSupport.h"
#include "analysis/HTMemoryObjectMap.h"
#include "model/HTMemoryObject.h"

#include <gtest/gtest.h>

namespace {

using HTHeftTest = HTAnalysisTest;

HTMemoryObject* objectOf(const HTProcess& process, size_t region)
{
    return process.memoryRegions().at(region)->memoryObject().get();
}

TEST_F(HTHeftTest, SwitchesDecideOwnersAndProcessViews)
{
    // p20 maps the object through two regions, which would give it a view of
    // its own; p10 owns it.
    HTScriptedRegion owned = dirtyPages(0x500, 1), secondPage = dirtyPages(0x500, 1);
    owned.owned = true;
    secondPage.offset = kPage;
    auto run = [&](bool breakdown, bool sharingDisabled) {
        settings_.breakDownPhysHeft = breakdown;
        settings_.sharingAnalysisDisabled = sharingDisabled;
        auto p10 = process(10, {owned});
        auto heft = gathered({p10, process(20, {dirtyPages(0x500, 1), secondPage})});
        return std::make_pair(objectOf(*p10, 0)->ownerPid(), objectOf(*p10, 0)->processMemoryRegions().has_value());
    };
    EXPECT_EQ(run(true, false), std::make_pair(10, true));
    EXPECT_EQ(run(false, false), std::make_pair(-1, true));
    EXPECT_EQ(run(true, true), std::make_pair(10, false));
}

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

}  // namespace
