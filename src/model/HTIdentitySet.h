#pragma once

#include "base/HTPointerIndex.h"

#include <cstddef>
#include <memory>
#include <utility>
#include <vector>

// A set of shared objects compared by identity (the same instance), which
// iterates in the order the objects were first inserted so that the same
// input always gives the same report. Used for the region sets of memory
// objects and categories and for the member objects of categories.
//
// Not for concurrent use, even to read: a look-up may bring the index up to
// date.
template<typename T>
class HTIdentitySet {
public:
    using const_iterator = typename std::vector<std::shared_ptr<T>>::const_iterator;

    // Adds the object unless this very instance is already present; returns
    // true when it was added.
    bool insert(std::shared_ptr<T> item)
    {
        if (contains(item.get())) return false;
        append(std::move(item));
        return true;
    }

    // Adds an object that the caller knows is not present, without looking:
    // routing adds tens of thousands of regions, each to one object once.
    void append(std::shared_ptr<T> item) { items_.push_back(std::move(item)); }

    void unite(const HTIdentitySet& other)
    {
        for (const auto& item : other) insert(item);
    }

    bool contains(const T* item) const
    {
        if (items_.size() <= kLinearSize) {
            for (const auto& present : items_)
                if (present.get() == item) return true;
            return false;
        }
        // The index learns of the objects added since it was last asked.
        for (; indexed_ < items_.size(); ++indexed_) index_.insert(items_[indexed_].get());
        return index_.contains(item);
    }
    size_t size() const { return items_.size(); }
    bool empty() const { return items_.empty(); }
    // The first object inserted; the set must not be empty.
    const std::shared_ptr<T>& front() const { return items_.front(); }
    const_iterator begin() const { return items_.begin(); }
    const_iterator end() const { return items_.end(); }

private:
    static constexpr size_t kLinearSize = 16;

    std::vector<std::shared_ptr<T>> items_;
    // The first indexed_ items, once the set has outgrown kLinearSize and
    // been searched.
    mutable HTPointerIndex index_;
    mutable size_t indexed_ = 0;
};
