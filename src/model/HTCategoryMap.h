#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

class HTMemoryCategory;

// Categories of one table under their keys (a short or a full name). Keys
// iterate in the order they were first added, so that the same input gives
// the same report byte for byte. Most tables have a handful of rows, so a
// small map is searched in place and only a larger one gets a hash index.
class HTCategoryMap {
public:
    using Entry = std::pair<std::string, std::shared_ptr<HTMemoryCategory>>;

    // The category under the key, or null.
    HTMemoryCategory* find(std::string_view key) const
    {
        if (index_.empty()) {
            for (const auto& entry : entries_)
                if (entry.first == key) return entry.second.get();
            return nullptr;
        }
        auto found = index_.find(key);
        return found == index_.end() ? nullptr : entries_[found->second].second.get();
    }

    // Stores a category under a key that is not yet present.
    void add(std::string key, std::shared_ptr<HTMemoryCategory> category)
    {
        entries_.emplace_back(std::move(key), std::move(category));
        if (!index_.empty()) {
            index_.emplace(entries_.back().first, entries_.size() - 1);
        } else if (entries_.size() > kLinearSize) {
            for (size_t i = 0; i < entries_.size(); ++i) index_.emplace(entries_[i].first, i);
        }
    }

    size_t size() const { return entries_.size(); }
    bool empty() const { return entries_.empty(); }
    std::vector<Entry>::const_iterator begin() const { return entries_.begin(); }
    std::vector<Entry>::const_iterator end() const { return entries_.end(); }

private:
    // Looks keys up by view, so that finding one needs no string of its own.
    struct KeyHash {
        using is_transparent = void;
        size_t operator()(std::string_view key) const { return std::hash<std::string_view>{}(key); }
    };

    static constexpr size_t kLinearSize = 8;

    std::vector<Entry> entries_;
    // Empty while the map holds kLinearSize keys or fewer.
    std::unordered_map<std::string, size_t, KeyHash, std::equal_to<>> index_;
};
