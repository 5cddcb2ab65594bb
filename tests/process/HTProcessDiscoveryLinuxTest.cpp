#include "base/HTNoticeLog.h"
#include "platform/linux/HTLinuxPlatform.h"
#include "process/HTKernelProcess.h"
#include "process/HTProcess.h"
#include "process/HTProcessDiscovery.h"
#include "process/HTUserProcess.h"
#include "support/HTLayoutChild.h"

#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <set>

namespace {

// The layout program copied under a name of its own, so that the processes
// started from it are the only ones of that name. Removed with the object.
struct HTLayoutProgramCopy {
    explicit HTLayoutProgramCopy(const std::string& stem) : name(stem + "-" + std::to_string(::getpid()))
    {
        std::filesystem::create_directories(directory);
        std::filesystem::copy_file(HEFT_LAYOUT_PROGRAM, path(), std::filesystem::copy_options::overwrite_existing);
    }
    ~HTLayoutProgramCopy() { std::filesystem::remove_all(directory); }
    std::string path() const { return directory + "/" + name; }

    const std::string name, directory = "/tmp/heft-test-" + name;
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
    HTLayoutProgramCopy program("heftnamed");
    HTLayoutChild first({}, HTLayoutChild::kSameUser, program.path()),
        second({}, HTLayoutChild::kSameUser, program.path()), third({}, HTLayoutChild::kSameUser, program.path());
    ASSERT_TRUE(first.ready() && second.ready() && third.ready());
    const std::string gone = std::to_string(HTLayoutChild::reapedPid());

    std::vector<std::string> errors;
    auto pids = discovery_.pidsForStringDescriptions({program.name, gone}, &errors);
    ASSERT_TRUE(pids);
    EXPECT_EQ(pids->size(), 3u);
    for (const HTLayoutChild* child : {&first, &second, &third}) {
        const std::optional<std::string>* description = pids->find(child->pid());
        ASSERT_NE(description, nullptr) << child->pid();
        EXPECT_EQ(*description, program.name);
    }
    EXPECT_EQ(errors, std::vector<std::string>{"Unable to find pid for process matching '" + gone + "'"});

    // A pid given as a number maps to no name.
    pids = discovery_.pidsForStringDescriptions({second.pidString()}, &errors);
    ASSERT_TRUE(pids);
    ASSERT_EQ(pids->size(), 1u);
    EXPECT_EQ(*pids->find(second.pid()), std::nullopt);
    EXPECT_TRUE(errors.empty());

    // Opened by pid, it is a user process, which heft on Linux never skips
    // as idle-exit clean.
    auto process = discovery_.processWithPid(first.pid());
    ASSERT_NE(dynamic_cast<HTUserProcess*>(process.get()), nullptr);
    EXPECT_EQ(process->idleExitStatus(), HTIdleExitStatusNotControlled);
}

TEST_F(HTProcessDiscoveryLinux, DescendantsAreFoundGenerationByGeneration)
{
    HTLayoutChild tree({"tree"});
    ASSERT_TRUE(tree.ready());
    const auto first = static_cast<int32_t>(tree.value(0, 0)), second = static_cast<int32_t>(tree.value(0, 1)),
               grandchild = static_cast<int32_t>(tree.value(0, 2));
    auto pids = discovery_.childPidsForPids({tree.pid()});
    ASSERT_TRUE(pids);
    ASSERT_EQ(pids->size(), 4u);
    EXPECT_EQ((*pids)[0], tree.pid());
    EXPECT_EQ((std::set<int32_t>{(*pids)[1], (*pids)[2]}), (std::set<int32_t>{first, second}));
    EXPECT_EQ((*pids)[3], grandchild);
    pids = discovery_.childPidsForPids({grandchild});
    ASSERT_TRUE(pids);
    EXPECT_EQ(*pids, std::vector<int32_t>{grandchild}) << "a leaf yields just itself";
}

TEST_F(HTProcessDiscoveryLinux, KernelAndAllProcesses)
{
    HTLayoutChild child({});
    ASSERT_TRUE(child.ready());
    auto kernel = discovery_.processWithPid(0);
    ASSERT_NE(dynamic_cast<HTKernelProcess*>(kernel.get()), nullptr);
    EXPECT_EQ(kernel->name(), "kernel");
    EXPECT_EQ(kernel->idleExitStatus(), HTIdleExitStatusNotControlled);
    EXPECT_EQ(discovery_.processWithPid(HTLayoutChild::reapedPid()), nullptr);
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
    HTLayoutChild child({"exit"});
    ASSERT_TRUE(child.waitForExit());
    proc_bsdinfo info{};
    ASSERT_EQ(platform_->proc_pidinfo(child.pid(), PROC_PIDTBSDINFO, 0, &info, sizeof(info)), (int)sizeof(info));
    const std::string pid = child.pidString();
    child.reap();

    HTNoticeLog::standardError().take();
    EXPECT_EQ(discovery_.processWithBsdInfo(info), nullptr);
    EXPECT_EQ(HTNoticeLog::standardError().take(),
              std::vector<std::string>{std::string(info.pbi_name) + " [" + pid +
                                       "]: exited before it could be opened; not measured"});
    EXPECT_EQ(HTProcess::globalErrors(),
              std::vector<std::string>{"task_for_pid [" + pid + "] " + std::strerror(ESRCH)});
}
