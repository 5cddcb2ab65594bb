#pragma once

#include "base/HTOrderedMap.h"

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

class HTMemoryCategory;

// Categories of one table under their keys (a short or a full name). Keys
// iterate in the order they were first added, so that the same input gives
// the same report byte for byte.
class HTCategoryMap {
public:
    using Entry = std::pair<std::string, std::shared_ptr<HTMemoryCategory>>;

    // The category under the key, or null.
    HTMemoryCategory* find(std::string_view key) const
    {
        const std::shared_ptr<HTMemoryCategory>* found = categories_.find(key);
        return found ? found->get() : nullptr;
    }

    // Stores a category under a key that is not yet present.
    void add(std::string key, std::shared_ptr<HTMemoryCategory> category)
    {
        categories_.add(std::move(key), std::move(category));
    }

    size_t size() const { return categories_.size(); }
    bool empty() const { return categories_.empty(); }
    auto begin() const { return categories_.begin(); }
    auto end() const { return categories_.end(); }

private:
    // Looks keys up by view, so that finding one needs no string of its own.
    struct KeyHash {
        using is_transparent = void;
        size_t operator()(std::string_view key) const { return std::hash<std::string_view>{}(key); }
    };

    HTOrderedMap<std::string, std::shared_ptr<HTMemoryCategory>, KeyHash, std::equal_to<>> categories_;
};
