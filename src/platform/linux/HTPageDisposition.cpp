#include "platform/linux/HTPageDisposition.h"

#include "platform/HTPlatformTypes.h"

int32_t htPageDisposition(uint64_t pagemapEntry, const uint64_t* pageFlags, HTPageMapping mapping)
{
    bool present = (pagemapEntry & HT_PAGEMAP_PRESENT) != 0;
    bool fileOrShared = (pagemapEntry & HT_PAGEMAP_FILE_OR_SHARED) != 0;
    int32_t disposition = 0;
    if (present) disposition |= VM_PAGE_QUERY_PAGE_PRESENT;
    if ((pagemapEntry & HT_PAGEMAP_SWAPPED) != 0) disposition |= VM_PAGE_QUERY_PAGE_PAGED_OUT;
    // Only anonymous pages are ever swapped out or copied on write.
    if (mapping.privateFile && !fileOrShared && disposition != 0) disposition |= VM_PAGE_QUERY_PAGE_COPIED;

    if (pageFlags != nullptr && present) {
        // hugetlbfs pages are never marked swap-backed, yet they have no
        // backing store either: they count as swap-backed memory.
        bool swapBacked = (*pageFlags & HT_KPF_SWAPBACKED) != 0 || mapping.hugetlb;
        if (fileOrShared && !swapBacked) disposition |= VM_PAGE_QUERY_PAGE_EXTERNAL;
        if ((*pageFlags & HT_KPF_DIRTY) != 0 || swapBacked) disposition |= VM_PAGE_QUERY_PAGE_DIRTY;
        // An anonymous page that lost its swap backing was freed with
        // MADV_FREE: the kernel may take it back.
        if ((*pageFlags & HT_KPF_ANON) != 0 && !swapBacked) disposition |= VM_PAGE_QUERY_PAGE_REUSABLE;
        return disposition;
    }

    bool external = fileOrShared && !mapping.sharedMemory && !mapping.hugetlb;
    if (external) disposition |= VM_PAGE_QUERY_PAGE_EXTERNAL;
    if (present && !external) disposition |= VM_PAGE_QUERY_PAGE_DIRTY;
    return disposition;
}

bool htPageFlagsMatter(uint64_t pagemapEntry, HTPageMapping mapping)
{
    if ((pagemapEntry & HT_PAGEMAP_PRESENT) == 0 || mapping.hugetlb || mapping.cleanFile) return false;
    // Anonymous pages: the flags tell the zero page and freed pages from
    // the rest.
    if ((pagemapEntry & HT_PAGEMAP_FILE_OR_SHARED) == 0) return !mapping.plainAnonymous;
    // Shared memory is swap-backed; a file's pages may be dirty, or on tmpfs.
    return !mapping.sharedMemory;
}

uint64_t htSharedPageIdentity(uint64_t pagemapEntry, bool swapShared, bool zeroPage)
{
    // Frames and swap slots live in separate halves of the identity space.
    constexpr uint64_t kFrame = uint64_t{1} << 56;
    constexpr uint64_t kSwapSlot = uint64_t{1} << 57;
    const uint64_t value = pagemapEntry & HT_PAGEMAP_PFN_MASK;
    if (value == 0) return 0;
    if ((pagemapEntry & HT_PAGEMAP_PRESENT) != 0) {
        if ((pagemapEntry & (HT_PAGEMAP_FILE_OR_SHARED | HT_PAGEMAP_EXCLUSIVE)) != 0 || zeroPage) return 0;
        return kFrame | value;
    }
    // Guard markers look like swap entries but hold no page.
    if ((pagemapEntry & HT_PAGEMAP_SWAPPED) == 0 || (pagemapEntry & HT_PAGEMAP_GUARD_REGION) != 0 || !swapShared)
        return 0;
    return kSwapSlot | value;
}
