#include "platform/linux/HTProcArgs.h"

#include <algorithm>
#include <cstdint>
#include <cstring>

int32_t htArgumentCount(std::string_view cmdline)
{
    if (cmdline.empty()) return 0;
    auto count = static_cast<int32_t>(std::count(cmdline.begin(), cmdline.end(), '\0'));
    if (cmdline.back() != '\0') ++count;
    return count;
}

size_t htProcArgsHeaderSize(std::string_view executablePath)
{
    size_t used = sizeof(int32_t) + executablePath.size() + 1;
    return (used + 7) & ~size_t(7);
}

size_t htBuildProcArgs(std::string_view executablePath, std::string_view cmdline, char* out, size_t capacity)
{
    size_t header = htProcArgsHeaderSize(executablePath);
    bool terminated = cmdline.empty() || cmdline.back() == '\0';
    size_t total = header + cmdline.size() + (terminated ? 0 : 1);
    if (out == nullptr || capacity == 0) return total;

    // Assemble piece by piece, each piece clipped to what is left.
    size_t at = 0;
    auto put = [&](const void* bytes, size_t length) {
        size_t count = std::min(length, capacity - at);
        std::memcpy(out + at, bytes, count);
        at += count;
    };
    auto pad = [&](size_t length) {
        size_t count = std::min(length, capacity - at);
        std::memset(out + at, 0, count);
        at += count;
    };
    int32_t argc = htArgumentCount(cmdline);
    put(&argc, sizeof(argc));
    put(executablePath.data(), executablePath.size());
    pad(header - sizeof(argc) - executablePath.size());
    put(cmdline.data(), cmdline.size());
    if (!terminated) pad(1);
    return total;
}
