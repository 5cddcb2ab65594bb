#include "base/HTNoticeLog.h"
#include "platform/HTTestChildren.h"
#include "platform/linux/HTLinuxPlatform.h"
#include "platform/linux/HTLinuxTaskPort.h"
#include "process/HTKernelProcess.h"
#include "process/HTProcess.h"
#include "process/HTProcessDiscovery.h"
#include "process/HTUserProcess.h"

#include <gtest/gtest.h>

#include <array>
#include <cstring>
#include <fcntl.h>
#include <set>
#include <string>
#include <vector>

namespace {

// A small tree of forked processes: one child with two children of its
// own, the first of which has one child. Every member waits for the end of
// a lifeline pipe and reaps its own children before it exits, so closing
// the lifeline and reaping the top child takes the whole tree down, and
// nothing is left to the system's init.
class HTTestProcessTree {
public:
    HTTestProcessTree()
    {
        int lifeline[2];
        int report[2];
        if (::pipe2(lifeline, O_CLOEXEC) != 0) return;
        if (::pipe2(report, O_CLOEXEC) != 0) {
            ::close(lifeline[0]);
            ::close(lifeline[1]);
            return;
        }
        lifeline_ = lifeline[1];
        child_ = HTTestChild::fork([&] {
            ::close(lifeline[1]);
            ::close(report[0]);
            pid_t first = ::fork();
            if (first == 0) {
                pid_t grandchild = ::fork();
                if (grandchild == 0) live(lifeline[0]);
                tell(report[1], 2, grandchild);
                live(lifeline[0]);
            }
            tell(report[1], 0, first);
            pid_t second = ::fork();
            if (second == 0) live(lifeline[0]);
            tell(report[1], 1, second);
            live(lifeline[0]);
            return 0;
        });
        ::close(lifeline[0]);
        ::close(report[1]);
        // Three reports; each is sent after its fork returned, so all
        // members exist once they are in.
        for (int i = 0; i < 3; ++i) {
            int32_t message[2];
            if (::read(report[0], message, sizeof(message)) != sizeof(message)) break;
            if (message[0] >= 0 && message[0] < 3) members_[static_cast<size_t>(message[0])] = message[1];
        }
        ::close(report[0]);
    }
    ~HTTestProcessTree()
    {
        if (lifeline_ >= 0) ::close(lifeline_);
        if (child_.valid()) {
            while (::waitpid(child_.pid(), nullptr, 0) < 0 && errno == EINTR) {}
            // Reaped already; keep HTTestChild from signalling a reused pid.
            child_ = HTTestChild();
        }
    }

    pid_t root() const { return child_.pid(); }
    pid_t firstChild() const { return members_[0]; }
    pid_t secondChild() const { return members_[1]; }
    pid_t grandchild() const { return members_[2]; }
    bool complete() const { return child_.valid() && members_[0] > 0 && members_[1] > 0 && members_[2] > 0; }

private:
    [[noreturn]] static void live(int lifeline)
    {
        char byte;
        while (::read(lifeline, &byte, 1) != 0 && errno == EINTR) {}
        while (::wait(nullptr) > 0 || errno == EINTR) {}
        ::_exit(0);
    }
    static void tell(int fd, int32_t role, pid_t pid)
    {
        int32_t message[2] = {role, pid};
        (void)!::write(fd, message, sizeof(message));
    }

    int lifeline_ = -1;
    HTTestChild child_;
    std::array<pid_t, 3> members_{-1, -1, -1};
};

class HTProcessDiscoveryLinux : public testing::Test {
protected:
    void SetUp() override { HTProcess::_clearGlobalErrors(); }
    void TearDown() override { HTProcess::_clearGlobalErrors(); }

    std::shared_ptr<HTPlatform> platform_ = std::make_shared<HTLinuxPlatform>();
    HTProcessDiscovery discovery_{platform_, HTSettings()};
};

}  // namespace

TEST_F(HTProcessDiscoveryLinux, NameSharedByThreeProcessesYieldsAllThree)
{
    HTTestProgramCopy program("/bin/sleep", "heftsleep");
    ASSERT_TRUE(program.ready());
    std::vector<HTTestChild> children;
    for (int i = 0; i < 3; ++i) {
        children.push_back(HTTestChild::exec(program.path(), {program.name(), "600"}));
        ASSERT_TRUE(children.back().valid());
    }
    pid_t gone = htReapedPid();
    std::string goneText = std::to_string(gone);

    std::vector<std::string> errors;
    auto pids = discovery_.pidsForStringDescriptions({program.name(), goneText}, &errors);
    ASSERT_TRUE(pids);
    EXPECT_EQ(pids->size(), 3u);
    for (const auto& child : children) {
        const std::optional<std::string>* description = pids->find(child.pid());
        ASSERT_NE(description, nullptr) << child.pid();
        EXPECT_EQ(*description, program.name());
    }
    ASSERT_EQ(errors.size(), 1u);
    EXPECT_EQ(errors[0], "Unable to find pid for process matching '" + goneText + "'");

    // A pid given as a number maps to no name.
    pids = discovery_.pidsForStringDescriptions({std::to_string(children[1].pid())}, &errors);
    ASSERT_TRUE(pids);
    ASSERT_EQ(pids->size(), 1u);
    EXPECT_EQ(*pids->find(children[1].pid()), std::nullopt);
    EXPECT_TRUE(errors.empty());
}

