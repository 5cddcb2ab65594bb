#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <unordered_set>
#include <vector>

class HTProcess;

// A set of processes that map the same memory objects: one process stands
// for its private memory, several for the memory they share. A group is
// built by adding members and then frozen; a frozen group takes no more
// members and serves as a map key, by identity.
//
// Members are processes compared by pid; they iterate in the order added.
class HTProcessGroup {
public:
    using ProcessList = std::vector<std::shared_ptr<HTProcess>>;

    HTProcessGroup() = default;
    HTProcessGroup(const HTProcessGroup&) = delete;
    HTProcessGroup& operator=(const HTProcessGroup&) = delete;

    // Adds a member unless a process with its pid is one already. The group
    // must not be frozen.
    void addProcess(const std::shared_ptr<HTProcess>& process);
    void freeze() { immutable_ = true; }

    const ProcessList& processes() const { return processes_; }
    size_t count() const { return processes_.size(); }
    bool containsPid(int32_t pid) const;

private:
    bool immutable_ = false;
    ProcessList processes_;
    // Pids of the members, in the order added, for membership tests; large
    // groups also get a hash index.
    std::vector<int32_t> pids_;
    std::unique_ptr<std::unordered_set<int32_t>> pidIndex_;
};
