#pragma once

// Parsing of /proc/meminfo: one "Name:   value [kB]" line a figure. Pure
// functions from bytes to records.

#include <cstdint>
#include <string_view>
#include <vector>

struct HTMeminfoField {
    // Points into the parsed text.
    std::string_view name;
    // Bytes for the figures given in kB; the plain number for the counts
    // (HugePages_Total and the like).
    uint64_t value = 0;
};

// The figures in the order of the file; lines that are not "name: number"
// are skipped.
std::vector<HTMeminfoField> htParseMeminfo(std::string_view text);

// The figure called `name`, or nullptr.
const HTMeminfoField* htFindMeminfoField(const std::vector<HTMeminfoField>& fields, std::string_view name);
