#pragma once

// Parsing of /proc/allocinfo, the kernel's memory allocation profile: after
// a version line and a line of column names, one line a call site that
// allocates, "bytes calls file:line [module] func:name", from version 2 on
// followed by key:value pairs. Pure functions from bytes to records.

#include <cstdint>
#include <string_view>
#include <vector>

struct HTAllocinfoSite {
    // What the site holds now; below 0 only through a kernel miscount.
    int64_t bytes = 0;
    uint64_t calls = 0;
    // These point into the parsed text; `module` is empty for the kernel's
    // own code.
    std::string_view path;
    int32_t line = 0;
    std::string_view module;
    std::string_view function;
};

// The call sites in the order of the file; lines that are not call sites
// are skipped.
std::vector<HTAllocinfoSite> htParseAllocinfo(std::string_view text);
