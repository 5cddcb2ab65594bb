#include "platform/linux/HTLinuxPlatform.h"
#include "platform/HTTestChildren.h"
#include "platform/linux/HTLinuxTaskPort.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatParser.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <climits>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <thread>
#include <utility>
#include <vector>

namespace {

std::string field(const char* chars, size_t capacity) { return std::string(chars, strnlen(chars, capacity)); }

std::vector<int32_t> listAll(HTPlatform& platform)
{
    int bound = platform.proc_listallpids(nullptr, 0);
    EXPECT_GT(bound, 0);
    std::vector<int32_t> pids(static_cast<size_t>(bound) + 20);
    int count = platform.proc_listallpids(pids.data(), static_cast<int>(pids.size() * sizeof(int32_t)));
    EXPECT_GT(count, 0);
    EXPECT_LE(count, bound + 20);
    pids.resize(static_cast<size_t>(std::max(count, 0)));
    return pids;
}

// Waits until the main thread of `pid` is a zombie; false after a second.
bool waitForMainThreadExit(int32_t pid)
{
    HTProcBuffer stat;
    const std::string path = "/proc/" + std::to_string(pid) + "/stat";
    for (int tries = 0; tries < 1000; ::usleep(1000), ++tries) {
        std::optional<HTProcStat> parsed;
        if (stat.readFile(AT_FDCWD, path.c_str())) parsed = htParseProcStat(stat.view());
        if (parsed && parsed->state == 'Z') return true;
    }
    return false;
}

bool contains(const std::vector<int32_t>& pids, int32_t pid)
{
    return std::find(pids.begin(), pids.end(), pid) != pids.end();
}

// The argument area of a process through the platform; empty with errno
// on failure.
std::string procArgs(HTPlatform& platform, int32_t pid)
{
    int name[3] = {CTL_KERN, KERN_PROCARGS2, pid};
    std::vector<char> area(1 << 20);
    size_t length = area.size();
    if (platform.sysctl(name, 3, area.data(), &length, nullptr, 0) != 0) return {};
    return std::string(area.data(), length);
}

std::string readWhole(const char* path)
{
    HTProcBuffer buffer;
    return buffer.readFile(AT_FDCWD, path) ? std::string(buffer.view()) : std::string();
}

}  // namespace

TEST(HTLinuxPlatform, RecordOfTheTestItselfAndOfTheKernel)
{
    HTLinuxPlatform platform;
    proc_bsdinfo info{};
    ASSERT_EQ(platform.proc_pidinfo(::getpid(), PROC_PIDTBSDINFO, 0, &info, sizeof(info)), (int)sizeof(info));
    EXPECT_EQ(info.pbi_pid, static_cast<uint32_t>(::getpid()));
    EXPECT_EQ(info.pbi_ppid, static_cast<uint32_t>(::getppid()));
    EXPECT_EQ(info.pbi_status, SRUN);  // it is running: it is reading its own record
    EXPECT_EQ(info.pbi_flags & PROC_FLAG_SYSTEM, 0u);
    EXPECT_EQ((info.pbi_flags & PROC_FLAG_LP64) != 0, sizeof(void*) == 8);
    EXPECT_EQ(info.pbi_uid, ::geteuid());
    std::string comm = readWhole("/proc/self/comm");
    ASSERT_FALSE(comm.empty());
    comm.pop_back();
    EXPECT_EQ(field(info.pbi_name, sizeof(info.pbi_name)), comm);
    EXPECT_EQ(field(info.pbi_comm, sizeof(info.pbi_comm)), comm.substr(0, 16));

    proc_bsdshortinfo shortInfo{};
    ASSERT_EQ(platform.proc_pidinfo(::getpid(), PROC_PIDT_SHORTBSDINFO, 1, &shortInfo, sizeof(shortInfo)),
              (int)sizeof(shortInfo));
    EXPECT_EQ(shortInfo.pbsi_ppid, info.pbi_ppid);
    EXPECT_EQ(0, std::memcmp(shortInfo.pbsi_comm, info.pbi_comm, sizeof(info.pbi_comm)));

    proc_bsdinfo kernel{};
    ASSERT_EQ(platform.proc_pidinfo(0, PROC_PIDTBSDINFO, 0, &kernel, sizeof(kernel)), (int)sizeof(kernel));
    EXPECT_EQ(kernel.pbi_pid, 0u);
    EXPECT_EQ(kernel.pbi_ppid, 0u);
    EXPECT_NE(kernel.pbi_flags & PROC_FLAG_SYSTEM, 0u);
    EXPECT_EQ(field(kernel.pbi_name, sizeof(kernel.pbi_name)), "kernel");
}

