#pragma once

#include <cstddef>
#include <memory>
#include <unordered_set>
#include <utility>
#include <vector>

// A set of shared objects compared by identity (the same instance), which
// iterates in the order the objects were first inserted so that the same
// input always gives the same report. Used for the region sets of memory
// objects and categories and for the member objects of categories.
template <typename T>
class HTIdentitySet {
public:
    using const_iterator = typename std::vector<std::shared_ptr<T>>::const_iterator;

    // Adds the object unless this very instance is already present; returns
    // true when it was added.
    bool insert(std::shared_ptr<T> item)
    {
        if (index_.empty() && items_.size() < kLinearSize) {
            if (contains(item.get())) return false;
        } else {
            if (index_.empty()) {
                for (const auto& present : items_) index_.insert(present.get());
            }
            if (!index_.insert(item.get()).second) return false;
        }
        items_.push_back(std::move(item));
        return true;
    }

    void unite(const HTIdentitySet& other)
    {
        for (const auto& item : other) insert(item);
    }

    bool contains(const T* item) const
    {
        if (!index_.empty()) return index_.count(item) != 0;
        for (const auto& present : items_)
            if (present.get() == item) return true;
        return false;
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
    // Empty until the set outgrows kLinearSize.
    std::unordered_set<const T*> index_;
};
