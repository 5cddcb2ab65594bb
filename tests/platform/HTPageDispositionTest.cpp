#include "platform/linux/HTPageDisposition.h"
#include "platform/HTPlatformTypes.h"

#include <gtest/gtest.h>

#include <tuple>
#include <vector>

namespace {

constexpr int32_t kPresent = VM_PAGE_QUERY_PAGE_PRESENT, kDirty = VM_PAGE_QUERY_PAGE_DIRTY,
                  kPagedOut = VM_PAGE_QUERY_PAGE_PAGED_OUT, kExternal = VM_PAGE_QUERY_PAGE_EXTERNAL,
                  kReusable = VM_PAGE_QUERY_PAGE_REUSABLE, kCopied = VM_PAGE_QUERY_PAGE_COPIED;

constexpr uint64_t kFrame = 0x1234;
constexpr uint64_t kPresentEntry = HT_PAGEMAP_PRESENT | kFrame;
constexpr uint64_t kFileEntry = HT_PAGEMAP_PRESENT | HT_PAGEMAP_FILE_OR_SHARED | kFrame;
// A swapped page's entry holds the swap type and offset where a frame
// number would be.
constexpr uint64_t kSwappedEntry = HT_PAGEMAP_SWAPPED | 0x5678;

constexpr HTPageMapping kPrivate{};
constexpr HTPageMapping kSharedMemory{true, false};
constexpr HTPageMapping kHugetlb{false, true};
constexpr HTPageMapping kCleanFile{false, false, true, false};
constexpr HTPageMapping kPlainAnonymous{false, false, false, true};
constexpr HTPageMapping kPrivateFile{false, false, false, false, true};

constexpr uint64_t kNoFlags = ~uint64_t{0};  // the page flags could not be read

int32_t withFlags(uint64_t entry, uint64_t flags, HTPageMapping mapping = kPrivate)
{
    return htPageDisposition(entry, flags == kNoFlags ? nullptr : &flags, mapping);
}

TEST(HTPageDisposition, FromPagemapAndPageFlags)
{
    struct Row {
        uint64_t entry, flags;
        HTPageMapping mapping;
        int32_t expected;
    };
    const Row rows[] = {
        // Swap-backed memory is dirty while present; file pages only when the kernel says so.
        {kPresentEntry, HT_KPF_ANON | HT_KPF_SWAPBACKED, kPrivate, kPresent | kDirty},
        {kFileEntry, HT_KPF_SWAPBACKED, kSharedMemory, kPresent | kDirty},
        {kFileEntry, 0, kPrivate, kPresent | kExternal},
        {kFileEntry, HT_KPF_DIRTY, kPrivate, kPresent | kExternal | kDirty},
        // Freed with MADV_FREE: anonymous without swap backing.
        {kPresentEntry, HT_KPF_ANON, kPrivate, kPresent | kReusable},
        // hugetlbfs pages: no swap-backed flag, yet neither external nor reusable.
        {kPresentEntry, HT_KPF_ANON, kHugetlb, kPresent | kDirty},
        {kFileEntry, 0, kHugetlb, kPresent | kDirty},
        // The shared zero page of a read-only touch: present, clean.
        {kPresentEntry, 0, kPrivate, kPresent},
        // From the pagemap alone. Shared memory pages carry the file bit
        // but have no file behind them.
        {0, kNoFlags, kPrivate, 0},
        {HT_PAGEMAP_PRESENT, kNoFlags, kPrivate, kPresent | kDirty},
        {kFileEntry, kNoFlags, kPrivate, kPresent | kExternal},
        {kFileEntry, kNoFlags, kSharedMemory, kPresent | kDirty},
        {kFileEntry, kNoFlags, kHugetlb, kPresent | kDirty},
        {kSwappedEntry, kNoFlags, kPrivate, kPagedOut},
        // Page flags never apply to a page that is not present.
        {kSwappedEntry, HT_KPF_ANON, kPrivate, kPagedOut},
        // A private file mapping's anonymous pages are copies made on write.
        {kPresentEntry, kNoFlags, kPrivateFile, kPresent | kDirty | kCopied},
        {kSwappedEntry, kNoFlags, kPrivateFile, kPagedOut | kCopied},
        {kFileEntry, kNoFlags, kPrivateFile, kPresent | kExternal},
        {0, kNoFlags, kPrivateFile, 0},
    };
    for (const Row& row : rows)
        EXPECT_EQ(withFlags(row.entry, row.flags, row.mapping), row.expected)
            << std::hex << row.entry << " flags " << row.flags;
    EXPECT_EQ(htPagemapFrame(kSwappedEntry), 0u);
    EXPECT_EQ(htPagemapFrame(kFileEntry), kFrame);
}

// The kpageflags a present page can have in such a mapping, as far as the
// rules look at them.
std::vector<uint64_t> possibleFlags(uint64_t entry, HTPageMapping mapping)
{
    const bool file = (entry & HT_PAGEMAP_FILE_OR_SHARED) != 0;
    if (mapping.hugetlb) return {0, HT_KPF_DIRTY, HT_KPF_ANON, HT_KPF_ANON | HT_KPF_DIRTY};
    // Neither the zero page nor freed: swap-backed anonymous memory.
    if (mapping.plainAnonymous && !file)
        return {HT_KPF_ANON | HT_KPF_SWAPBACKED, HT_KPF_ANON | HT_KPF_SWAPBACKED | HT_KPF_DIRTY};
    // Shared memory pages are always swap-backed.
    if (mapping.sharedMemory && file) return {HT_KPF_SWAPBACKED, HT_KPF_SWAPBACKED | HT_KPF_DIRTY};
    // Clean page cache; copies made on write, never freed with MADV_FREE.
    if (mapping.cleanFile)
        return file
            ? std::vector<uint64_t>{0}
            : std::vector<uint64_t>{HT_KPF_ANON | HT_KPF_SWAPBACKED, HT_KPF_ANON | HT_KPF_SWAPBACKED | HT_KPF_DIRTY};
    return {};
}

}  // namespace

