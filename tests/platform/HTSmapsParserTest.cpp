#include "platform/linux/HTLinuxRegionInfo.h"
#include "platform/linux/HTSmapsParser.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <set>
#include <string_view>
#include <vector>

namespace {

// Mappings captured from two real processes on x86-64 Linux 6.18: a probe
// that laid out one mapping of every kind (the hugetlbfs ones come from a
// second process, which puts them out of address order here), plus two
// mappings named with prctl(PR_SET_VMA_ANON_NAME) written in the kernel's
// format, since the capturing kernel was built without named anonymous
// memory.
constexpr std::string_view kCapture = R"smaps(55e60358a000-55e60358b000 r--p 00000000 fe:00 10953404                   /tmp/walkx/probe
Size:                  4 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   4 kB
Pss:                   4 kB
Pss_Dirty:             4 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         4 kB
Referenced:            4 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd mr mw me 
55e63f88e000-55e63f8af000 rw-p 00000000 00:00 0                          [heap]
Size:                132 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   8 kB
Pss:                   8 kB
Pss_Dirty:             8 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         8 kB
Referenced:            8 kB
Anonymous:             8 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr mr mw me ac 
7f8955800000-7f8955a00000 rw-p 00000000 00:00 0 
Size:               2048 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                2048 kB
Pss:                2048 kB
Pss_Dirty:          2048 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:      2048 kB
Referenced:         2048 kB
Anonymous:          2048 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:      2048 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           1
VmFlags: rd wr mr mw me ac hg 
7f8955dc1000-7f8955dc2000 rw-p 00000000 00:00 0 
Size:                  4 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   0 kB
Pss:                   0 kB
Pss_Dirty:             0 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         0 kB
Referenced:            0 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr mr mw me dc ac 
7f8955dc2000-7f8955dc6000 rw-p 00000000 00:00 0 
Size:                 16 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                  16 kB
Pss:                  16 kB
Pss_Dirty:             0 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:        16 kB
Private_Dirty:         0 kB
Referenced:            0 kB
Anonymous:            16 kB
KSM:                   0 kB
LazyFree:             16 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr mr mw me ac 
7f8955dc6000-7f8955dc8000 rw-p 00000000 00:00 0 
Size:                  8 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   8 kB
Pss:                   8 kB
Pss_Dirty:             8 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         8 kB
Referenced:            8 kB
Anonymous:             8 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                8 kB
THPeligible:           0
VmFlags: rd wr mr mw me lo ac 
7f8955dc8000-7f8955dca000 rw-p 00000000 fe:00 10953381                   /tmp/walkx/file with blank (deleted)
Size:                  8 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   8 kB
Pss:                   6 kB
Pss_Dirty:             6 kB
Shared_Clean:          0 kB
Shared_Dirty:          4 kB
Private_Clean:         0 kB
Private_Dirty:         4 kB
Referenced:            8 kB
Anonymous:             4 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr mr mw me ac 
7f8955dca000-7f8955dcc000 rw-s 00000000 fe:00 10953381                   /tmp/walkx/file with blank (deleted)
Size:                  8 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   4 kB
Pss:                   2 kB
Pss_Dirty:             2 kB
Shared_Clean:          0 kB
Shared_Dirty:          4 kB
Private_Clean:         0 kB
Private_Dirty:         0 kB
Referenced:            4 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr sh mr mw me ms 
7f8955dcc000-7f8955dcd000 rw-s 00000000 00:01 0                          /SYSV00000000 (deleted)
Size:                  4 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   4 kB
Pss:                   4 kB
Pss_Dirty:             4 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         4 kB
Referenced:            4 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr sh mr mw me ms 
7f8955dcd000-7f8955dce000 rw-s 00000000 00:1a 2                          /dev/shm/heftprobe
Size:                  4 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   4 kB
Pss:                   4 kB
Pss_Dirty:             4 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         4 kB
Referenced:            4 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr sh mr mw me ms 
7f8955dce000-7f8955dd0000 rw-s 00000000 00:01 26                         /memfd:heft probe (deleted)
Size:                  8 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   4 kB
Pss:                   4 kB
Pss_Dirty:             4 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         4 kB
Referenced:            4 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr sh mr mw me ms 
7f8955dd0000-7f8955dd2000 rw-s 00000000 00:01 25                         /dev/zero (deleted)
Size:                  8 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   4 kB
Pss:                   4 kB
Pss_Dirty:             4 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         4 kB
Referenced:            4 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr sh mr mw me ms 
7f8955dd2000-7f8955dd5000 rw-p 00000000 00:00 0                          [anon:jit cache]
Size:                 12 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   8 kB
Pss:                   8 kB
Pss_Dirty:             8 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         8 kB
Referenced:            8 kB
Anonymous:             8 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr mr mw me ac 
7f8955dd5000-7f8955dd7000 rw-s 00000000 00:01 27                         [anon_shmem:ring]
Size:                  8 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   4 kB
Pss:                   4 kB
Pss_Dirty:             4 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         4 kB
Referenced:            4 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr sh mr mw me ms 
7f8955dfb000-7f8955f51000 r-xp 00026000 fe:00 332835                     /usr/lib/x86_64-linux-gnu/libc.so.6
Size:               1368 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                 980 kB
Pss:                  50 kB
Pss_Dirty:             0 kB
Shared_Clean:        980 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         0 kB
Referenced:          980 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd ex mr mw me 
7f8955fbc000-7f8955fbe000 ---p 00000000 00:00 0 
Size:                  8 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   0 kB
Pss:                   0 kB
Pss_Dirty:             0 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         0 kB
Referenced:            0 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: mr mw me 
7f8955fc4000-7f8955fc8000 r--p 00000000 00:00 0                          [vvar]
Size:                 16 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   0 kB
Pss:                   0 kB
Pss_Dirty:             0 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         0 kB
Referenced:            0 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd mr pf io de dd 
7f8955fca000-7f8955fcc000 r-xp 00000000 00:00 0                          [vdso]
Size:                  8 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   4 kB
Pss:                   0 kB
Pss_Dirty:             0 kB
Shared_Clean:          4 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         0 kB
Referenced:            4 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd ex mr mw me de 
7fffd5480000-7fffd54a1000 rw-p 00000000 00:00 0                          [stack]
Size:                132 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                  20 kB
Pss:                  20 kB
Pss_Dirty:            20 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:        20 kB
Referenced:           20 kB
Anonymous:            20 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr mr mw me gd ac 
ffffffffff600000-ffffffffff601000 --xp 00000000 00:00 0                  [vsyscall]
Size:                  4 kB
KernelPageSize:        4 kB
MMUPageSize:           4 kB
Rss:                   0 kB
Pss:                   0 kB
Pss_Dirty:             0 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         0 kB
Referenced:            0 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:       0 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: ex 
7f5e64200000-7f5e64400000 rw-s 00000000 00:11 411891                     /anon_hugepage (deleted)
Size:               2048 kB
KernelPageSize:     2048 kB
MMUPageSize:        2048 kB
Rss:                   0 kB
Pss:                   0 kB
Pss_Dirty:             0 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         0 kB
Referenced:            0 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:    2048 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr sh mr mw me ms de ht 
7f5e64400000-7f5e64800000 rw-p 00000000 00:11 411890                     /anon_hugepage (deleted)
Size:               4096 kB
KernelPageSize:     2048 kB
MMUPageSize:        2048 kB
Rss:                   0 kB
Pss:                   0 kB
Pss_Dirty:             0 kB
Shared_Clean:          0 kB
Shared_Dirty:          0 kB
Private_Clean:         0 kB
Private_Dirty:         0 kB
Referenced:            0 kB
Anonymous:             0 kB
KSM:                   0 kB
LazyFree:              0 kB
AnonHugePages:         0 kB
ShmemPmdMapped:        0 kB
FilePmdMapped:         0 kB
Shared_Hugetlb:        0 kB
Private_Hugetlb:    2048 kB
Swap:                  0 kB
SwapPss:               0 kB
Locked:                0 kB
THPeligible:           0
VmFlags: rd wr mr mw me de ht 
)smaps";

