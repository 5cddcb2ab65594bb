#include "platform/linux/HTSmapsParser.h"
#include "platform/linux/HTDeletedMark.h"
#include "platform/linux/HTLinuxRegionInfo.h"
#include "platform/linux/HTProcBuffer.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <fcntl.h>
#include <set>
#include <string_view>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;
constexpr uint64_t kKiB = 1024;

// Mappings captured from two real processes on x86-64 Linux 6.18: a probe
// that laid out one mapping of every kind (the hugetlbfs ones come from a
// second process, which puts them out of address order), plus two mappings
// named with prctl(PR_SET_VMA_ANON_NAME) written in the kernel's format,
// since the capturing kernel was built without named anonymous memory.
std::vector<HTSmapsEntry> parsedCapture()
{
    HTProcBuffer file;
    EXPECT_TRUE(file.readFile(AT_FDCWD, HEFT_TEST_DATA_DIR "/smaps-every-kind.txt"));
    std::vector<HTSmapsEntry> entries;
    EXPECT_EQ(htParseSmaps(file.view(), entries), 22u);
    EXPECT_EQ(entries.size(), 22u);
    return entries;
}

const HTSmapsEntry& at(const std::vector<HTSmapsEntry>& entries, uint64_t start)
{
    auto found = std::find_if(entries.begin(), entries.end(), [&](const HTSmapsEntry& e) { return e.start == start; });
    if (found == entries.end()) {
        ADD_FAILURE() << std::hex << "no mapping at 0x" << start;
        static const HTSmapsEntry none;
        return none;
    }
    return *found;
}

}  // namespace

TEST(HTSmapsParser, MapsLinesOfEveryKind)
{
    std::vector<HTSmapsEntry> entries = parsedCapture();
    EXPECT_TRUE(std::is_sorted(entries.begin(), entries.end(),
                               [](const HTSmapsEntry& a, const HTSmapsEntry& b) { return a.start < b.start; }));

    const HTSmapsEntry& program = entries.front();
    EXPECT_EQ(program.start, 0x55e60358a000u);
    EXPECT_EQ(program.end, 0x55e60358b000u);
    EXPECT_EQ(program.protection, VM_PROT_READ);
    EXPECT_FALSE(program.shared);
    EXPECT_EQ(program.devMajor, 0xfeu);
    EXPECT_EQ(program.inode, 10953404u);
    EXPECT_EQ(program.path, "/tmp/walkx/probe");
    EXPECT_EQ(program.kernelPageSize, 4 * kKiB);
    const HTSmapsEntry& libc = at(entries, 0x7f8955dfb000);
    EXPECT_EQ(libc.protection, VM_PROT_READ | VM_PROT_EXECUTE);
    EXPECT_EQ(libc.offset, 0x26000u);
    EXPECT_EQ(libc.sharedClean, 980 * kKiB);

    // A path with blanks runs to the end of the line, " (deleted)" kept;
    // anonymous memory's maps line ends in a blank, which is no path.
    const HTSmapsEntry& privateFile = at(entries, 0x7f8955dc8000);
    EXPECT_EQ(privateFile.path, "/tmp/walkx/file with blank (deleted)");
    EXPECT_EQ(htPathWithoutDeletedMark(privateFile.path), "/tmp/walkx/file with blank");
    EXPECT_EQ(at(entries, 0x7f8955800000).path, "");
    // System V shows its segment id as the inode: 0 for the first segment.
    EXPECT_EQ(at(entries, 0x7f8955dcc000).devMinor, 1u);
    EXPECT_EQ(at(entries, 0x7f8955dcc000).inode, 0u);

    EXPECT_EQ(at(entries, 0x7f8955fbc000).vmFlags, HTVmFlagMayRead | HTVmFlagMayWrite | HTVmFlagMayExec);
    EXPECT_EQ(at(entries, 0x7f8955dca000).vmFlags,
              HTVmFlagShared | HTVmFlagMayRead | HTVmFlagMayWrite | HTVmFlagMayExec);
    // hugetlbfs: pages outside Rss, the huge page size as the kernel's.
    const HTSmapsEntry& huge = at(entries, 0x7f5e64400000);
    EXPECT_TRUE(huge.hasFlag(HTVmFlagHugetlb));
    EXPECT_EQ(huge.rss, 0u);
    EXPECT_EQ(huge.kernelPageSize, 2048 * kKiB);
}

