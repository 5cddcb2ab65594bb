#pragma once

// The disposition of one page from its /proc/PID/pagemap entry and, when
// heft may read them (as root), the page's /proc/kpageflags. A pure
// function, so that every rule can be checked without the page itself.

#include <cstdint>

// pagemap entry bits.
inline constexpr uint64_t HT_PAGEMAP_PRESENT = uint64_t{1} << 63;
inline constexpr uint64_t HT_PAGEMAP_SWAPPED = uint64_t{1} << 62;
inline constexpr uint64_t HT_PAGEMAP_FILE_OR_SHARED = uint64_t{1} << 61;
inline constexpr uint64_t HT_PAGEMAP_GUARD_REGION = uint64_t{1} << 58;
inline constexpr uint64_t HT_PAGEMAP_EXCLUSIVE = uint64_t{1} << 56;
inline constexpr uint64_t HT_PAGEMAP_PFN_MASK = (uint64_t{1} << 55) - 1;

// kpageflags bits.
inline constexpr uint64_t HT_KPF_DIRTY = uint64_t{1} << 4;
inline constexpr uint64_t HT_KPF_ANON = uint64_t{1} << 12;
inline constexpr uint64_t HT_KPF_SWAPBACKED = uint64_t{1} << 14;
inline constexpr uint64_t HT_KPF_ZERO_PAGE = uint64_t{1} << 24;

// What the page's mapping is, from its smaps record.
struct HTPageMapping {
    bool sharedMemory = false;  // memfd, /dev/shm, System V, MAP_SHARED anonymous
    bool hugetlb = false;       // hugetlbfs pages: memory only, never reclaimable
    // A file on a block device, with no dirty page in the mapping: its file
    // pages are clean page cache with backing store, and its anonymous pages
    // are private copies, which MADV_FREE cannot touch in a file mapping.
    bool cleanFile = false;
    // No anonymous page here is the shared zero page or was freed with
    // MADV_FREE: each is swap-backed memory of its own, dirty.
    bool plainAnonymous = false;
    // A private mapping of a file: its anonymous pages are copies made on
    // write.
    bool privateFile = false;
};

// The frame number of a present page; 0 when the reader may not see it.
inline uint64_t htPagemapFrame(uint64_t entry)
{
    return (entry & HT_PAGEMAP_PRESENT) != 0 ? entry & HT_PAGEMAP_PFN_MASK : 0;
}

// VM_PAGE_QUERY_PAGE_* bits. `pageFlags` is the page's kpageflags entry,
// or null when it is not known (an unprivileged reader, a page without a
// frame number); the rules then rest on the pagemap and the mapping alone.
int32_t htPageDisposition(uint64_t pagemapEntry, const uint64_t* pageFlags, HTPageMapping mapping);

// Whether the page's kpageflags can change its disposition. They cannot for
// pages of shared memory and hugetlbfs, always swap-backed; for any page of
// a clean file mapping; nor for an anonymous page of a plain mapping. There
// the pagemap and the mapping already say everything, and skipping the
// flags saves a read per page or folio: frames lie scattered.
bool htPageFlagsMatter(uint64_t pagemapEntry, HTPageMapping mapping);

// The identity of a page that other processes may map as well, from its
// pagemap entry; 0 for any other page. A resident anonymous page that is
// not mapped exclusively is named by its frame, a swapped-out page (only
// where `swapShared`: some swap slot of its mapping is shared) by its swap
// slot. The shared zero page is mapped everywhere and holds nothing: the
// caller says when the page is one. Without the right to see frames and
// swap slots (they read 0), no page has an identity.
uint64_t htSharedPageIdentity(uint64_t pagemapEntry, bool swapShared, bool zeroPage);
