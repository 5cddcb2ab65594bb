#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"

#include <gtest/gtest.h>

#include <initializer_list>
#include <memory>
#include <string>
#include <utility>

namespace {

std::shared_ptr<HTAuxDataMap> map(std::initializer_list<std::pair<std::string, HTAuxDataMap::Value>> entries)
{
    auto made = std::make_shared<HTAuxDataMap>();
    for (const auto& [key, value] : entries) made->set(key, value);
    return made;
}

HTAuxDataMap::Value datum(int64_t value, bool aggregate) { return std::make_shared<HTAuxData>(value, aggregate); }

// The value under `key`, or -1 when the key is gone.
int64_t valueOf(const std::shared_ptr<HTAuxDataMap>& data, const std::string& key)
{
    auto found = data ? std::dynamic_pointer_cast<HTAuxData>(data->find(key)) : nullptr;
    return found ? found->value() : -1;
}

}  // namespace

TEST(HTAuxData, OnlyAggregatingDataSurviveAMerge)
{
    // What the producers make is never added up, so nothing is merged.
    EXPECT_EQ(map({{"phys_heft", datum(10, false)}})->mergeWithData(nullptr), nullptr);

    // Over a run each process's map is merged with the accumulation so far.
    auto merged = map({{"a", datum(7, true)}, {"once", datum(3, false)}})->mergeWithData(map({{"a", datum(5, true)}}));
    EXPECT_EQ(valueOf(merged, "a"), 12);
    EXPECT_EQ(merged->find("once"), nullptr);
    EXPECT_EQ(valueOf(map({{"a", datum(1, true)}})->mergeWithData(merged), "a"), 13);
    EXPECT_EQ(map({{"a", datum(1, false)}})->mergeWithData(merged), nullptr);

    // Only the receiver's flag counts.
    auto aggregating = map({{"k", datum(2, true)}});
    auto plain = map({{"k", datum(3, false)}});
    EXPECT_EQ(valueOf(aggregating->mergeWithData(plain), "k"), 5);
    EXPECT_EQ(plain->mergeWithData(aggregating), nullptr);
}

TEST(HTAuxData, NestedMapsMergeAndDropOut)
{
    auto a = map({{"Maps", map({{"zone", datum(4, true)}, {"site", datum(1, false)}})}});
    auto b = map({{"Maps", map({{"zone", datum(6, true)}})}, {"x", datum(1, true)}});
    auto merged = a->mergeWithData(b);
    auto maps = std::dynamic_pointer_cast<HTAuxDataMap>(merged->find("Maps"));
    EXPECT_EQ(valueOf(maps, "zone"), 10);
    EXPECT_EQ(valueOf(maps, "site"), -1);
    EXPECT_EQ(valueOf(merged, "x"), 1);

    auto dropped = map({{"Maps", map({{"site", datum(1, false)}})}, {"x", datum(1, true)}})->mergeWithData(nullptr);
    EXPECT_EQ(dropped->find("Maps"), nullptr);

    EXPECT_DEATH(HTAuxDataMap::mergeAuxDatum(datum(1, true), map({})), "HTAuxData.*datum1->isContainer");
}
