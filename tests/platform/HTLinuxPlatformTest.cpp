#include "platform/linux/HTLinuxPlatform.h"
#include "platform/linux/HTLinuxTaskPort.h"
#include "platform/linux/HTPageQueryChunk.h"
#include "platform/linux/HTProcBuffer.h"
#include "support/HTLayoutChild.h"

#include <gtest/gtest.h>

#include <fstream>
#include <tuple>

#include <algorithm>
#include <chrono>
#include <optional>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <thread>
#include <type_traits>
#include <utility>

namespace {

// The argument area of a process; empty, with errno, on failure.
std::string procArgs(HTPlatform& platform, int32_t pid)
{
    int name[3] = {CTL_KERN, KERN_PROCARGS2, pid};
    std::vector<char> area(1 << 20);
    size_t length = area.size();
    if (platform.sysctl(name, 3, area.data(), &length, nullptr, 0) != 0) return {};
    return std::string(area.data(), length);
}

// What proc_pidinfo returns for the full or the short record, errno cleared before.
template<class Record>
int pidinfo(HTPlatform& platform, int32_t pid, Record& record)
{
    errno = 0;
    const int flavor = std::is_same_v<Record, proc_bsdinfo> ? PROC_PIDTBSDINFO : PROC_PIDT_SHORTBSDINFO;
    return platform.proc_pidinfo(pid, flavor, 0, &record, sizeof(record));
}

const uint64_t kPage = static_cast<uint64_t>(::sysconf(_SC_PAGESIZE));
constexpr int32_t kPresent = VM_PAGE_QUERY_PAGE_PRESENT, kDirty = VM_PAGE_QUERY_PAGE_DIRTY,
                  kExternal = VM_PAGE_QUERY_PAGE_EXTERNAL, kReusable = VM_PAGE_QUERY_PAGE_REUSABLE;

struct WalkedRegion {
    uint64_t start, size;
    vm_region_submap_info_64 info;
};

// The whole address space as the walk sees it; `result` ends the walk.
std::vector<WalkedRegion> walk(HTPlatform& platform, HTTaskPort& task, kern_return_t& result)
{
    std::vector<WalkedRegion> regions;
    for (uint64_t address = 0;;) {
        uint64_t size = 0;
        uint32_t depth = 0xFFFFFFFF, count = VM_REGION_SUBMAP_INFO_COUNT_64;
        vm_region_submap_info_64 info{};
        result = platform.mach_vm_region_recurse(task, &address, &size, &depth, &info, &count);
        if (result != KERN_SUCCESS) return regions;
        EXPECT_TRUE(depth == 0xFFFFFFFF && count == VM_REGION_SUBMAP_INFO_COUNT_64) << depth << " " << count;
        regions.push_back({address, size, info});
        address += size;
    }
}

std::vector<int32_t> dispositions(HTPlatform& platform, HTTaskPort& task, uint64_t start, uint64_t pages,
                                  kern_return_t& result)
{
    std::vector<int32_t> answer(pages, -1);
    uint64_t count = pages;
    result = platform.mach_vm_page_range_query(task, start, pages * kPage, answer.data(), &count);
    EXPECT_TRUE(result != KERN_SUCCESS || count == pages);
    return answer;
}

bool pageFlagsReadable() { return ::access("/proc/kpageflags", R_OK) == 0; }

// Enough freed pages that the kernel's per-CPU batch cannot hold them all back from LazyFree.
constexpr uint64_t kTouched = 16, kFreed = 64, kFilePages = 4, kFileWritten = 3;

// A child with written and lazily freed anonymous memory, and a shared file mapping partly written.
class HTLinuxAddressSpace : public testing::Test {
protected:
    void SetUp() override
    {
        char pattern[] = "/tmp/heft-walk-XXXXXX";
        int fd = ::mkstemp(pattern);
        ASSERT_GE(fd, 0);
        filePath_ = pattern;
        ASSERT_EQ(::ftruncate(fd, static_cast<off_t>(kFilePages * kPage)), 0);
        ::close(fd);
        auto bytes = [](uint64_t pages) { return std::to_string(pages * kPage); };
        child_.emplace(std::vector<std::string>{"anon", bytes(kTouched), "free", bytes(kFreed), "file", filePath_,
                                                bytes(kFilePages), bytes(kFileWritten)});
        ASSERT_TRUE(child_->ready());
        ASSERT_EQ(platform_.task_for_pid(child_->pid(), &task_), KERN_SUCCESS);
        regions_ = walk(platform_, *task_, result_);
    }
    void TearDown() override
    {
        child_.reset();
        if (!filePath_.empty()) ::unlink(filePath_.c_str());
    }
    uint64_t at(size_t directive) const { return child_->value(directive); }

