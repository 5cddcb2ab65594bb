#pragma once

#include "base/HTOrderedMap.h"
#include "model/HTAuxDataType.h"

#include <cstddef>
#include <memory>
#include <string>
#include <utility>

// Auxiliary values under string keys; a value may itself be a map, to any
// depth. Keys iterate in the order they were first set.
class HTAuxDataMap : public HTAuxDataType {
public:
    using Value = std::shared_ptr<HTAuxDataType>;
    using Entry = std::pair<std::string, Value>;

    // Stores the value under the key; replacing keeps the key's position.
    void set(const std::string& key, Value value);
    // The value under the key, or null.
    Value find(const std::string& key) const;
    size_t size() const { return values_.size(); }
    bool empty() const { return values_.empty(); }
    auto begin() const { return values_.begin(); }
    auto end() const { return values_.end(); }

    bool isContainer() const override { return true; }

    // This map merged with `other` (which may be null): what may be added up
    // is added up, the rest drops out. Null when no key is left.
    std::shared_ptr<HTAuxDataMap> mergeWithData(const std::shared_ptr<HTAuxDataMap>& other) const;
    // One value merged with another of the same kind, or with nothing. Null
    // when the result holds nothing worth keeping. Only the first datum's
    // aggregate flag counts.
    static Value mergeAuxDatum(const Value& datum1, const Value& datum2);

private:
    HTOrderedMap<std::string, Value> values_;
};
