#pragma once

// Parsing of /proc/vmallocinfo: one line an area of the kernel's virtual
// memory, "start-end size caller [pages=N] [phys=...] kinds...". Only areas
// that own pages hold memory of their own (ioremap and vmap areas map
// memory owned elsewhere). Pure functions from bytes to records.

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

struct HTVmallocCaller {
    // The function that allocated, as "name" or "name [module]"; the bare
    // address when the kernel has no symbol for it; empty when the area
    // names no caller.
    std::string function;
    uint64_t pages = 0;
};

// The pages of the areas that own pages, summed by calling function (all
// the call sites in one function count together), in the order the
// functions first appear.
std::vector<HTVmallocCaller> htParseVmallocinfo(std::string_view text);
