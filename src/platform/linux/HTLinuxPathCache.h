#pragma once

// Resolved paths, for the whole run: every process maps the same libraries,
// and resolving one path reads every link on the way. Safe on any thread.

#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>

class HTLinuxPathCache {
public:
    // The path with symbolic links resolved; nullopt when it cannot be.
    std::optional<std::string> realpath(const std::string& path);

private:
    std::mutex lock_;
    std::unordered_map<std::string, std::optional<std::string>> paths_;
};