constexpr uint64_t kPage = 4096;
constexpr uint64_t kKiB = 1024;

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

std::vector<HTSmapsEntry> parsedCapture()
{
    std::vector<HTSmapsEntry> entries;
    EXPECT_EQ(htParseSmaps(kCapture, entries), 22u);
    return entries;
}

}  // namespace

TEST(HTSmapsParser, MapsLinesOfEveryKind)
{
    std::vector<HTSmapsEntry> entries = parsedCapture();
    ASSERT_EQ(entries.size(), 22u);
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
    EXPECT_EQ(htSmapsPathWithoutDeleted(privateFile.path), "/tmp/walkx/file with blank");
    EXPECT_EQ(privateFile.anonymous, 4 * kKiB);
    EXPECT_EQ(at(entries, 0x7f8955800000).path, "");
    EXPECT_EQ(at(entries, 0x7f8955800000).rss, 2048 * kKiB);  // a transparent huge page is in Rss
    // System V shows its segment id as the inode: 0 for the first segment.
    EXPECT_EQ(at(entries, 0x7f8955dcc000).devMinor, 1u);
    EXPECT_EQ(at(entries, 0x7f8955dcc000).inode, 0u);

    EXPECT_EQ(at(entries, 0x7f8955fbc000).vmFlags, HTVmFlagMayRead | HTVmFlagMayWrite | HTVmFlagMayExec);
    EXPECT_EQ(at(entries, 0x7f8955dc6000).vmFlags,
              HTVmFlagMayRead | HTVmFlagMayWrite | HTVmFlagMayExec | HTVmFlagLocked);
    EXPECT_EQ(at(entries, 0x7f8955dca000).vmFlags,
              HTVmFlagShared | HTVmFlagMayRead | HTVmFlagMayWrite | HTVmFlagMayExec);
    EXPECT_EQ(at(entries, 0x7f8955dc2000).lazyFree, 16 * kKiB);

    // hugetlbfs: pages outside Rss, the huge page size as the kernel's.
    const HTSmapsEntry& huge = at(entries, 0x7f5e64400000);
    EXPECT_TRUE(huge.hasFlag(HTVmFlagHugetlb));
    EXPECT_EQ(huge.rss, 0u);
    EXPECT_EQ(huge.privateHugetlb, 2048 * kKiB);
    EXPECT_EQ(huge.kernelPageSize, 2048 * kKiB);
}