TEST(HTSmapsParser, ReusesRecordsAndSkipsWhatItCannotRead)
{
    std::vector<HTSmapsEntry> entries = parsedCapture();
    // A second, shorter text: no record of the first survives in it.
    constexpr std::string_view text = "not a maps line\n"
                                      "Rss:                 99 kB\n"
                                      "7f00-zz00 rw-p 00000000 00:00 0 \n"
                                      "Rss:                 98 kB\n"
                                      "1000-3000 rw-s 00002000 00:01 7    /memfd:x (deleted)\n"
                                      "Rss:                  8 kB\n"
                                      "Swap:\n"
                                      "Private_Dirty:        4 kB\n"
                                      "VmFlags: rd wr sh mr mw me lo";  // cut short: no final line feed
    ASSERT_EQ(htParseSmaps(text, entries), 1u);
    ASSERT_EQ(entries.size(), 1u);
    EXPECT_EQ(entries[0].start, 0x1000u);
    EXPECT_EQ(entries[0].end, 0x3000u);
    EXPECT_EQ(entries[0].offset, 0x2000u);
    EXPECT_EQ(entries[0].path, "/memfd:x (deleted)");
    EXPECT_EQ(entries[0].rss, 8 * kKiB);
    EXPECT_EQ(entries[0].swap, 0u);
    EXPECT_EQ(entries[0].privateDirty, 4 * kKiB);
    EXPECT_EQ(entries[0].sharedClean, 0u);
    EXPECT_TRUE(entries[0].hasFlag(HTVmFlagLocked));
    EXPECT_EQ(entries[0].kind, HTSmapsKind::SharedMemory);

    EXPECT_EQ(htParseSmaps("", entries), 0u);
    EXPECT_TRUE(entries.empty());
}

TEST(HTLinuxRegionInfo, RecordsOfCapturedMappings)
{
    std::vector<HTSmapsEntry> entries = parsedCapture();
    // Sizes in pages; "now private" counts a private file mapping's copies.
    struct Row {
        uint64_t start;
        uint32_t tag;
        uint8_t shareMode;
        uint32_t inheritance;
        int external;
        uint32_t resident, dirtied, nowPrivate, reusable, refCount;
        uint16_t wired;
    };
    const Row rows[] = {
        {0x55e60358a000, HT_VM_TAG_UNTAGGED, SM_COW, VM_INHERIT_COPY, 1, 1, 1, 0, 0, 1, 0},  // the program
        {0x55e63f88e000, HT_VM_TAG_HEAP, SM_PRIVATE, VM_INHERIT_COPY, 0, 2, 2, 0, 0, 1, 0},
        {0x7f8955800000, HT_VM_TAG_UNTAGGED, SM_PRIVATE, VM_INHERIT_COPY, 0, 512, 512, 0, 0, 1, 0},  // THP
        {0x7f8955dc1000, HT_VM_TAG_UNTAGGED, SM_EMPTY, VM_INHERIT_NONE, 0, 0, 0, 0, 0, 1, 0},        // MADV_DONTFORK
        {0x7f8955dc2000, HT_VM_TAG_UNTAGGED, SM_PRIVATE, VM_INHERIT_COPY, 0, 4, 0, 0, 4, 1, 0},      // MADV_FREE
        {0x7f8955dc6000, HT_VM_TAG_UNTAGGED, SM_PRIVATE, VM_INHERIT_COPY, 0, 2, 2, 0, 0, 1, 1},      // mlocked
        // One page copied on write, one still shared with the file.
        {0x7f8955dc8000, HT_VM_TAG_UNTAGGED, SM_COW, VM_INHERIT_COPY, 1, 2, 2, 1, 0, 2, 0},
        {0x7f8955dca000, HT_VM_TAG_UNTAGGED, SM_SHARED, VM_INHERIT_SHARE, 1, 1, 1, 0, 0, 2, 0},
        // System V, POSIX, memfd and MAP_SHARED anonymous memory.
        {0x7f8955dcc000, HT_VM_TAG_SHARED_MEMORY, SM_SHARED, VM_INHERIT_SHARE, 0, 1, 1, 0, 0, 1, 0},
        {0x7f8955dcd000, HT_VM_TAG_SHARED_MEMORY, SM_SHARED, VM_INHERIT_SHARE, 0, 1, 1, 0, 0, 1, 0},
        {0x7f8955dce000, HT_VM_TAG_SHARED_MEMORY, SM_SHARED, VM_INHERIT_SHARE, 0, 1, 1, 0, 0, 1, 0},
        {0x7f8955dd0000, HT_VM_TAG_SHARED_MEMORY, SM_SHARED, VM_INHERIT_SHARE, 0, 1, 1, 0, 0, 1, 0},
        {0x7f8955dd2000, HT_VM_TAG_NAMED_ANONYMOUS, SM_PRIVATE, VM_INHERIT_COPY, 0, 2, 2, 0, 0, 1, 0},
        {0x7f8955dd5000, HT_VM_TAG_NAMED_ANONYMOUS, SM_SHARED, VM_INHERIT_SHARE, 0, 1, 1, 0, 0, 1, 0},
        {0x7f8955dfb000, HT_VM_TAG_UNTAGGED, SM_COW, VM_INHERIT_COPY, 1, 245, 0, 0, 0, 2, 0},  // libc
        {0x7f8955fbc000, HT_VM_TAG_GUARD, SM_EMPTY, VM_INHERIT_COPY, 0, 0, 0, 0, 0, 1, 0},
        {0x7f8955fc4000, HT_VM_TAG_KERNEL_PROVIDED, SM_EMPTY, VM_INHERIT_COPY, 0, 0, 0, 0, 0, 1, 0},  // vvar
        // The vdso's page is shared with every process.
        {0x7f8955fca000, HT_VM_TAG_KERNEL_PROVIDED, SM_COW, VM_INHERIT_COPY, 0, 1, 0, 0, 0, 2, 0},
        {0x7fffd5480000, HT_VM_TAG_STACK, SM_PRIVATE, VM_INHERIT_COPY, 0, 5, 5, 0, 0, 1, 0},
        {0xffffffffff600000, HT_VM_TAG_KERNEL_PROVIDED, SM_EMPTY, VM_INHERIT_COPY, 0, 0, 0, 0, 0, 1, 0},
        // hugetlbfs pages count by their bytes, all of them dirty.
        {0x7f5e64200000, HT_VM_TAG_SHARED_MEMORY, SM_SHARED, VM_INHERIT_SHARE, 0, 512, 512, 0, 0, 1, 0},
        {0x7f5e64400000, HT_VM_TAG_UNTAGGED, SM_PRIVATE, VM_INHERIT_COPY, 0, 512, 512, 0, 0, 1, 0},
    };
    for (const Row& row : rows) {
        vm_region_submap_info_64 info = htSubmapInfo(at(entries, row.start), 4242, kPage);
        SCOPED_TRACE(testing::Message() << std::hex << "mapping at 0x" << row.start);
        EXPECT_EQ(info.user_tag, row.tag);
        EXPECT_EQ(info.share_mode, row.shareMode);
        EXPECT_EQ(info.inheritance, row.inheritance);
        EXPECT_EQ(info.external_pager, row.external);
        EXPECT_EQ(info.pages_resident, row.resident);
        EXPECT_EQ(info.pages_dirtied, row.dirtied);
        EXPECT_EQ(info.pages_shared_now_private, row.nowPrivate);
        EXPECT_EQ(info.pages_reusable, row.reusable);
        EXPECT_EQ(info.ref_count, row.refCount);
        EXPECT_EQ(info.user_wired_count, row.wired);
    }

    vm_region_submap_info_64 privateFile = htSubmapInfo(at(entries, 0x7f8955dc8000), 4242, kPage);
    EXPECT_EQ(privateFile.protection, VM_PROT_READ | VM_PROT_WRITE);
    EXPECT_EQ(privateFile.max_protection, VM_PROT_READ | VM_PROT_WRITE | VM_PROT_EXECUTE);
    // The maps line of anonymous memory shows its start page as the offset.
    EXPECT_EQ(htSubmapInfo(at(entries, 0x55e63f88e000), 4242, kPage).offset, 0u);
    EXPECT_EQ(htSubmapInfo(at(entries, 0x7f8955dfb000), 4242, kPage).offset, 0x26000u);

    vm_region_basic_info_64 basic = htBasicInfo(at(entries, 0x7f8955dca000));
    EXPECT_EQ(basic.shared, 1u);
    EXPECT_EQ(basic.inheritance, VM_INHERIT_SHARE);
    EXPECT_EQ(basic.max_protection, VM_PROT_READ | VM_PROT_WRITE | VM_PROT_EXECUTE);
    EXPECT_EQ(htBasicInfo(at(entries, 0x7f8955dc6000)).user_wired_count, 1);
}

