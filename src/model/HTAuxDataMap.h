#pragma once

#include "model/HTAuxDataType.h"

#include <cstddef>
#include <memory>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

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
    size_t size() const { return entries_.size(); }
    bool empty() const { return entries_.empty(); }
    std::vector<Entry>::const_iterator begin() const { return entries_.begin(); }
    std::vector<Entry>::const_iterator end() const { return entries_.end(); }

    bool isContainer() const override { return true; }

    // This map merged with `other` (which may be null): what may be added up
    // is added up, the rest drops out. Null when no key is left.
    std::shared_ptr<HTAuxDataMap> mergeWithData(const std::shared_ptr<HTAuxDataMap>& other) const;
    // One value merged with another of the same kind, or with nothing. Null
    // when the result holds nothing worth keeping. Only the first datum's
    // aggregate flag counts.
    static Value mergeAuxDatum(const Value& datum1, const Value& datum2);

private:
    std::vector<Entry> entries_;
    std::unordered_map<std::string, size_t> index_;
};