    std::string filePath_;
    std::optional<HTLayoutChild> child_;
    HTLinuxPlatform platform_;
    std::shared_ptr<HTTaskPort> task_;
    std::vector<WalkedRegion> regions_;
    kern_return_t result_ = KERN_SUCCESS;
};

}  // namespace

TEST_F(HTLinuxAddressSpace, WalkAndPageQueryFindTheChildsMemory)
{
    // The regions' figures are the end-to-end tests'; here, how the walk ends and the page answers.
    EXPECT_EQ(result_, KERN_INVALID_ADDRESS);
    ASSERT_GT(regions_.size(), 5u);
    for (size_t i = 1; i < regions_.size(); ++i)
        EXPECT_GE(regions_[i].start, regions_[i - 1].start + regions_[i - 1].size) << "regions overlap or go back";

    // The touched pages between two inaccessible ones; a query longer than one chunk of pagemap answers the
    // same and writes nothing past the pages asked for.
    std::vector<int32_t> expected(kTouched + 2, kPresent | kDirty);
    expected.front() = expected.back() = 0;
    const uint64_t longQuery = HTPageQueryChunk::kPages + kTouched + 2;
    std::vector<int32_t> answer(longQuery + HTPageQueryChunk::kPages, -1);
    for (uint64_t pages : {kTouched + 2, longQuery}) {
        uint64_t count = pages;
        ASSERT_EQ(platform_.mach_vm_page_range_query(*task_, at(0) - kPage, pages * kPage, answer.data(), &count),
                  KERN_SUCCESS);
        EXPECT_EQ(count, pages);
        EXPECT_TRUE(std::equal(expected.begin(), expected.end(), answer.begin())) << pages << " pages";
    }
    EXPECT_EQ(std::count(answer.begin() + longQuery, answer.end(), -1), HTPageQueryChunk::kPages);
    // The file's written pages present and external, the last not (well within the 30 s before write-back).
    kern_return_t result;
    std::vector<int32_t> pages = dispositions(platform_, *task_, at(2), kFilePages, result);
    ASSERT_EQ(result, KERN_SUCCESS);
    for (uint64_t i = 0; i < kFileWritten; ++i)
        EXPECT_EQ(pages[i] & (kPresent | kExternal | kReusable), kPresent | kExternal);
    EXPECT_EQ(pages[kFileWritten], 0);
    // The written pages are one populated run, whose pages a shared file mapping leaves to be asked one by one.
    std::vector<HTPageRun> runs;
    platform_.populatedRuns(*task_, at(2), at(2) + kFilePages * kPage, runs);
    ASSERT_EQ(runs.size(), 1u);
    EXPECT_EQ(std::tuple(runs[0].start, runs[0].end, runs[0].disposition),
              std::tuple(at(2), at(2) + kFileWritten * kPage, 0));
    // Runs hold populated pages only, also across the gaps between mappings.
    const uint64_t low = std::min(at(0), at(2)), high = std::max(at(0), at(2)) + kTouched * kPage;
    platform_.populatedRuns(*task_, low, high, runs);
    for (const HTPageRun& run : runs) {
        pages = dispositions(platform_, *task_, run.start, (run.end - run.start) / kPage, result);
        EXPECT_EQ(std::count(pages.begin(), pages.end(), 0), 0) << std::hex << run.start << "-" << run.end;
    }
    EXPECT_EQ(platform_.realpath("/tmp/.." + filePath_), std::optional<std::string>(filePath_));
    EXPECT_EQ(platform_.realpath(filePath_ + ".missing"), std::nullopt);
    // Mapped files are named; anonymous memory and pseudo-paths such as "[stack]" are not.
    char name[PATH_MAX];
    ASSERT_EQ(platform_.proc_regionfilename(*task_, at(2), name, sizeof(name)), static_cast<int>(filePath_.size()));
    EXPECT_EQ(std::string(name, filePath_.size()), filePath_);
    EXPECT_EQ(platform_.proc_regionfilename(*task_, at(0), name, sizeof(name)), 0);
    std::ifstream maps("/proc/" + std::to_string(child_->pid()) + "/maps");
    std::string line;
    while (std::getline(maps, line) && line.find("[stack]") == std::string::npos) continue;
    ASSERT_NE(line.find("[stack]"), std::string::npos);
    EXPECT_EQ(platform_.proc_regionfilename(*task_, std::stoull(line, nullptr, 16), name, sizeof(name)), 0);

    // Page identities are asked for page-aligned ranges inside the address space only.
    uint64_t identities[2] = {7, 7};
    EXPECT_EQ(platform_.sharedPageIdentities(*task_, at(0) + 1, 1, identities), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(platform_.sharedPageIdentities(*task_, at(0), UINT64_MAX / 2, identities), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(platform_.sharedPageIdentities(*task_, at(0), 2, nullptr), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(platform_.sharedPageIdentities(*task_, at(0), 2, identities), KERN_SUCCESS);

    // Lazily freed pages are reusable: at least those the walk counted (the kernel may since have let more out
    // of its per-CPU batch), the others dirty.
    if (!pageFlagsReadable()) GTEST_SKIP() << "reusable pages show in page queries only with /proc/kpageflags (root)";
    auto freed = std::find_if(regions_.begin(), regions_.end(), [&](const auto& r) { return r.start == at(1); });
    ASSERT_NE(freed, regions_.end());
    if (freed->info.pages_reusable == 0) GTEST_SKIP() << "the kernel reports no LazyFree pages";
    pages = dispositions(platform_, *task_, at(1), kFreed, result);
    EXPECT_GE(std::count(pages.begin(), pages.end(), kPresent | kReusable), freed->info.pages_reusable);
    EXPECT_EQ(std::count(pages.begin(), pages.end(), kPresent | kReusable) +
                  std::count(pages.begin(), pages.end(), kPresent | kDirty),
              kFreed);
}

TEST_F(HTLinuxAddressSpace, ZombieAndReapedChildAnswerAsGone)
{
    // Parsed and with its pagemap open while the child lives.
    kern_return_t result;
    dispositions(platform_, *task_, at(0), 1, result);
    ASSERT_EQ(result, KERN_SUCCESS);
    const int32_t pid = child_->pid();
    ::kill(pid, SIGKILL);
    ASSERT_TRUE(child_->waitForExit());
    rusage_info_v4 usage{};
    for (bool reaped : {false, true}) {
        if (reaped) child_->reap();
        SCOPED_TRACE(reaped ? "reaped" : "zombie");
        EXPECT_TRUE(walk(platform_, *task_, result).empty());
        EXPECT_EQ(result, MACH_SEND_INVALID_DEST);
        dispositions(platform_, *task_, at(0), 1, result);
        EXPECT_EQ(result, KERN_INVALID_ARGUMENT);
        errno = 0;
        EXPECT_EQ(platform_.proc_pid_rusage(pid, RUSAGE_INFO_V4, &usage), -1);
        EXPECT_EQ(errno, ESRCH);
        EXPECT_FALSE(platform_.forEachTaskImage(*task_, 0, [](const HTPlatformImage&) {}));
        proc_bsdshortinfo brief{};
        EXPECT_EQ(pidinfo(platform_, pid, brief), reaped ? 0 : static_cast<int>(sizeof(brief)));
        EXPECT_EQ(reaped ? errno : static_cast<int>(brief.pbsi_status), reaped ? ESRCH : SZOMB);
        errno = 0;
        EXPECT_EQ(procArgs(platform_, pid), "");
        EXPECT_EQ(errno, reaped ? ESRCH : ENOENT) << "a zombie has no executable any more";
    }
    proc_bsdinfo full{};
    EXPECT_EQ(pidinfo(platform_, pid, full), 0);
    EXPECT_EQ(errno, ESRCH);
    std::shared_ptr<HTTaskPort> gone;
    EXPECT_EQ(platform_.task_for_pid(pid, &gone), HT_KERN_ERRNO_BASE | ESRCH);
    EXPECT_EQ(gone, nullptr);
    // Later look-ups do not answer from the mappings read while it lived.
    uint64_t address = 0x1000, size = 0;
    uint32_t count = VM_REGION_BASIC_INFO_COUNT_64;
    vm_region_basic_info_64 basic{};
    EXPECT_EQ(platform_.mach_vm_region(*task_, &address, &size, &basic, &count), MACH_SEND_INVALID_DEST);
    ledger_entry_info entry{};
    int entries = 1;
    EXPECT_EQ(platform_.ledger_entries(pid, &entry, &entries), -1);
}

TEST(HTLinuxAddressSpaceExit, ProcessKilledWhileItsMappingsAreReadIsNeverWhole)
{
    // A kill lands while the kernel lists tens of thousands of mappings, and the text ends early without an
    // error: whatever the moment, the walk has every mapping or says that the process exited.
    constexpr size_t kMappings = 30000;
    for (int delayMs : {1, 3, 6, 10, 20}) {
        SCOPED_TRACE("kill after " + std::to_string(delayMs) + " ms");
        HTLayoutChild child({"mappings", std::to_string(kMappings)});
        ASSERT_TRUE(child.ready());
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

TEST(HTLinuxAddressSpaceOfItself, PagesOnlyReadAgreeWithTheKernelsPageFlags)
{
    // Memory only read holds the (huge) zero page or a page of its own; the answers must be what the page's
    // flags say: zero pages are present but cost nothing, other pages are dirty. Asked of the test itself.
    if (!pageFlagsReadable()) GTEST_SKIP() << "needs /proc/kpageflags (root)";
    HTLinuxPlatform platform;
    constexpr uint64_t kHuge = 2u << 20;
    void* base = ::mmap(nullptr, 3 * kHuge, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    ASSERT_NE(base, MAP_FAILED);
    auto* aligned = reinterpret_cast<volatile char*>((reinterpret_cast<uintptr_t>(base) + kHuge - 1) & ~(kHuge - 1));
    ::madvise(const_cast<char*>(aligned), kHuge, MADV_HUGEPAGE);
    const uint64_t pages = kHuge / kPage + 8;
    char sink = 0;
    for (uint64_t i = 0; i < pages; ++i) sink = static_cast<char>(sink + aligned[i * kPage]);
    aligned[kHuge + 4 * kPage] = sink;  // one page written among the read ones

    std::shared_ptr<HTTaskPort> task;
    ASSERT_EQ(platform.task_for_pid(::getpid(), &task), KERN_SUCCESS);
    kern_return_t result;
    walk(platform, *task, result);
    const auto start = reinterpret_cast<uint64_t>(aligned);
    // Asked alone, and after a scan of populated pages, which learns whether the mapping holds zero pages.
    std::vector<int32_t> answers = dispositions(platform, *task, start, pages, result);
    ASSERT_EQ(result, KERN_SUCCESS);
    std::vector<HTPageRun> runs;
    platform.populatedRuns(*task, reinterpret_cast<uint64_t>(base), reinterpret_cast<uint64_t>(base) + 3 * kHuge, runs);
    EXPECT_EQ(dispositions(platform, *task, start, pages, result), answers);

    int pagemap = ::open("/proc/self/pagemap", O_RDONLY | O_CLOEXEC);
    int kpageflags = ::open("/proc/kpageflags", O_RDONLY | O_CLOEXEC);
    ASSERT_GE(std::min(pagemap, kpageflags), 0);
    for (uint64_t i = 0; i < pages; ++i) {
        uint64_t entry = 0, flags = 0;
        ASSERT_EQ(::pread(pagemap, &entry, 8, static_cast<off_t>((start / kPage + i) * 8)), 8);
        ASSERT_EQ(::pread(kpageflags, &flags, 8, static_cast<off_t>((entry & ((uint64_t{1} << 55) - 1)) * 8)), 8);
        if ((flags & (uint64_t{1} << 24)) != 0)  // the zero page
            EXPECT_EQ(answers[i] & ~kExternal, kPresent) << "zero page " << i;
        else
            EXPECT_EQ(answers[i], kPresent | kDirty) << "page " << i;
    }
    ::close(pagemap);
    ::close(kpageflags);
    ::munmap(base, 3 * kHuge);
}

TEST(HTLinuxPlatform, ListingHoldsKernelAndProcessesButNoKernelThreads)
{
    HTLinuxPlatform platform;
    int bound = platform.proc_listallpids(nullptr, 0);
    ASSERT_GT(bound, 0);
    std::vector<int32_t> pids(static_cast<size_t>(bound) + 20);
    int count = platform.proc_listallpids(pids.data(), static_cast<int>(pids.size() * sizeof(int32_t)));
    ASSERT_GT(count, 0);
    EXPECT_LE(count, bound + 20);
    pids.resize(static_cast<size_t>(count));
    EXPECT_EQ(pids.front(), 0);
    EXPECT_EQ(std::count(pids.begin(), pids.end(), ::getpid()), 1);
    EXPECT_EQ(std::count(pids.begin(), pids.end(), ::getppid()), 1);

    // A buffer with room for two pids gets two.
    int32_t two[3] = {-1, -1, -1};
    EXPECT_EQ(platform.proc_listallpids(two, 2 * sizeof(int32_t)), 2);
    EXPECT_EQ(two[0], 0);
    EXPECT_EQ(two[2], -1);

    // Outside a pid namespace, pid 2 is kthreadd, parent of every kernel thread.
    HTProcBuffer stat;
    if (!stat.readFile(AT_FDCWD, "/proc/2/stat") || !stat.view().starts_with("2 (kthreadd) "))
        GTEST_SKIP() << "no kernel threads visible here";
    EXPECT_EQ(std::count(pids.begin(), pids.end(), 2), 0);
    proc_bsdinfo info{};
    EXPECT_EQ(pidinfo(platform, 2, info), 0);
    EXPECT_EQ(errno, ESRCH);
}

TEST(HTLinuxPlatform, ArgumentAreaSizeAndShortBuffer)
{
    HTLinuxPlatform platform;
    int argmaxName[2] = {CTL_KERN, KERN_ARGMAX};
    int32_t argmax = 0;
    size_t length = sizeof(argmax);
    ASSERT_EQ(platform.sysctl(argmaxName, 2, &argmax, &length, nullptr, 0), 0);
    EXPECT_GE(argmax, 4096);
    EXPECT_LE(argmax, 1 << 20);

    // The area itself is in every end-to-end run; here its size, and a buffer too small for the path.
    std::string area = procArgs(platform, ::getpid());
    ASSERT_GT(area.size(), 8u);
    int name[3] = {CTL_KERN, KERN_PROCARGS2, ::getpid()};
    size_t needed = 0;
    ASSERT_EQ(platform.sysctl(name, 3, nullptr, &needed, nullptr, 0), 0);
    EXPECT_EQ(needed, area.size());
    char small[8];
    length = sizeof(small);
    errno = 0;
    EXPECT_EQ(platform.sysctl(name, 3, small, &length, nullptr, 0), -1);
    EXPECT_EQ(errno, ENOMEM);
    EXPECT_EQ(procArgs(platform, 0), "") << "the kernel has no argument area";
}

TEST(HTLinuxPlatform, OtherUsersProcessesNeedTheRightToTrace)
{
    // Unprivileged, another user's executable and maps are closed (EACCES); the record stays readable.
    auto check = [](int32_t target) -> int {
        HTLinuxPlatform platform;
        int failures = 0;
        errno = 0;
        if (!procArgs(platform, target).empty() || errno != EACCES) failures |= 1;
        std::shared_ptr<HTTaskPort> task;
        if (platform.task_for_pid(target, &task) != (HT_KERN_ERRNO_BASE | EACCES)) failures |= 2;
        proc_bsdinfo info{};
        if (pidinfo(platform, target, info) != sizeof(info)) failures |= 4;
        return failures;
    };
    int failures = -1;
    if (::geteuid() != 0) {
        struct stat init {};
        if (::stat("/proc/1", &init) != 0 || init.st_uid == ::geteuid())
            GTEST_SKIP() << "needs root, or a pid 1 of another user";
        failures = check(1);
    } else {
        // A thread gives up root (bare system calls change that thread alone) and looks at a child that kept it.
        HTLayoutChild child({});
        ASSERT_TRUE(child.ready());
        std::thread([&] {
            if (::syscall(SYS_setresgid, 65534, 65534, 65534) == 0 &&
                ::syscall(SYS_setresuid, 65534, 65534, 65534) == 0)
                failures = check(child.pid());
        }).join();
    }
    EXPECT_EQ(failures, 0) << "1: argument area, 2: task port, 4: record";
}

TEST(HTLinuxPlatform, TaskPortAndSettings)
{
    HTLinuxPlatform platform;
    std::shared_ptr<HTTaskPort> task;
    ASSERT_EQ(platform.task_for_pid(::getpid(), &task), KERN_SUCCESS);
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(task.get());
    ASSERT_NE(linuxTask, nullptr);
    EXPECT_EQ(linuxTask->pid(), ::getpid());
    // A handle on a process of the same pid that started at another time (the pid recycled) opens nothing.
    ASSERT_TRUE(linuxTask->startTime());
    HTLinuxTaskPort recycled(::getpid(), *linuxTask->startTime() + 1);
    errno = 0;
    EXPECT_FALSE(recycled.openDirectory());
    EXPECT_EQ(errno, ESRCH);

    task.reset();
    EXPECT_NE(platform.task_for_pid(0, &task), KERN_SUCCESS);
    EXPECT_EQ(task, nullptr);
    EXPECT_EQ(platform.mach_error_string(MACH_SEND_INVALID_DEST), "process is gone");
    int32_t value = -1;
    size_t length = sizeof(value);
    for (const char* absent : {"vm.self_region_heft", "vm.get_owned_vmobjects", "kern.nothing"}) {
        errno = 0;
        EXPECT_EQ(platform.sysctlbyname(absent, &value, &length, nullptr, 0), -1) << absent;
        EXPECT_EQ(errno, ENOENT) << absent;
    }
}