TEST(HTLinuxPlatform, ChildThroughStoppedLeaderExitedZombieAndGone)
{
    HTLinuxPlatform platform;
    // The child stops itself; once continued its main thread exits while
    // another carries on, until the child is killed. Waiting for each state
    // makes every check below independent of timing.
    HTTestChild child = HTTestChild::fork([] {
        ::raise(SIGSTOP);
        std::thread([] {
            for (;;) ::pause();
        }).detach();
        // The bare system call ends this thread alone, with no unwinding
        // back through the test.
        ::syscall(SYS_exit, 0);
        return 0;
    });
    ASSERT_TRUE(child.valid());
    int status = 0;
    ASSERT_EQ(::waitpid(child.pid(), &status, WUNTRACED), child.pid());
    ASSERT_TRUE(WIFSTOPPED(status));

    proc_bsdinfo info{};
    ASSERT_EQ(platform.proc_pidinfo(child.pid(), PROC_PIDTBSDINFO, 0, &info, sizeof(info)), (int)sizeof(info));
    EXPECT_EQ(info.pbi_pid, static_cast<uint32_t>(child.pid()));
    EXPECT_EQ(info.pbi_ppid, static_cast<uint32_t>(::getpid()));
    EXPECT_EQ(info.pbi_status, SSTOP);
    std::shared_ptr<HTTaskPort> task;
    EXPECT_EQ(platform.task_for_pid(child.pid(), &task), KERN_SUCCESS);
    task.reset();

    // The main thread's stat says zombie, but the process lives, and the
    // live thread has its memory figures.
    ::kill(child.pid(), SIGCONT);
    ASSERT_TRUE(waitForMainThreadExit(child.pid()));
    proc_bsdshortinfo shortInfo{};
    ASSERT_EQ(platform.proc_pidinfo(child.pid(), PROC_PIDT_SHORTBSDINFO, 1, &shortInfo, sizeof(shortInfo)),
              (int)sizeof(shortInfo));
    EXPECT_NE(shortInfo.pbsi_status, SZOMB);
    rusage_info_v4 usage{};
    EXPECT_EQ(platform.proc_pid_rusage(child.pid(), RUSAGE_INFO_V4, &usage), 0);
    EXPECT_GT(usage.ri_phys_heft, 0u);

    ::kill(child.pid(), SIGKILL);
    ASSERT_TRUE(child.waitForZombie());
    ASSERT_EQ(platform.proc_pidinfo(child.pid(), PROC_PIDT_SHORTBSDINFO, 1, &shortInfo, sizeof(shortInfo)),
              (int)sizeof(shortInfo));
    EXPECT_EQ(shortInfo.pbsi_status, SZOMB);
    ASSERT_EQ(platform.proc_pidinfo(child.pid(), PROC_PIDTBSDINFO, 0, &info, sizeof(info)), (int)sizeof(info));
    EXPECT_EQ(info.pbi_status, SZOMB);
    // A zombie has no executable any more.
    errno = 0;
    EXPECT_EQ(procArgs(platform, child.pid()), "");
    EXPECT_EQ(errno, ENOENT);

    int32_t pid = child.pid();
    child.reap();
    errno = 0;
    EXPECT_EQ(platform.proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof(info)), 0);
    EXPECT_EQ(std::exchange(errno, 0), ESRCH);
    EXPECT_EQ(platform.proc_pidinfo(pid, PROC_PIDT_SHORTBSDINFO, 1, &shortInfo, sizeof(shortInfo)), 0);
    EXPECT_EQ(std::exchange(errno, 0), ESRCH);
    EXPECT_EQ(procArgs(platform, pid), "");
    EXPECT_EQ(errno, ESRCH);
    EXPECT_EQ(platform.task_for_pid(pid, &task), HT_KERN_ERRNO_BASE | ESRCH);
    EXPECT_EQ(task, nullptr);
}

