#include "model/HTAuxDataMap.h"

#include "base/HTAssert.h"
#include "model/HTAuxData.h"

void HTAuxDataMap::set(const std::string& key, Value value)
{
    HT_ASSERT("HTAuxData", value != nullptr, "value != nullptr");
    values_.set(key, std::move(value));
}

HTAuxDataMap::Value HTAuxDataMap::find(const std::string& key) const
{
    const Value* found = values_.find(key);
    return found ? *found : nullptr;
}

std::shared_ptr<HTAuxDataMap> HTAuxDataMap::mergeWithData(const std::shared_ptr<HTAuxDataMap>& other) const
{
    auto merged = std::make_shared<HTAuxDataMap>();
    for (const auto& [key, value] : values_) {
        if (Value result = mergeAuxDatum(value, other ? other->find(key) : nullptr)) merged->set(key, result);
    }
    if (other) {
        for (const auto& [key, value] : *other) {
            if (values_.contains(key)) continue;
            if (Value result = mergeAuxDatum(value, nullptr)) merged->set(key, result);
        }
    }
    return merged->empty() ? nullptr : merged;
}

HTAuxDataMap::Value HTAuxDataMap::mergeAuxDatum(const Value& datum1, const Value& datum2)
{
    HT_ASSERT("HTAuxData", !datum2 || datum1->isContainer() == datum2->isContainer(),
              "!datum2 || datum1->isContainer() == datum2->isContainer()");
    if (datum1->isContainer()) {
        // Maps are the only containers.
        const auto& map1 = static_cast<const HTAuxDataMap&>(*datum1);
        return map1.mergeWithData(std::static_pointer_cast<HTAuxDataMap>(datum2));
    }

    const auto& data1 = static_cast<const HTAuxData&>(*datum1);
    if (!data1.shouldAggregate()) return nullptr;
    if (!datum2) return datum1;
    const auto& data2 = static_cast<const HTAuxData&>(*datum2);
    return std::make_shared<HTAuxData>(data1.value() + data2.value(), true);
}
