#pragma once

#include <cstdint>

// A 64-bit finaliser that spreads every input bit over the whole result, so
// that neighbouring inodes, addresses or numbers give unrelated identities
// and hash keys.
inline uint64_t htMix(uint64_t value)
{
    value ^= value >> 30;
    value *= 0xbf58476d1ce4e5b9ULL;
    value ^= value >> 27;
    value *= 0x94d049bb133111ebULL;
    value ^= value >> 31;
    return value;
}
