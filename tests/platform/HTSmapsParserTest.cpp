#include "platform/linux/HTSmapsParser.h"
#include "output/HTExpectedReport.h"
#include "platform/linux/HTLinuxRegionInfo.h"
#include "platform/linux/HTProcBuffer.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <fcntl.h>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;
constexpr uint64_t kKiB = 1024;

// start-end, protection and sharing, offset, device, inode,
// KernelPageSize/Rss/Shared_Clean in KiB, VmFlags bits, path.
std::string describe(const HTSmapsEntry& e)
{
    char text[160];
    std::snprintf(text, sizeof(text),
                  "%" PRIx64 "-%" PRIx64 " %u%c %" PRIx64 " %x:%x %" PRIu64 " %" PRIu64 "/%" PRIu64 "/%" PRIu64
                  " %x %s",
                  e.start, e.end, e.protection, e.shared ? 's' : 'p', e.offset, e.devMajor, e.devMinor, e.inode,
                  e.kernelPageSize / kKiB, e.rss / kKiB, e.sharedClean / kKiB, e.vmFlags, e.path.c_str());
    return text;
}

// The walk's region record of a mapping, then its basic record.
std::string describeRecord(const HTSmapsEntry& e)
{
    const vm_region_submap_info_64 i = htSubmapInfo(e, 4242, kPage);
    const vm_region_basic_info_64 b = htBasicInfo(e);
    char text[200];
    std::snprintf(text, sizeof(text),
                  "tag %u sm %u inh %u ext %u prot %u/%u off %" PRIx64 " pages %u/%u/%u/%u/%u ref %u wired %u | "
                  "shared %u inh %u prot %u/%u wired %u",
                  i.user_tag, i.share_mode, i.inheritance, i.external_pager, i.protection, i.max_protection, i.offset,
                  i.pages_resident, i.pages_dirtied, i.pages_shared_now_private, i.pages_reusable, i.pages_swapped_out,
                  i.ref_count, i.user_wired_count, b.shared, b.inheritance, b.protection, b.max_protection,
                  b.user_wired_count);
    return text;
}

}  // namespace

TEST(HTSmapsParser, EveryKindOfMappingItsRecordsAndIdentities)
{
    // Captured on Linux 6.18 (two named anonymous mappings written in the kernel's format), in order: the
    // program, its heap, a huge page of anonymous memory, MADV_DONTFORK, MADV_FREE and mlocked memory, a private
    // file mapping with a page copied on write and the same file shared, System V, POSIX, memfd and MAP_SHARED
    // anonymous memory, named anonymous memory private and shared, libc, a guard page, vvar, vdso, the stack,
    // vsyscall, then hugetlbfs shared and private from another process, out of address order.
    HTProcBuffer file;
    ASSERT_TRUE(file.readFile(AT_FDCWD, HEFT_TEST_DATA_DIR "/smaps-every-kind.txt"));
    std::vector<HTSmapsEntry> entries;
    EXPECT_EQ(htParseSmaps(file.view(), entries), 22u);
    ASSERT_EQ(entries.size(), 22u);
    EXPECT_TRUE(std::is_sorted(entries.begin(), entries.end(),
                               [](const HTSmapsEntry& a, const HTSmapsEntry& b) { return a.start < b.start; }));
    std::string report;
    for (const HTSmapsEntry& entry : entries) report += describe(entry) + "\n    " + describeRecord(entry) + "\n";
    expectReport("smaps-every-kind-records.txt", report);

    const HTSmapsEntry &heap = entries[1], &privateFile = entries[8];
    // Files and shared memory are named by (device, inode), top bit set: the same in every process and mapping.
    // Private anonymous memory is the process's own (top bits 01), one object a mapping.
    for (size_t shared : {8, 9, 10, 15}) {
        EXPECT_EQ(htRegionObjectId(entries[shared], 200), htRegionObjectId(entries[shared], 100)) << shared;
        EXPECT_EQ(htRegionObjectId(entries[shared], 100) >> 63, 1u) << shared;
    }
    EXPECT_EQ(htRegionObjectId(entries[9], 100), htRegionObjectId(privateFile, 100));
    EXPECT_NE(htRegionObjectId(heap, 100), htRegionObjectId(heap, 200));
    EXPECT_EQ(htRegionObjectId(heap, 100) >> 62, 1u);

    // All distinct (the two mappings of one file aside), never 0 nor all ones; the 32-bit id is the low half.
    std::set<uint64_t> ids;
    for (const HTSmapsEntry& entry : entries) {
        vm_region_submap_info_64 info = htSubmapInfo(entry, 100, kPage);
        EXPECT_NE(info.object_id_full, 0u);
        EXPECT_NE(info.object_id_full, ~uint64_t{0});
        EXPECT_EQ(info.object_id, static_cast<uint32_t>(info.object_id_full));
        EXPECT_EQ(info.object_id_full, htRegionObjectId(entry, 100));
        ids.insert(info.object_id_full);
    }
    EXPECT_EQ(ids.size(), entries.size() - 1);
    // Neighbouring inodes and starts give unrelated identities.
    HTSmapsEntry nextInode = privateFile, nextStart = heap;
    nextInode.inode += 1;
    nextStart.start += kPage;
    EXPECT_NE(htRegionObjectId(nextInode, 1), htRegionObjectId(privateFile, 1));
    EXPECT_NE(htRegionObjectId(nextStart, 100), htRegionObjectId(heap, 100));

    // A second, shorter text, cut short without a final line feed: no record of the first survives.
    ASSERT_TRUE(file.readFile(AT_FDCWD, HEFT_TEST_DATA_DIR "/smaps-unreadable-lines.txt"));
    const std::string_view text = file.view().substr(0, file.size() - 1);
    ASSERT_EQ(htParseSmaps(text, entries), 1u);
    ASSERT_EQ(entries.size(), 1u);
    EXPECT_EQ(describe(entries[0]), "1000-3000 3s 2000 0:1 7 0/8/0 1f /memfd:x (deleted)");
    EXPECT_EQ(entries[0].swap, 0u);
    EXPECT_EQ(entries[0].privateDirty, 4 * kKiB);
    EXPECT_EQ(entries[0].kind, HTSmapsKind::SharedMemory);
    EXPECT_EQ(htParseSmaps("", entries), 0u);
    EXPECT_TRUE(entries.empty());
}
