#include "platform/HTTestChildren.h"
#include "platform/linux/HTLinuxPlatform.h"
#include "platform/linux/HTLinuxTaskPort.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <optional>
#include <string>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

constexpr size_t kTouchedPages = 16;
constexpr size_t kFreedPages = 8;
constexpr size_t kLockedPages = 2;
constexpr size_t kFilePages = 4;
constexpr size_t kFileWrittenPages = 3;

// Where the child put its memory.
struct ChildLayout {
    uint64_t touched = 0;  // kTouchedPages pages, each written
    uint64_t freed = 0;    // kFreedPages pages, written, then freed with MADV_FREE
    uint64_t locked = 0;   // kLockedPages pages, mlocked
    uint64_t file = 0;     // kFilePages pages of a shared file mapping, the first kFileWrittenPages written
};

size_t pageSize() { return static_cast<size_t>(::sysconf(_SC_PAGESIZE)); }

// `pages` read-write pages between two inaccessible ones, so that the
// kernel cannot merge them with a neighbouring mapping: the walk then
// finds exactly them as one region.
char* isolatedAnonymous(size_t pages)
{
    size_t page = pageSize();
    void* base = ::mmap(nullptr, (pages + 2) * page, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (base == MAP_FAILED) return nullptr;
    char* inner = static_cast<char*>(base) + page;
    if (::mprotect(inner, pages * page, PROT_READ | PROT_WRITE) != 0) return nullptr;
    return inner;
}

// Lays out the child's memory into `layout`; answers 0, or the number of
// the step that failed.
int layOut(const std::string& filePath, ChildLayout& layout)
{
    size_t page = pageSize();
    char* touched = isolatedAnonymous(kTouchedPages);
    if (touched == nullptr) return 1;
    std::memset(touched, 0x5a, kTouchedPages * page);
    layout.touched = reinterpret_cast<uint64_t>(touched);

    char* freed = isolatedAnonymous(kFreedPages);
    if (freed == nullptr) return 2;
    std::memset(freed, 0x5a, kFreedPages * page);
    // The system calls themselves: a sanitizer's interceptors may turn
    // them into no-ops.
    if (::syscall(SYS_madvise, freed, kFreedPages * page, MADV_FREE) != 0) return 3;
    layout.freed = reinterpret_cast<uint64_t>(freed);

    char* locked = isolatedAnonymous(kLockedPages);
    if (locked == nullptr || ::syscall(SYS_mlock, locked, kLockedPages * page) != 0) return 4;
    layout.locked = reinterpret_cast<uint64_t>(locked);

    int fd = ::open(filePath.c_str(), O_RDWR | O_CLOEXEC);
    if (fd < 0) return 5;
    void* file = ::mmap(nullptr, kFilePages * page, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    ::close(fd);
    if (file == MAP_FAILED) return 6;
    std::memset(file, 0x5a, kFileWrittenPages * page);
    layout.file = reinterpret_cast<uint64_t>(file);
    return 0;
}

struct WalkedRegion {
    uint64_t start, size;
    vm_region_submap_info_64 info;
};

// The whole address space as the walk sees it; `result` is the code that
// ended the walk.
std::vector<WalkedRegion> walk(HTPlatform& platform, HTTaskPort& task, kern_return_t& result)
{
    std::vector<WalkedRegion> regions;
    uint64_t address = 0;
    for (;;) {
        uint64_t size = 0;
        uint32_t depth = 0xFFFFFFFF;
        uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
        vm_region_submap_info_64 info{};
        result = platform.mach_vm_region_recurse(task, &address, &size, &depth, &info, &count);
        if (result != KERN_SUCCESS) break;
        EXPECT_EQ(depth, 0xFFFFFFFFu);
        EXPECT_EQ(count, VM_REGION_SUBMAP_INFO_COUNT_64);
        regions.push_back({address, size, info});
        address += size;
    }
    return regions;
}

const WalkedRegion* regionAt(const std::vector<WalkedRegion>& regions, uint64_t start)
{
    for (const WalkedRegion& region : regions)
        if (region.start == start) return &region;
    return nullptr;
}

std::vector<int32_t> dispositions(HTPlatform& platform, HTTaskPort& task, uint64_t start, size_t pages,
                                  kern_return_t& result)
{
    std::vector<int32_t> answer(pages, -1);
    uint64_t count = pages;
    result = platform.mach_vm_page_range_query(task, start, pages * pageSize(), answer.data(), &count);
    if (result == KERN_SUCCESS) {
        EXPECT_EQ(count, pages);
    }
    return answer;
}

bool pageFlagsReadable() { return ::access("/proc/kpageflags", R_OK) == 0; }

// A child that lays out known memory, reports where through a page shared
// with the test, and stops itself; continued, it exits. The walk of its
// address space is taken once it has stopped.
class HTLinuxAddressSpace : public testing::Test {
protected:
    void SetUp() override
    {
        char pattern[] = "/tmp/heft-walk-XXXXXX";
        int fd = ::mkstemp(pattern);
        ASSERT_GE(fd, 0);
        filePath_ = pattern;
        ASSERT_EQ(::ftruncate(fd, static_cast<off_t>(kFilePages * pageSize())), 0);
        ::close(fd);
        void* report = ::mmap(nullptr, sizeof(ChildLayout), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
        ASSERT_NE(report, MAP_FAILED);
        child_ = HTTestChild::fork([&] {
            int failed = layOut(filePath_, *static_cast<ChildLayout*>(report));
            if (failed == 0) ::raise(SIGSTOP);
            return failed;
        });
        siginfo_t state{};
        ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(child_.pid()), &state, WSTOPPED | WEXITED | WNOWAIT), 0);
        layout_ = *static_cast<ChildLayout*>(report);
        ::munmap(report, sizeof(ChildLayout));
        ASSERT_EQ(state.si_code, CLD_STOPPED) << "the child failed in step " << state.si_status;
        ASSERT_EQ(platform_.task_for_pid(child_.pid(), &task_), KERN_SUCCESS);
        regions_ = walk(platform_, *task_, result_);
    }
    void TearDown() override
    {
        if (!filePath_.empty()) ::unlink(filePath_.c_str());
    }

    std::string filePath_;
    HTTestChild child_;
    ChildLayout layout_;
    HTLinuxPlatform platform_;
    std::shared_ptr<HTTaskPort> task_;
    std::vector<WalkedRegion> regions_;
    kern_return_t result_ = KERN_SUCCESS;
};

}  // namespace

