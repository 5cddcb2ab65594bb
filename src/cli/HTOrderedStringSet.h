#pragma once

#include <algorithm>
#include <string>
#include <unordered_set>
#include <vector>

// A set of strings that iterates in insertion order, so that the same
// command line always resolves its operands in the same order and gives
// the same report. Removal is O(n); sets here hold a few operands.
class HTOrderedStringSet {
public:
    HTOrderedStringSet() = default;
    HTOrderedStringSet(std::initializer_list<std::string> values)
    {
        for (const auto& value : values) add(value);
    }

    // Returns true when the string was not yet a member.
    bool add(const std::string& value)
    {
        if (!members_.insert(value).second) return false;
        order_.push_back(value);
        return true;
    }

    bool remove(const std::string& value)
    {
        if (members_.erase(value) == 0) return false;
        order_.erase(std::find(order_.begin(), order_.end(), value));
        return true;
    }

    bool contains(const std::string& value) const { return members_.count(value) != 0; }
    size_t size() const { return order_.size(); }
    bool empty() const { return order_.empty(); }
    void clear()
    {
        order_.clear();
        members_.clear();
    }

    // The members in insertion order.
    const std::vector<std::string>& values() const { return order_; }
    std::vector<std::string>::const_iterator begin() const { return order_.begin(); }
    std::vector<std::string>::const_iterator end() const { return order_.end(); }

    bool operator==(const HTOrderedStringSet& other) const { return order_ == other.order_; }

private:
    std::vector<std::string> order_;
    std::unordered_set<std::string> members_;
};
