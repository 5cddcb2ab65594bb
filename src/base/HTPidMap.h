#pragma once

#include "base/HTOrderedMap.h"

#include <cstdint>

// A map keyed by pid that iterates in insertion order. Most hold a few pids
// (the processes mapping one object), which the ordered map searches in
// place; std::hash of an int32_t is the pid itself, so a large one hashes
// without mixing.
template<typename Value>
using HTPidMap = HTOrderedMap<int32_t, Value>;
