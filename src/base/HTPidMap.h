#pragma once

#include <cstddef>
#include <cstdint>
#include <unordered_map>
#include <utility>
#include <vector>

// A map keyed by pid that iterates in insertion order, so that the same
// input always gives the same report. Replacing the value of a present key
// keeps the key's original position; erasing is O(n) and rare.
template <typename Value>
class HTPidMap {
public:
    using Entry = std::pair<int32_t, Value>;

    // Inserts or replaces; returns true when the key was new.
    bool set(int32_t pid, Value value)
    {
        auto found = index_.find(pid);
        if (found != index_.end()) {
            entries_[found->second].second = std::move(value);
            return false;
        }
        index_.emplace(pid, entries_.size());
        entries_.emplace_back(pid, std::move(value));
        return true;
    }

    bool contains(int32_t pid) const { return index_.count(pid) != 0; }

    const Value* find(int32_t pid) const
    {
        auto found = index_.find(pid);
        return found == index_.end() ? nullptr : &entries_[found->second].second;
    }

    Value* find(int32_t pid)
    {
        auto found = index_.find(pid);
        return found == index_.end() ? nullptr : &entries_[found->second].second;
    }

    bool erase(int32_t pid)
    {
        auto found = index_.find(pid);
        if (found == index_.end()) return false;
        entries_.erase(entries_.begin() + static_cast<std::ptrdiff_t>(found->second));
        rebuildIndex();
        return true;
    }

    std::vector<int32_t> keys() const
    {
        std::vector<int32_t> result;
        result.reserve(entries_.size());
        for (const auto& entry : entries_) result.push_back(entry.first);
        return result;
    }

    size_t size() const { return entries_.size(); }
    bool empty() const { return entries_.empty(); }
    void clear() { entries_.clear(); index_.clear(); }

    typename std::vector<Entry>::const_iterator begin() const { return entries_.begin(); }
    typename std::vector<Entry>::const_iterator end() const { return entries_.end(); }

private:
    void rebuildIndex()
    {
        index_.clear();
        for (size_t i = 0; i < entries_.size(); ++i) index_.emplace(entries_[i].first, i);
    }

    std::vector<Entry> entries_;
    std::unordered_map<int32_t, size_t> index_;
};
