#include "platform/linux/HTLinuxPathCache.h"

#include <cstdlib>

std::optional<std::string> HTLinuxPathCache::realpath(const std::string& path)
{
    {
        std::lock_guard<std::mutex> guard(lock_);
        auto found = paths_.find(path);
        if (found != paths_.end()) return found->second;
    }
    std::optional<std::string> result;
    if (char* resolved = ::realpath(path.c_str(), nullptr)) {
        result = resolved;
        std::free(resolved);
    }
    std::lock_guard<std::mutex> guard(lock_);
    paths_.emplace(path, result);
    return result;
}
