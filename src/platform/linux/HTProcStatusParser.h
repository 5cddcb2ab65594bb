#pragma once

// Parsing of the memory figures of /proc/PID/status ("Name:\tvalue kB"
// lines). A pure function from bytes to a record.

#include <cstdint>
#include <optional>
#include <string_view>

// Sizes in bytes. A process without an address space (a zombie, a kernel
// thread) has none of these lines: the fields are then absent.
struct HTProcStatus {
    std::optional<uint64_t> rssAnon;
    std::optional<uint64_t> vmSwap;
    std::optional<uint64_t> vmPTE;
    std::optional<uint64_t> vmHWM;

    bool hasMemoryFigures() const { return rssAnon && vmSwap && vmPTE && vmHWM; }
};

HTProcStatus htParseProcStatus(std::string_view text);