TEST(HTSmapsParser, ReusesRecordsAndSkipsWhatItCannotRead)
{
    std::vector<HTSmapsEntry> entries;
    htParseSmaps(kCapture, entries);
    // A second, shorter text: no record of the first survives in it.
    constexpr std::string_view text =
        "not a maps line\n"
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
    ASSERT_EQ(entries.size(), 22u);
    constexpr int32_t pid = 4242;
    auto info = [&](uint64_t start) { return htSubmapInfo(at(entries, start), pid, kPage); };

    // Private file mapping with one copied-on-write page and one page still
    // shared with the file.
    vm_region_submap_info_64 privateFile = info(0x7f8955dc8000);
    EXPECT_EQ(privateFile.protection, VM_PROT_READ | VM_PROT_WRITE);
    EXPECT_EQ(privateFile.max_protection, VM_PROT_READ | VM_PROT_WRITE | VM_PROT_EXECUTE);
    EXPECT_EQ(privateFile.inheritance, VM_INHERIT_COPY);
    EXPECT_EQ(privateFile.user_tag, 0u);
    EXPECT_EQ(privateFile.pages_resident, 2u);
    EXPECT_EQ(privateFile.pages_dirtied, 2u);
    EXPECT_EQ(privateFile.pages_shared_now_private, 1u);
    EXPECT_EQ(privateFile.ref_count, 2u);
    EXPECT_EQ(privateFile.external_pager, 1);
    EXPECT_EQ(privateFile.share_mode, SM_COW);
    EXPECT_EQ(privateFile.user_wired_count, 0);
    EXPECT_EQ(privateFile.is_submap, 0u);
    EXPECT_EQ(privateFile.shadow_depth, 0);
    EXPECT_EQ(privateFile.behavior, 0);

    vm_region_submap_info_64 sharedFile = info(0x7f8955dca000);
    EXPECT_EQ(sharedFile.share_mode, SM_SHARED);
    EXPECT_EQ(sharedFile.inheritance, VM_INHERIT_SHARE);
    EXPECT_EQ(sharedFile.external_pager, 1);
    EXPECT_EQ(sharedFile.pages_dirtied, 1u);
    EXPECT_EQ(sharedFile.pages_shared_now_private, 0u);

    // Anonymous memory of each kind.
    vm_region_submap_info_64 heap = info(0x55e63f88e000);
    EXPECT_EQ(heap.user_tag, 5u);
    EXPECT_EQ(heap.share_mode, SM_PRIVATE);
    EXPECT_EQ(heap.offset, 0u);  // the maps line shows the start page there
    EXPECT_EQ(heap.external_pager, 0);
    EXPECT_EQ(heap.ref_count, 1u);
    EXPECT_EQ(info(0x7fffd5480000).user_tag, 30u);
    vm_region_submap_info_64 guard = info(0x7f8955fbc000);
    EXPECT_EQ(guard.user_tag, 31u);
    EXPECT_EQ(guard.share_mode, SM_EMPTY);
    EXPECT_EQ(info(0x7f8955800000).pages_resident, 512u);
    EXPECT_EQ(info(0x7f8955800000).pages_dirtied, 512u);
    EXPECT_EQ(info(0x7f8955dc1000).inheritance, VM_INHERIT_NONE);
    vm_region_submap_info_64 freed = info(0x7f8955dc2000);
    EXPECT_EQ(freed.pages_resident, 4u);
    EXPECT_EQ(freed.pages_reusable, 4u);
    EXPECT_EQ(freed.pages_dirtied, 0u);
    EXPECT_EQ(info(0x7f8955dc6000).user_wired_count, 1);
    EXPECT_EQ(info(0x7f8955dd2000).user_tag, 102u);
    vm_region_submap_info_64 vdso = info(0x7f8955fca000);
    EXPECT_EQ(vdso.user_tag, 101u);
    EXPECT_EQ(vdso.share_mode, SM_COW);  // its page is shared with every process
    EXPECT_EQ(info(0xffffffffff600000).user_tag, 101u);

    // Shared memory: tag, no external pager, file offsets.
    for (uint64_t start : {0x7f8955dcc000ULL, 0x7f8955dcd000ULL, 0x7f8955dce000ULL, 0x7f8955dd0000ULL}) {
        vm_region_submap_info_64 shm = info(start);
        EXPECT_EQ(shm.user_tag, 100u) << std::hex << start;
        EXPECT_EQ(shm.external_pager, 0) << std::hex << start;
        EXPECT_EQ(shm.share_mode, SM_SHARED) << std::hex << start;
        EXPECT_EQ(shm.pages_dirtied, 1u) << std::hex << start;
    }
    vm_region_submap_info_64 namedShared = info(0x7f8955dd5000);
    EXPECT_EQ(namedShared.user_tag, 102u);
    EXPECT_EQ(namedShared.external_pager, 0);
    EXPECT_EQ(namedShared.object_id_full >> 63, 1u);
    EXPECT_EQ(info(0x7f8955fc4000).user_tag, 101u);

    // hugetlbfs pages count by their bytes, all of them dirty.
    vm_region_submap_info_64 hugePrivate = info(0x7f5e64400000);
    EXPECT_EQ(hugePrivate.pages_resident, 512u);
    EXPECT_EQ(hugePrivate.pages_dirtied, 512u);
    EXPECT_EQ(hugePrivate.share_mode, SM_PRIVATE);
    EXPECT_EQ(hugePrivate.user_tag, 0u);
    vm_region_submap_info_64 hugeShared = info(0x7f5e64200000);
    EXPECT_EQ(hugeShared.share_mode, SM_SHARED);
    EXPECT_EQ(hugeShared.user_tag, 100u);

    vm_region_basic_info_64 basic = htBasicInfo(at(entries, 0x7f8955dca000));
    EXPECT_EQ(basic.shared, 1u);
    EXPECT_EQ(basic.inheritance, VM_INHERIT_SHARE);
    EXPECT_EQ(basic.max_protection, VM_PROT_READ | VM_PROT_WRITE | VM_PROT_EXECUTE);
    EXPECT_EQ(htBasicInfo(at(entries, 0x7f8955dc6000)).user_wired_count, 1);
}

