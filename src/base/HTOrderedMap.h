#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <unordered_map>
#include <utility>
#include <vector>

// A map that iterates in the order its keys were first set, so that the same
// input always gives the same report byte for byte. Replacing the value of a
// present key keeps the key's position; erasing is O(n) and rare.
//
// Most of heft's maps hold a handful of keys (the processes mapping one
// object, the rows of a small table), so a map of up to kLinearSize keys is
// searched in place and only a larger one gets a hash index. `Hash` and
// `KeyEqual` may be transparent, so that a key can be looked up by a view of
// it (a std::string_view for a std::string key) without a copy.
template<typename Key, typename Value, typename Hash = std::hash<Key>, typename KeyEqual = std::equal_to<Key>>
class HTOrderedMap {
public:
    using Entry = std::pair<Key, Value>;
    using const_iterator = typename std::vector<Entry>::const_iterator;

    static constexpr size_t kLinearSize = 8;

    // Inserts or replaces; returns true when the key was new.
    template<typename K>
    bool set(K&& key, Value value)
    {
        const size_t at = positionOf(key);
        if (at != kAbsent) {
            entries_[at].second = std::move(value);
            return false;
        }
        add(Key(std::forward<K>(key)), std::move(value));
        return true;
    }

    // Appends a key that the caller knows is not present, without looking.
    void add(Key key, Value value)
    {
        entries_.emplace_back(std::move(key), std::move(value));
        if (!index_.empty())
            index_.emplace(entries_.back().first, entries_.size() - 1);
        else if (entries_.size() > kLinearSize)
            rebuildIndex();
    }

    template<typename K>
    bool contains(const K& key) const
    {
        return positionOf(key) != kAbsent;
    }

    // The value under the key, or null.
    template<typename K>
    const Value* find(const K& key) const
    {
        const size_t at = positionOf(key);
        return at == kAbsent ? nullptr : &entries_[at].second;
    }

    template<typename K>
    Value* find(const K& key)
    {
        const size_t at = positionOf(key);
        return at == kAbsent ? nullptr : &entries_[at].second;
    }

    template<typename K>
    bool erase(const K& key)
    {
        const size_t at = positionOf(key);
        if (at == kAbsent) return false;
        entries_.erase(entries_.begin() + static_cast<std::ptrdiff_t>(at));
        rebuildIndex();
        return true;
    }

    std::vector<Key> keys() const
    {
        std::vector<Key> result;
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

    const_iterator begin() const { return entries_.begin(); }
    const_iterator end() const { return entries_.end(); }

private:
    static constexpr size_t kAbsent = SIZE_MAX;

    template<typename K>
    size_t positionOf(const K& key) const
    {
        if (index_.empty()) {
            const KeyEqual equal;
            for (size_t i = 0; i < entries_.size(); ++i)
                if (equal(entries_[i].first, key)) return i;
            return kAbsent;
        }
        auto found = index_.find(key);
        return found == index_.end() ? kAbsent : found->second;
    }

    void rebuildIndex()
    {
        index_.clear();
        if (entries_.size() <= kLinearSize) return;
        for (size_t i = 0; i < entries_.size(); ++i) index_.emplace(entries_[i].first, i);
    }

    std::vector<Entry> entries_;
    // Empty while the map holds kLinearSize keys or fewer.
    std::unordered_map<Key, size_t, Hash, KeyEqual> index_;
};