TEST(HTLinuxPlatform, ListingHoldsKernelAndProcessesButNoKernelThreads)
{
    HTLinuxPlatform platform;
    std::vector<int32_t> pids = listAll(platform);
    ASSERT_FALSE(pids.empty());
    EXPECT_EQ(pids.front(), 0);
    EXPECT_TRUE(contains(pids, ::getpid()));
    EXPECT_TRUE(contains(pids, ::getppid()));
    EXPECT_EQ(std::count(pids.begin(), pids.end(), ::getpid()), 1);

    // A buffer with room for two pids gets two.
    int32_t two[3] = {-1, -1, -1};
    EXPECT_EQ(platform.proc_listallpids(two, 2 * sizeof(int32_t)), 2);
    EXPECT_EQ(two[0], 0);
    EXPECT_EQ(two[2], -1);

    // Outside a pid namespace, pid 2 is kthreadd, the parent of every
    // kernel thread.
    std::string kthreadd = readWhole("/proc/2/stat");
    if (kthreadd.rfind("2 (kthreadd) ", 0) != 0) GTEST_SKIP() << "no kernel threads visible in this pid namespace";
    EXPECT_FALSE(contains(pids, 2));
    proc_bsdinfo info{};
    errno = 0;
    EXPECT_EQ(platform.proc_pidinfo(2, PROC_PIDTBSDINFO, 0, &info, sizeof(info)), 0);
    EXPECT_EQ(errno, ESRCH);
}

TEST(HTLinuxPlatform, ArgumentAreaOfTheTestItself)
{
    HTLinuxPlatform platform;
    int argmaxName[2] = {CTL_KERN, KERN_ARGMAX};
    int32_t argmax = 0;
    size_t length = sizeof(argmax);
    ASSERT_EQ(platform.sysctl(argmaxName, 2, &argmax, &length, nullptr, 0), 0);
    EXPECT_GE(argmax, 4096);
    EXPECT_LE(argmax, 1 << 20);

    std::string area = procArgs(platform, ::getpid());
    ASSERT_GT(area.size(), 8u);
    char exe[PATH_MAX];
    ssize_t exeLength = ::readlink("/proc/self/exe", exe, sizeof(exe));
    ASSERT_GT(exeLength, 0);
    std::string cmdline = readWhole("/proc/self/cmdline");
    int32_t argc;
    std::memcpy(&argc, area.data(), sizeof(argc));
    EXPECT_EQ(argc, std::count(cmdline.begin(), cmdline.end(), '\0'));
    EXPECT_EQ(std::string(area.c_str() + 4), std::string(exe, static_cast<size_t>(exeLength)));
    EXPECT_TRUE(area.ends_with(cmdline));

    // Asked for its size, then into a buffer too small for the path.
    int name[3] = {CTL_KERN, KERN_PROCARGS2, ::getpid()};
    size_t needed = 0;
    ASSERT_EQ(platform.sysctl(name, 3, nullptr, &needed, nullptr, 0), 0);
    EXPECT_EQ(needed, area.size());
    char small[8];
    length = sizeof(small);
    errno = 0;
    EXPECT_EQ(platform.sysctl(name, 3, small, &length, nullptr, 0), -1);
    EXPECT_EQ(errno, ENOMEM);

    // The kernel has no argument area.
    name[2] = 0;
    EXPECT_EQ(procArgs(platform, 0), "");
}

