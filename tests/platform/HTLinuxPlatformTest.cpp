#include "platform/linux/HTLinuxPlatform.h"
#include "platform/linux/HTLinuxTaskPort.h"
#include "platform/linux/HTProcBuffer.h"
#include "support/HTLayoutChild.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <thread>
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
    const int flavor = sizeof(Record) == sizeof(proc_bsdinfo) ? PROC_PIDTBSDINFO : PROC_PIDT_SHORTBSDINFO;
    return platform.proc_pidinfo(pid, flavor, 0, &record, sizeof(record));
}

}  // namespace

TEST(HTLinuxPlatform, ChildZombieAndGone)
{
    // A live process's record is in every end-to-end run; here, the ends.
    HTLinuxPlatform platform;
    HTLayoutChild child({"exit"});
    ASSERT_TRUE(child.waitForExit());
    proc_bsdinfo full{};
    proc_bsdshortinfo brief{};
    EXPECT_EQ(pidinfo(platform, child.pid(), brief), static_cast<int>(sizeof(brief)));
    EXPECT_EQ(brief.pbsi_status, SZOMB);
    errno = 0;
    EXPECT_EQ(procArgs(platform, child.pid()), "");
    EXPECT_EQ(errno, ENOENT) << "a zombie has no executable any more";

    const int32_t pid = child.pid();
    child.reap();
    EXPECT_EQ(pidinfo(platform, pid, full), 0);
    EXPECT_EQ(errno, ESRCH);
    EXPECT_EQ(pidinfo(platform, pid, brief), 0);
    EXPECT_EQ(std::exchange(errno, 0), ESRCH);
    EXPECT_EQ(procArgs(platform, pid), "");
    EXPECT_EQ(errno, ESRCH);
    std::shared_ptr<HTTaskPort> task;
    EXPECT_EQ(platform.task_for_pid(pid, &task), HT_KERN_ERRNO_BASE | ESRCH);
    EXPECT_EQ(task, nullptr);
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
