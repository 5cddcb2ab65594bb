#pragma once

#include <cstdint>
#include <optional>

// Asks the kernel, through the pagemap's scan request, for the first page
// in [start, end) that is resident or swapped out. The kernel walks its page
// tables and steps over empty stretches whole, so a terabyte-sized sparse
// reservation costs what its populated pages cost, not one entry per page.
// Returns `end` when no such page exists, and nullopt when the kernel does
// not offer the request (kernels before 6.7) or it fails.
std::optional<uint64_t> htPagemapFirstPopulated(int pagemapFd, uint64_t start, uint64_t end);