TEST(HTLinuxPlatform, OtherUsersProcessesNeedTheRightToTrace)
{
    // Unprivileged, another user's executable and memory maps are closed:
    // the failures carry EACCES, while the process record stays readable.
    auto check = [](int32_t target) -> int {
        HTLinuxPlatform platform;
        int failures = 0;
        errno = 0;
        if (!procArgs(platform, target).empty() || errno != EACCES) failures |= 1;
        std::shared_ptr<HTTaskPort> task;
        if (platform.task_for_pid(target, &task) != (HT_KERN_ERRNO_BASE | EACCES)) failures |= 2;
        proc_bsdinfo info{};
        if (platform.proc_pidinfo(target, PROC_PIDTBSDINFO, 0, &info, sizeof(info)) != sizeof(info)) failures |= 4;
        return failures;
    };
    if (::geteuid() != 0) {
        struct stat init {};
        if (::stat("/proc/1", &init) != 0 || init.st_uid == ::geteuid())
            GTEST_SKIP() << "needs root, or a pid 1 of another user";
        EXPECT_EQ(check(1), 0) << "1: argument area, 2: task port, 4: record";
        return;
    }
    // As root: a child that gives up root looks at the test process.
    int32_t parent = ::getpid();
    HTTestChild child = HTTestChild::fork([&] {
        if (::setgid(65534) != 0 || ::setuid(65534) != 0) return 100;
        return check(parent);
    });
    siginfo_t exit{};
    ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(child.pid()), &exit, WEXITED | WNOWAIT), 0);
    EXPECT_EQ(exit.si_code, CLD_EXITED);
    EXPECT_EQ(exit.si_status, 0) << "1: argument area, 2: task port, 4: record";
}

TEST(HTLinuxPlatform, TaskPortOfTheTestItself)
{
    HTLinuxPlatform platform;
    std::shared_ptr<HTTaskPort> task;
    ASSERT_EQ(platform.task_for_pid(::getpid(), &task), KERN_SUCCESS);
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(task.get());
    ASSERT_NE(linuxTask, nullptr);
    EXPECT_EQ(linuxTask->pid(), ::getpid());
    // Between calls the handle holds no descriptor; opened, its directory
    // reads the process's files, and it closes what it opened.
    EXPECT_EQ(linuxTask->procDirFd(), -1);
    int dirFd = -1;
    {
        HTLinuxTaskPort::DirectoryUse directory(*linuxTask);
        dirFd = directory.fd();
        EXPECT_EQ(::faccessat(dirFd, "smaps", R_OK, 0), 0);
    }
    EXPECT_EQ(::fcntl(dirFd, F_GETFD), -1) << "the handle keeps its directory open";

    // A handle on a process of the same pid that started at another time
    // (the pid recycled since) opens nothing.
    ASSERT_TRUE(linuxTask->startTime());
    HTLinuxTaskPort recycled(::getpid(), *linuxTask->startTime() + 1);
    errno = 0;
    EXPECT_FALSE(recycled.openDirectory());
    EXPECT_EQ(errno, ESRCH);

    task.reset();
    EXPECT_NE(platform.task_for_pid(0, &task), KERN_SUCCESS);
    EXPECT_EQ(task, nullptr);

    EXPECT_EQ(platform.mach_error_string(MACH_SEND_INVALID_DEST), "process is gone");
}

TEST(HTLinuxPlatform, NoSettingByName)
{
    HTLinuxPlatform platform;
    int32_t value = -1;
    size_t length = sizeof(value);
    for (const char* absent : {"vm.self_region_heft", "vm.get_owned_vmobjects", "kern.nothing"}) {
        errno = 0;
        EXPECT_EQ(platform.sysctlbyname(absent, &value, &length, nullptr, 0), -1) << absent;
        EXPECT_EQ(errno, ENOENT) << absent;
    }
}
