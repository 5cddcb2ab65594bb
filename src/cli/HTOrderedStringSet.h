#pragma once

#include <string>
#include <unordered_set>
#include <vector>

// A set of strings that iterates in insertion order, so that the same
// command line always resolves its operands in the same order and gives
// the same report.
class HTOrderedStringSet {
public:
    // Returns true when the string was not yet a member.
    bool add(const std::string& value)
    {
        if (!members_.insert(value).second) return false;
        order_.push_back(value);
        return true;
    }

    bool empty() const { return order_.empty(); }
    // The members in insertion order.
    const std::vector<std::string>& values() const { return order_; }

private:
    std::vector<std::string> order_;
    std::unordered_set<std::string> members_;
};