TEST(HTPageDisposition, FlagsAreSkippedOnlyWhereTheyCannotMatter)
{
    // Wherever the flags are skipped, every flag combination the kernel can
    // give such a page must lead to the pagemap-only answer.
    const uint64_t entries[] = {0, kPresentEntry, kFileEntry, kSwappedEntry};
    const HTPageMapping mappings[] = {kPrivate, kSharedMemory, kHugetlb, kCleanFile, kPlainAnonymous};
    for (uint64_t entry : entries) {
        for (HTPageMapping mapping : mappings) {
            if (htPageFlagsMatter(entry, mapping)) continue;
            for (uint64_t flags : possibleFlags(entry, mapping))
                EXPECT_EQ(withFlags(entry, flags, mapping), withFlags(entry, kNoFlags, mapping))
                    << std::hex << entry << " " << flags;
        }
    }
    // File pages, anonymous pages (MADV_FREE, the zero page) and copies in
    // a private mapping of shared memory need them.
    const std::tuple<uint64_t, HTPageMapping, bool> rows[] = {
        {kFileEntry, kPrivate, true},       {kPresentEntry, kPrivate, true}, {kPresentEntry, kSharedMemory, true},
        {kFileEntry, kSharedMemory, false}, {kFileEntry, kCleanFile, false}, {kPresentEntry, kPlainAnonymous, false},
        {kFileEntry, kPlainAnonymous, true}};
    for (auto [entry, mapping, matters] : rows) EXPECT_EQ(htPageFlagsMatter(entry, mapping), matters) << entry;
}

TEST(HTPageDisposition, SharedPageIdentities)
{
    constexpr uint64_t kExclusive = HT_PAGEMAP_EXCLUSIVE;
    struct Row {
        uint64_t entry;
        bool swapShared, zeroPage, named;
    };
    const Row rows[] = {
        {kPresentEntry, false, false, true},                // resident, mapped by others too
        {kPresentEntry | kExclusive, false, false, false},  // mapped here alone
        {kFileEntry, false, false, false},                  // the file's page, not a copy
        {kPresentEntry, false, true, false},                // the zero page holds nothing
        {HT_PAGEMAP_PRESENT, false, false, false},          // frames hidden from the reader
        {kSwappedEntry, true, false, true},                 // a swap slot shared after fork
        {kSwappedEntry, false, false, false},               // no swap slot of the mapping is shared
        {kSwappedEntry | HT_PAGEMAP_GUARD_REGION, true, false, false},
        {0, true, false, false},
    };
    for (const Row& row : rows) {
        uint64_t identity = htSharedPageIdentity(row.entry, row.swapShared, row.zeroPage);
        EXPECT_EQ(identity != 0, row.named) << std::hex << row.entry;
        EXPECT_LT(identity, HTMaxPageIdentity);
    }
    // A frame and a swap slot of the same number are different pages; the
    // same frame seen from two processes is one.
    EXPECT_NE(htSharedPageIdentity(HT_PAGEMAP_PRESENT | 0x5678, false, false),
              htSharedPageIdentity(kSwappedEntry, true, false));
    EXPECT_EQ(htSharedPageIdentity(kPresentEntry, false, false), htSharedPageIdentity(kPresentEntry, true, false));
}