TEST_F(HTProcessDiscoveryLinux, DescendantsAreFoundGenerationByGeneration)
{
    HTTestProcessTree tree;
    ASSERT_TRUE(tree.complete());
    auto pids = discovery_.childPidsForPids({tree.root()});
    ASSERT_TRUE(pids);
    ASSERT_EQ(pids->size(), 4u);
    EXPECT_EQ((*pids)[0], tree.root());
    EXPECT_EQ((std::set<int32_t>{(*pids)[1], (*pids)[2]}), (std::set<int32_t>{tree.firstChild(), tree.secondChild()}));
    EXPECT_EQ((*pids)[3], tree.grandchild());

    // A leaf yields just itself.
    pids = discovery_.childPidsForPids({tree.grandchild()});
    ASSERT_TRUE(pids);
    EXPECT_EQ(*pids, std::vector<int32_t>{tree.grandchild()});
}

TEST_F(HTProcessDiscoveryLinux, ProcessWithPidMakesUserAndKernelProcesses)
{
    HTTestProgramCopy program("/bin/sleep", "heftnamed");
    ASSERT_TRUE(program.ready());
    HTTestChild child = HTTestChild::exec(program.path(), {program.name(), "600"});
    ASSERT_TRUE(child.valid());

    auto process = discovery_.processWithPid(child.pid());
    ASSERT_NE(process, nullptr);
    auto* user = dynamic_cast<HTUserProcess*>(process.get());
    ASSERT_NE(user, nullptr);
    EXPECT_EQ(user->pid(), child.pid());
    EXPECT_EQ(user->name(), program.name());
    EXPECT_TRUE(user->is64bit());
    // Linux has no idle-exit control.
    EXPECT_EQ(user->idleExitStatus(), HTIdleExitStatusNotControlled);
    auto* task = dynamic_cast<HTLinuxTaskPort*>(user->task().get());
    ASSERT_NE(task, nullptr);
    EXPECT_EQ(task->pid(), child.pid());

    auto kernel = discovery_.processWithPid(0);
    ASSERT_NE(kernel, nullptr);
    EXPECT_NE(dynamic_cast<HTKernelProcess*>(kernel.get()), nullptr);
    EXPECT_EQ(kernel->name(), "kernel");
    EXPECT_EQ(kernel->idleExitStatus(), HTIdleExitStatusNotControlled);

    EXPECT_EQ(discovery_.processWithPid(htReapedPid()), nullptr);
    EXPECT_TRUE(HTProcess::globalErrors().empty());

    // Processes heft may not read are reported on standard error; that is
    // not what this test looks at.
    testing::internal::CaptureStderr();
    auto all = discovery_.allProcessesExcludingPids({::getpid()});
    testing::internal::GetCapturedStderr();
    ASSERT_TRUE(all);
    EXPECT_TRUE(all->contains(0));
    EXPECT_TRUE(all->contains(child.pid()));
    EXPECT_FALSE(all->contains(::getpid()));
}

TEST_F(HTProcessDiscoveryLinux, ProcessGoneBeforeItsTaskOpensIsAGlobalError)
{
    // The record is taken while the child is a zombie; by the time the
    // process object opens it, it has been reaped.
    HTTestChild child = HTTestChild::fork([] { return 0; });
    ASSERT_TRUE(child.valid());
    ASSERT_TRUE(child.waitForZombie());
    proc_bsdinfo info{};
    ASSERT_EQ(platform_->proc_pidinfo(child.pid(), PROC_PIDTBSDINFO, 0, &info, sizeof(info)), (int)sizeof(info));
    int32_t pid = child.pid();
    child.reap();

    HTNoticeLog::standardError().take();
    EXPECT_EQ(discovery_.processWithBsdInfo(info), nullptr);
    EXPECT_EQ(HTNoticeLog::standardError().take(),
              std::vector<std::string>{std::string(info.pbi_name) + " [" + std::to_string(pid) +
                                       "]: exited before it could be opened; not measured"});
    EXPECT_EQ(HTProcess::globalErrors(),
              std::vector<std::string>{"task_for_pid [" + std::to_string(pid) + "] " + std::strerror(ESRCH)});
}
