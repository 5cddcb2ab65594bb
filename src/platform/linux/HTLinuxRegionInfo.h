#pragma once

// The region records of the address-space walk, built from a parsed smaps
// mapping. Pure functions: the walk calls them for a live process, tests
// for captured text.

#include "platform/HTPlatformTypes.h"
#include "platform/linux/HTSmapsParser.h"

#include <cstdint>

// The VM tag of a mapping (HT_VM_TAG_*, HTPlatformTypes.h).
uint32_t htRegionTag(const HTSmapsEntry& entry);

// The identity of the VM object behind a mapping, never 0 nor all ones.
// Files and shared memory are named by (device, inode) with the top bit
// set, so every process that maps one names the same object; private
// anonymous memory by (pid, start) with the top bits 01, one object a
// mapping.
uint64_t htRegionObjectId(const HTSmapsEntry& entry, int32_t pid);
// The object id of the file (or shared-memory object) with that device and
// inode, as the mappings of it are given.
uint64_t htFileObjectId(uint32_t devMajor, uint32_t devMinor, uint64_t inode);

// The full record of the walk. Page counts are in units of pageSize.
vm_region_submap_info_64 htSubmapInfo(const HTSmapsEntry& entry, int32_t pid, uint64_t pageSize);

// The top-level record of the same mapping.
vm_region_basic_info_64 htBasicInfo(const HTSmapsEntry& entry);
