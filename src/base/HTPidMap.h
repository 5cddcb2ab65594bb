#pragma once

#include <cstddef>
#include <cstdint>
#include <unordered_map>
#include <utility>
#include <vector>

// A map keyed by pid that iterates in insertion order, so that the same
// input always gives the same report. Replacing the value of a present key
// keeps the key's original position; erasing is O(n) and rare. Most maps
// hold a few pids (the processes mapping one object), so a small map is
// searched in place and only a larger one gets a hash index.
template<typename Value>
class HTPidMap {
public:
    using Entry = std::pair<int32_t, Value>;

    // Inserts or replaces; returns true when the key was new.
    bool set(int32_t pid, Value value)
    {
        const size_t at = positionOf(pid);
        if (at != kAbsent) {
            entries_[at].second = std::move(value);
            return false;
        }
        entries_.emplace_back(pid, std::move(value));
        if (!index_.empty())
            index_.emplace(pid, entries_.size() - 1);
        else if (entries_.size() > kLinearSize)
            rebuildIndex();
        return true;
    }

    bool contains(int32_t pid) const { return positionOf(pid) != kAbsent; }

    const Value* find(int32_t pid) const
    {
        const size_t at = positionOf(pid);
        return at == kAbsent ? nullptr : &entries_[at].second;
    }

    Value* find(int32_t pid)
    {
        const size_t at = positionOf(pid);
        return at == kAbsent ? nullptr : &entries_[at].second;
    }

    bool erase(int32_t pid)
    {
        const size_t at = positionOf(pid);
        if (at == kAbsent) return false;
        entries_.erase(entries_.begin() + static_cast<std::ptrdiff_t>(at));
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
    void clear()
    {
        entries_.clear();
        index_.clear();
    }

    typename std::vector<Entry>::const_iterator begin() const { return entries_.begin(); }
    typename std::vector<Entry>::const_iterator end() const { return entries_.end(); }

private:
    static constexpr size_t kLinearSize = 8;
    static constexpr size_t kAbsent = SIZE_MAX;

    size_t positionOf(int32_t pid) const
    {
        if (index_.empty()) {
            for (size_t i = 0; i < entries_.size(); ++i)
                if (entries_[i].first == pid) return i;
            return kAbsent;
        }
        auto found = index_.find(pid);
        return found == index_.end() ? kAbsent : found->second;
    }

    void rebuildIndex()
    {
        index_.clear();
        if (entries_.size() <= kLinearSize) return;
        for (size_t i = 0; i < entries_.size(); ++i) index_.emplace(entries_[i].first, i);
    }

    std::vector<Entry> entries_;
    // Empty while the map holds kLinearSize pids or fewer.
    std::unordered_map<int32_t, size_t> index_;
};
