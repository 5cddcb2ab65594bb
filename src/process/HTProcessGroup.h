#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <unordered_set>
#include <vector>

class HTProcess;

// A set of processes that map the same memory objects: one process stands
// for its private memory, several for the memory they share. A group is
// built open, by adding members, and then frozen; a frozen group takes no
// more members and serves as a map key, compared by identity. An open group
// is compared by its members, which is how the sharing analysis finds the
// frozen representative of a set.
//
// Members are processes compared by pid; they iterate in the order added.
class HTProcessGroup {
public:
    using ProcessList = std::vector<std::shared_ptr<HTProcess>>;

    HTProcessGroup() = default;
    HTProcessGroup(const HTProcessGroup&) = delete;
    HTProcessGroup& operator=(const HTProcessGroup&) = delete;

    // Adds a member unless a process with its pid is one already. The group
    // must be open.
    void addProcess(const std::shared_ptr<HTProcess>& process);
    void freeze() { immutable_ = true; }

    // Depends on the members and the order they arrived in: sets built by
    // adding processes in one global order hash alike.
    uint64_t hash() const { return hashValue_; }
    // Against a frozen group: the same instance (this group must then be
    // frozen too). Against an open group: the same members.
    bool isEqual(const HTProcessGroup& other) const;
    // A frozen group is its own copy.
    static std::shared_ptr<HTProcessGroup> copy(const std::shared_ptr<HTProcessGroup>& group);

    // "HTProcessGroup{HTProcess[10], HTProcess[20]}".
    std::string description() const;

    const ProcessList& processes() const { return processes_; }
    size_t count() const { return processes_.size(); }
    bool containsPid(int32_t pid) const;
    bool immutable() const { return immutable_; }
    uint64_t hashValue() const { return hashValue_; }

private:
    bool immutable_ = false;
    ProcessList processes_;
    uint64_t hashValue_ = 19;
    // Pids of the members, in the order added, for membership tests; large
    // groups also get a hash index.
    std::vector<int32_t> pids_;
    std::unique_ptr<std::unordered_set<int32_t>> pidIndex_;
};