TEST(HTLinuxRegionInfo, ObjectIdentities)
{
    std::vector<HTSmapsEntry> entries = parsedCapture();

    // Every mapping of a file or a shared-memory segment names the object
    // by (device, inode): the same in every process and every mapping.
    const HTSmapsEntry& privateFile = at(entries, 0x7f8955dc8000);
    uint64_t file = htRegionObjectId(privateFile, 100);
    EXPECT_EQ(file, htRegionObjectId(privateFile, 200));
    EXPECT_EQ(file, htRegionObjectId(at(entries, 0x7f8955dca000), 100));
    EXPECT_EQ(file >> 63, 1u);
    const HTSmapsEntry& sysv = at(entries, 0x7f8955dcc000);
    EXPECT_EQ(htRegionObjectId(sysv, 100), htRegionObjectId(sysv, 200));
    EXPECT_EQ(htRegionObjectId(sysv, 100) >> 63, 1u);
    EXPECT_EQ(htRegionObjectId(at(entries, 0x7f8955dd5000), 100) >> 63, 1u);

    // Private anonymous memory is the process's own, one object a mapping.
    const HTSmapsEntry& heap = at(entries, 0x55e63f88e000);
    uint64_t anonymous = htRegionObjectId(heap, 100);
    EXPECT_NE(anonymous, htRegionObjectId(heap, 200));
    EXPECT_EQ(anonymous >> 62, 1u);

    // All distinct within one process (the two mappings of one file
    // aside), never 0 nor all ones, and the 32-bit id is the low half.
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
    HTSmapsEntry b = privateFile;
    b.inode += 1;
    EXPECT_NE(htRegionObjectId(b, 1), htRegionObjectId(privateFile, 1));
    HTSmapsEntry c = heap;
    c.start += kPage;
    EXPECT_NE(htRegionObjectId(c, 100), anonymous);
}
