#pragma once

// Parsing of /proc/modules: one line a loaded module, "name size refcount
// dependencies state address [taints]". Pure functions from bytes to
// records.

#include <cstdint>
#include <string_view>
#include <vector>

struct HTModuleLine {
    // Points into the parsed text.
    std::string_view name;
    // Bytes of the module's code and data.
    uint64_t size = 0;
};

// The modules in the order of the file; lines that are not module lines
// are skipped.
std::vector<HTModuleLine> htParseModules(std::string_view text);