TEST_F(HTLinuxAddressSpace, WalkAndPageQueryFindTheChildsMemory)
{
    EXPECT_EQ(result_, KERN_INVALID_ADDRESS);
    ASSERT_GT(regions_.size(), 5u);
    for (size_t i = 1; i < regions_.size(); ++i)
        EXPECT_GE(regions_[i].start, regions_[i - 1].start + regions_[i - 1].size) << "regions overlap or go back";

    // Written pages are resident and dirty: mlock faults the locked ones
    // in, and the test looks well within the kernel's 30 s before it writes
    // dirty file pages back. Files have an external pager.
    struct Row {
        uint64_t start;
        size_t pages, written;
        uint8_t shareMode;
        uint32_t inheritance;
        int external, wired;
    };
    const Row rows[] = {{layout_.touched, kTouchedPages, kTouchedPages, SM_PRIVATE, VM_INHERIT_COPY, 0, 0},
                        {layout_.locked, kLockedPages, kLockedPages, SM_PRIVATE, VM_INHERIT_COPY, 0, 1},
                        {layout_.file, kFilePages, kFileWrittenPages, SM_SHARED, VM_INHERIT_SHARE, 1, 0}};
    for (const Row& row : rows) {
        const WalkedRegion* region = regionAt(regions_, row.start);
        ASSERT_NE(region, nullptr) << std::hex << row.start;
        SCOPED_TRACE(testing::Message() << "region of " << row.pages << " pages");
        EXPECT_EQ(region->size, row.pages * pageSize());
        EXPECT_EQ(region->info.pages_resident, row.written);
        EXPECT_EQ(region->info.pages_dirtied, row.written);
        EXPECT_EQ(region->info.share_mode, row.shareMode);
        EXPECT_EQ(region->info.inheritance, row.inheritance);
        EXPECT_EQ(region->info.external_pager, row.external);
        EXPECT_EQ(region->info.user_wired_count, row.wired);
        EXPECT_EQ(region->info.user_tag, 0u);
        // Files' identities carry the top bit, anonymous memory's the next.
        EXPECT_EQ(region->info.object_id_full >> (row.external ? 63 : 62), 1u);
    }
    const WalkedRegion* touched = regionAt(regions_, layout_.touched);
    const WalkedRegion* mapped = regionAt(regions_, layout_.file);

    // The touched pages each alike, the inaccessible page on either side
    // never touched.
    kern_return_t result;
    std::vector<int32_t> pages =
        dispositions(platform_, *task_, layout_.touched - pageSize(), kTouchedPages + 2, result);
    ASSERT_EQ(result, KERN_SUCCESS);
    EXPECT_EQ(pages.front(), 0);
    EXPECT_EQ(pages.back(), 0);
    for (size_t i = 1; i <= kTouchedPages; ++i)
        EXPECT_EQ(pages[i], VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY) << "page " << i;

    char path[1024];
    int length = platform_.proc_regionfilename(*task_, layout_.file + pageSize(), path, sizeof(path));
    EXPECT_EQ(std::string(path, static_cast<size_t>(std::max(length, 0))), filePath_);
    EXPECT_EQ(platform_.proc_regionfilename(*task_, layout_.touched, path, sizeof(path)), 0);
    pages = dispositions(platform_, *task_, layout_.file, kFilePages, result);
    ASSERT_EQ(result, KERN_SUCCESS);
    for (size_t i = 0; i < kFileWrittenPages; ++i) {
        int32_t expected = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL;
        EXPECT_EQ(pages[i] & expected, expected) << "page " << i;
        EXPECT_EQ(pages[i] & VM_PAGE_QUERY_PAGE_REUSABLE, 0) << "page " << i;
    }
    EXPECT_EQ(pages[kFileWrittenPages], 0);

    // The same file mapped here names the same object; anonymous memory at
    // the same address in parent and child (the child is a fork) does not.
    int fd = ::open(filePath_.c_str(), O_RDONLY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    void* own = ::mmap(nullptr, pageSize(), PROT_READ, MAP_SHARED, fd, 0);
    ::close(fd);
    ASSERT_NE(own, MAP_FAILED);
    std::shared_ptr<HTTaskPort> self;
    ASSERT_EQ(platform_.task_for_pid(::getpid(), &self), KERN_SUCCESS);
    std::vector<WalkedRegion> ownRegions = walk(platform_, *self, result);
    ::munmap(own, pageSize());
    const WalkedRegion* ownFile = regionAt(ownRegions, reinterpret_cast<uint64_t>(own));
    ASSERT_NE(ownFile, nullptr);
    EXPECT_EQ(ownFile->info.object_id_full, mapped->info.object_id_full);
    size_t sameStartAnonymous = 0;
    for (const WalkedRegion& region : ownRegions) {
        const WalkedRegion* theirs = regionAt(regions_, region.start);
        if (theirs == nullptr || region.info.external_pager != 0 || (region.info.object_id_full >> 62) != 1) continue;
        ++sameStartAnonymous;
        EXPECT_NE(theirs->info.object_id_full, region.info.object_id_full);
    }
    EXPECT_GT(sameStartAnonymous, 0u);

    // The basic records name the same regions.
    uint64_t address = layout_.touched + pageSize();
    uint64_t size = 0;
    uint32_t count = VM_REGION_BASIC_INFO_COUNT_64;
    vm_region_basic_info_64 basic{};
    ASSERT_EQ(platform_.mach_vm_region(*task_, &address, &size, &basic, &count), KERN_SUCCESS);
    EXPECT_EQ(address, layout_.touched);
    EXPECT_EQ(size, touched->size);
    EXPECT_EQ(basic.protection, VM_PROT_READ | VM_PROT_WRITE);
    EXPECT_EQ(basic.shared, 0u);

    int32_t state = VM_PURGABLE_NONVOLATILE;
    EXPECT_NE(platform_.mach_vm_purgable_control(*task_, layout_.touched, VM_PURGABLE_GET_STATE, &state), KERN_SUCCESS);
}

TEST_F(HTLinuxAddressSpace, PagesFreedWithMadvFreeAreReusable)
{
    const WalkedRegion* freed = regionAt(regions_, layout_.freed);
    ASSERT_NE(freed, nullptr);
    if (freed->info.pages_reusable == 0) GTEST_SKIP() << "the kernel reports no LazyFree pages for MADV_FREE memory";
    // Still resident (nothing reclaimed them), none dirty any more.
    EXPECT_EQ(freed->info.pages_reusable, kFreedPages);
    EXPECT_EQ(freed->info.pages_resident, kFreedPages);
    EXPECT_EQ(freed->info.pages_dirtied, 0u);

    if (!pageFlagsReadable()) GTEST_SKIP() << "reusable pages show in page queries only with /proc/kpageflags (root)";
    kern_return_t result;
    std::vector<int32_t> pages = dispositions(platform_, *task_, layout_.freed, kFreedPages, result);
    ASSERT_EQ(result, KERN_SUCCESS);
    for (size_t i = 0; i < kFreedPages; ++i)
        EXPECT_EQ(pages[i], VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_REUSABLE) << "page " << i;
}

TEST_F(HTLinuxAddressSpace, PagesOnlyReadAgreeWithTheKernelsPageFlags)
{
    // Anonymous memory that is only read holds the shared zero page on most
    // kernels (and, in a huge-page-aligned stretch, the huge zero page); a
    // kernel may also give such a read a page of its own. Whichever it did,
    // the answer must be what the page's own flags say: zero pages are
    // present but cost nothing, other pages are dirty memory.
    if (!pageFlagsReadable()) GTEST_SKIP() << "needs /proc/kpageflags (root)";
    constexpr size_t kHuge = 2u << 20;
    const size_t page = pageSize();
    void* base = ::mmap(nullptr, 3 * kHuge, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    ASSERT_NE(base, MAP_FAILED);
    auto* aligned = reinterpret_cast<volatile char*>((reinterpret_cast<uintptr_t>(base) + kHuge - 1) & ~(kHuge - 1));
    ::madvise(const_cast<char*>(aligned), kHuge, MADV_HUGEPAGE);
    const size_t pages = kHuge / page + 8;
    char sink = 0;
    for (size_t i = 0; i < pages; ++i) sink = static_cast<char>(sink + aligned[i * page]);
    aligned[kHuge + 4 * page] = sink;  // one page written among the read ones

    // Of the test itself, not of the child.
    std::shared_ptr<HTTaskPort> task;
    ASSERT_EQ(platform_.task_for_pid(::getpid(), &task), KERN_SUCCESS);
    kern_return_t result;
    walk(platform_, *task, result);
    const auto start = reinterpret_cast<uint64_t>(aligned);
    // Asked alone, and after a scan of the mapping's populated pages, which
    // answers whether the mapping holds zero pages on its way.
    std::vector<int32_t> answers = dispositions(platform_, *task, start, pages, result);
    ASSERT_EQ(result, KERN_SUCCESS);
    std::vector<HTPageRun> runs;
    platform_.populatedRuns(*task, reinterpret_cast<uint64_t>(base), reinterpret_cast<uint64_t>(base) + 3 * kHuge,
                            runs);
    EXPECT_EQ(dispositions(platform_, *task, start, pages, result), answers);

    int pagemap = ::open("/proc/self/pagemap", O_RDONLY | O_CLOEXEC);
    int kpageflags = ::open("/proc/kpageflags", O_RDONLY | O_CLOEXEC);
    ASSERT_GE(pagemap, 0);
    ASSERT_GE(kpageflags, 0);
    constexpr uint64_t kZeroPageFlag = uint64_t{1} << 24;
    for (size_t i = 0; i < pages; ++i) {
        uint64_t entry = 0;
        uint64_t flags = 0;
        ASSERT_EQ(::pread(pagemap, &entry, sizeof(entry), static_cast<off_t>((start / page + i) * sizeof(entry))),
                  static_cast<ssize_t>(sizeof(entry)));
        uint64_t frame = entry & ((uint64_t{1} << 55) - 1);
        ASSERT_EQ(::pread(kpageflags, &flags, sizeof(flags), static_cast<off_t>(frame * sizeof(flags))),
                  static_cast<ssize_t>(sizeof(flags)));
        int32_t present = VM_PAGE_QUERY_PAGE_PRESENT;
        if ((flags & kZeroPageFlag) != 0)
            EXPECT_EQ(answers[i] & ~VM_PAGE_QUERY_PAGE_EXTERNAL, present) << "zero page " << i;
        else
            EXPECT_EQ(answers[i], present | VM_PAGE_QUERY_PAGE_DIRTY) << "page " << i;
    }
    ::close(pagemap);
    ::close(kpageflags);
    ::munmap(base, 3 * kHuge);
}

TEST_F(HTLinuxAddressSpace, ZombieAndReapedChildAnswerAsExited)
{
    // Parsed and with its pagemap open while the child lives.
    ASSERT_FALSE(regions_.empty());
    kern_return_t result;
    dispositions(platform_, *task_, layout_.touched, 1, result);
    ASSERT_EQ(result, KERN_SUCCESS);
    rusage_info_v4 usage{};
    ASSERT_EQ(platform_.proc_pid_rusage(child_.pid(), RUSAGE_INFO_V4, &usage), 0);

    const int32_t pid = child_.pid();
    ::kill(pid, SIGCONT);
    ASSERT_TRUE(child_.waitForZombie());
    for (bool reaped : {false, true}) {
        if (reaped) child_.reap();
        SCOPED_TRACE(reaped ? "reaped" : "zombie");
        EXPECT_TRUE(walk(platform_, *task_, result).empty());
        EXPECT_EQ(result, MACH_SEND_INVALID_DEST);
        dispositions(platform_, *task_, layout_.touched, 1, result);
        EXPECT_EQ(result, KERN_INVALID_ARGUMENT);
        errno = 0;
        EXPECT_EQ(platform_.proc_pid_rusage(pid, RUSAGE_INFO_V4, &usage), -1);
        EXPECT_EQ(errno, ESRCH);
    }
    // Later look-ups do not answer from the mappings read while it lived.
    uint64_t address = 0x1000;
    uint64_t size = 0;
    uint32_t count = VM_REGION_BASIC_INFO_COUNT_64;
    vm_region_basic_info_64 basic{};
    EXPECT_EQ(platform_.mach_vm_region(*task_, &address, &size, &basic, &count), MACH_SEND_INVALID_DEST);
    ledger_entry_info entry{};
    int entries = 1;
    EXPECT_EQ(platform_.ledger_entries(pid, &entry, &entries), -1);
}

TEST_F(HTLinuxAddressSpace, PhysicalHeftPageTableLedgerAndPaths)
{
    rusage_info_v4 usage{};
    ASSERT_EQ(platform_.proc_pid_rusage(child_.pid(), RUSAGE_INFO_V4, &usage), 0);
    // At least the pages the child wrote and locked (its lazily freed pages
    // may or may not still count), and some page tables.
    EXPECT_GE(usage.ri_phys_heft, (kTouchedPages + kLockedPages) * pageSize());
    EXPECT_GE(usage.ri_lifetime_max_phys_heft, usage.ri_phys_heft);

    std::vector<ledger_template_info> names(80);
    int count = static_cast<int>(names.size());
    ASSERT_EQ(platform_.ledger_template(names.data(), &count), 0);
    ASSERT_EQ(count, 1);
    EXPECT_STREQ(names[0].lti_name, "page_table");
    std::vector<ledger_entry_info> entries(static_cast<size_t>(count));
    ASSERT_EQ(platform_.ledger_entries(child_.pid(), entries.data(), &count), 0);
    ASSERT_EQ(count, 1);
    // Page tables come in whole pages; the child has at least one.
    EXPECT_GT(entries[0].lei_balance, 0);
    EXPECT_EQ(entries[0].lei_balance % static_cast<int64_t>(pageSize()), 0);
    EXPECT_LT(static_cast<uint64_t>(entries[0].lei_balance), usage.ri_phys_heft);

    std::optional<std::string> resolved = platform_.realpath("/tmp/.." + filePath_);
    EXPECT_EQ(resolved, std::optional<std::string>(filePath_));
    EXPECT_EQ(platform_.realpath(filePath_ + ".missing"), std::nullopt);
}

TEST(HTLinuxAddressSpaceExit, ProcessKilledWhileItsMappingsAreReadIsNeverWhole)
{
    // Tens of thousands of mappings take the kernel milliseconds to list;
    // a kill lands in the middle of the listing, and the text then ends
    // early without an error. Whatever the moment of the kill, the walk
    // either has every mapping or says that the process exited.
    constexpr size_t kMappings = 30000;
    const size_t page = pageSize();
    for (int delayMs : {1, 3, 6, 10, 20}) {
        SCOPED_TRACE("kill after " + std::to_string(delayMs) + " ms");
        int ready[2];
        ASSERT_EQ(::pipe(ready), 0);
        HTTestChild child = HTTestChild::fork([&] {
            // Every other page inaccessible: no two mappings can merge.
            auto* base = static_cast<char*>(
                ::mmap(nullptr, 2 * kMappings * page, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
            if (base == MAP_FAILED) return 1;
            for (size_t i = 0; i < kMappings; ++i)
                if (::mprotect(base + 2 * i * page, page, PROT_READ) != 0) return 2;
            char byte = 1;
            if (::write(ready[1], &byte, 1) != 1) return 3;
            ::pause();
            return 0;
        });
        ::close(ready[1]);
        char byte = 0;
        ASSERT_EQ(::read(ready[0], &byte, 1), 1);
        ::close(ready[0]);

        HTLinuxPlatform platform;
        std::shared_ptr<HTTaskPort> task;
        ASSERT_EQ(platform.task_for_pid(child.pid(), &task), KERN_SUCCESS);
        std::thread killer([&] {
            std::this_thread::sleep_for(std::chrono::milliseconds(delayMs));
            ::kill(child.pid(), SIGKILL);
        });
        kern_return_t result = KERN_SUCCESS;
        std::vector<WalkedRegion> regions = walk(platform, *task, result);
        killer.join();
        if (result == MACH_SEND_INVALID_DEST)
            EXPECT_TRUE(regions.empty()) << regions.size() << " regions of a process said to have exited";
        else
            EXPECT_GT(regions.size(), kMappings) << "result " << result;
    }
}