TEST(HTLinuxRegionInfo, ObjectIdentities)
{
    std::vector<HTSmapsEntry> entries = parsedCapture();
    ASSERT_EQ(entries.size(), 22u);

    // Every mapping of a file or a shared-memory segment names the object
    // by (device, inode): the same in every process and every mapping.
    const HTSmapsEntry& privateFile = at(entries, 0x7f8955dc8000);
    const HTSmapsEntry& sharedFile = at(entries, 0x7f8955dca000);
    uint64_t file = htRegionObjectId(privateFile, 100);
    EXPECT_EQ(file, htRegionObjectId(privateFile, 200));
    EXPECT_EQ(file, htRegionObjectId(sharedFile, 100));
    EXPECT_EQ(file >> 63, 1u);
    const HTSmapsEntry& sysv = at(entries, 0x7f8955dcc000);
    EXPECT_EQ(htRegionObjectId(sysv, 100), htRegionObjectId(sysv, 200));
    EXPECT_EQ(htRegionObjectId(sysv, 100) >> 63, 1u);

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
    HTSmapsEntry a = privateFile;
    HTSmapsEntry b = privateFile;
    b.inode += 1;
    EXPECT_NE(htRegionObjectId(a, 1), htRegionObjectId(b, 1));
    HTSmapsEntry c = heap;
    c.start += kPage;
    EXPECT_NE(htRegionObjectId(c, 100), anonymous);
}
