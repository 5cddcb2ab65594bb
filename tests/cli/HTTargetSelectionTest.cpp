#include "cli/HTHeftArgs.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTProcess.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

constexpr int32_t kOwnPid = 500;

// A small system: the kernel, init, two shells with a tree of workers below
// one of them, and heft itself next to a second program of the same name.
class HTTargetSelectionTest : public testing::Test {
protected:
    void SetUp() override
    {
        HTProcess::_clearGlobalErrors();
        platform_ = std::make_shared<HTFakePlatform>();
        platform_->ownPid = kOwnPid;
        platform_->addProcess(0, 0, "kernel_task", std::nullopt, PROC_FLAG_SYSTEM | PROC_FLAG_LP64);
        platform_->addProcess(1, 0, "init", "/sbin/init");
        platform_->addProcess(100, 1, "worker", "/usr/bin/worker");
        platform_->addProcess(200, 1, "shell", "/bin/shell");
        platform_->addProcess(201, 200, "worker", "/usr/bin/worker");
        platform_->addProcess(202, 200, "helper", "/usr/bin/helper");
        platform_->addProcess(203, 202, "worker", "/usr/bin/worker");
        platform_->addProcess(kOwnPid, 200, "heft", "/usr/bin/heft");
        platform_->addProcess(501, 200, "heft", "/opt/heft/heft");
    }

    void TearDown() override { HTProcess::_clearGlobalErrors(); }

    struct Selection {
        std::optional<std::vector<std::shared_ptr<HTProcess>>> processes;
        HTError error;
        std::string standardError;

        std::vector<int32_t> pids() const
        {
            std::vector<int32_t> result;
            if (processes)
                for (const auto& process : *processes) result.push_back(process->pid());
            return result;
        }
    };

    Selection select(HTHeftArgs& args)
    {
        Selection selection;
        testing::internal::CaptureStderr();
        selection.processes = args.targetProcessesAndError(platform_, &selection.error);
        selection.standardError = testing::internal::GetCapturedStderr();
        return selection;
    }

    static HTHeftArgs argsWithTargets(std::initializer_list<std::string> operands,
                                      std::initializer_list<int32_t> pids = {})
    {
        HTHeftArgs args;
        args.setPotentialTargetProcesses(HTOrderedStringSet(operands));
        HTHeftArgs::PidMap pidMap;
        for (int32_t pid : pids) pidMap.set(pid, std::nullopt);
        args.setTargetPids(pidMap);
        return args;
    }

    std::shared_ptr<HTFakePlatform> platform_;
};

TEST_F(HTTargetSelectionTest, NothingToAnalyseIsAnError)
{
    HTHeftArgs args;
    Selection selection = select(args);
    EXPECT_FALSE(selection.processes);
    EXPECT_EQ(selection.error.domain, "HTHeftError");
    EXPECT_EQ(selection.error.code, 8);
    EXPECT_EQ(selection.error.description, "Must specify at least one process or snapfile");
    EXPECT_EQ(selection.standardError, "");
}

TEST_F(HTTargetSelectionTest, NamesSelectEveryProcessOfThatName)
{
    // "100" and "worker" both reach pid 100: one process for it.
    HTHeftArgs args = argsWithTargets({"worker", "100", "init"});
    Selection selection = select(args);
    ASSERT_TRUE(selection.processes);
    EXPECT_EQ(selection.pids(), (std::vector<int32_t>{100, 201, 203, 1}));
    EXPECT_EQ(selection.standardError, "");
    EXPECT_EQ(args.targetPids().find(201)->value_or(""), "worker");
    EXPECT_FALSE(*args.targetPids().find(100)) << "given by pid after being found by name";
}

TEST_F(HTTargetSelectionTest, UnknownOperandsAreReportedAndTheOthersKept)
{
    HTHeftArgs args = argsWithTargets({"nosuchthing", "shell", "99999"});
    Selection selection = select(args);
    ASSERT_TRUE(selection.processes);
    EXPECT_EQ(selection.pids(), (std::vector<int32_t>{200}));
    EXPECT_EQ(selection.standardError,
              "Unable to find pid for process matching 'nosuchthing'\n"
              "Unable to find pid for process matching '99999'\n");
}

TEST_F(HTTargetSelectionTest, ExcludesItselfAndTheExcludedProcesses)
{
    HTHeftArgs args = argsWithTargets({"heft", "worker"}, {kOwnPid});
    args.setExcludedPidsOrProcesses(HTOrderedStringSet{"201", "helper", "nosuchthing"});
    Selection selection = select(args);
    ASSERT_TRUE(selection.processes);
    EXPECT_EQ(selection.pids(), (std::vector<int32_t>{501, 100, 203}));
    // Exclusions that match nothing stay silent; excluded pids are not
    // "unable to analyze".
    EXPECT_EQ(selection.standardError, "");

    HTHeftArgs onlySelf = argsWithTargets({}, {kOwnPid});
    selection = select(onlySelf);
    ASSERT_TRUE(selection.processes);
    EXPECT_TRUE(selection.processes->empty());
}

TEST_F(HTTargetSelectionTest, DescendantsAreAddedAfterTheExclusions)
{
    HTHeftArgs args = argsWithTargets({"shell"});
    args.setTargetChildren(true);
    args.setExcludedPidsOrProcesses(HTOrderedStringSet{"202"});
    Selection selection = select(args);
    ASSERT_TRUE(selection.processes);
    // heft's own pid is a child of the shell too: -t reaches it as well.
    EXPECT_EQ(selection.pids(), (std::vector<int32_t>{200, 201, 202, 500, 501, 203}));
    for (const auto& [pid, name] : args.targetPids()) EXPECT_FALSE(name) << pid;

    // An excluded target has no descendants to add.
    HTHeftArgs excludedRoot = argsWithTargets({}, {202});
    excludedRoot.setTargetChildren(true);
    excludedRoot.setExcludedPidsOrProcesses(HTOrderedStringSet{"helper"});
    selection = select(excludedRoot);
    ASSERT_TRUE(selection.processes);
    EXPECT_TRUE(selection.processes->empty());
}

TEST_F(HTTargetSelectionTest, AllProcessesButItselfAndTheExcluded)
{
    HTHeftArgs args = argsWithTargets({"nosuchthing"}, {1});
    args.setTargetAll(true);
    args.setExcludedPidsOrProcesses(HTOrderedStringSet{"worker"});
    Selection selection = select(args);
    ASSERT_TRUE(selection.processes);
    EXPECT_EQ(selection.pids(), (std::vector<int32_t>{0, 1, 200, 202, 501}));
    // The operands are not looked at under -a.
    EXPECT_EQ(selection.standardError, "");

    HTHeftArgs allAlone;
    allAlone.setTargetAll(true);
    selection = select(allAlone);
    ASSERT_TRUE(selection.processes);
    EXPECT_EQ(selection.processes->size(), 8u);
}

TEST_F(HTTargetSelectionTest, UnmappedSearchHidesEveryOtherProcessButTheKernel)
{
    HTHeftArgs args = argsWithTargets({}, {201});
    args.setSearchForUnmapped(true);
    args.setExcludedPidsOrProcesses(HTOrderedStringSet{"init"});
    Selection selection = select(args);
    ASSERT_TRUE(selection.processes);
    EXPECT_EQ(selection.pids(), (std::vector<int32_t>{100, 200, 202, 203, 501, 201}));
    for (const auto& process : *selection.processes)
        EXPECT_EQ(process->hiddenFromDisplay(), process->pid() != 201) << process->pid();
}

TEST_F(HTTargetSelectionTest, SkipDropsIdleExitCleanProcesses)
{
    for (int32_t pid : {100, 201}) {
        HTFakePlatform::Process* process = platform_->process(pid);
        process->dirtyErrno = 0;
        process->dirtyFlags = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    }
    // Idle-exit capable but dirty: kept.
    platform_->process(203)->dirtyErrno = 0;
    platform_->process(203)->dirtyFlags = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT | PROC_DIRTY_IS_DIRTY;

    HTHeftArgs args = argsWithTargets({"worker", "shell"});
    args.setSkipIdleExitClean(true);
    Selection selection = select(args);
    ASSERT_TRUE(selection.processes);
    EXPECT_EQ(selection.pids(), (std::vector<int32_t>{203, 200}));

    HTHeftArgs onlyClean = argsWithTargets({}, {100, 201});
    onlyClean.setSkipIdleExitClean(true);
    selection = select(onlyClean);
    ASSERT_TRUE(selection.processes);
    EXPECT_TRUE(selection.processes->empty());
}

TEST_F(HTTargetSelectionTest, UnreadableProcessesAreNamedAsTheyWereGiven)
{
    platform_->process(100)->taskResult = KERN_FAILURE;
    platform_->process(202)->taskResult = KERN_FAILURE;
    HTHeftArgs args = argsWithTargets({"worker"}, {202, 1});
    Selection selection = select(args);
    ASSERT_TRUE(selection.processes);
    EXPECT_EQ(selection.pids(), (std::vector<int32_t>{1, 201, 203}));
    EXPECT_EQ(selection.standardError,
              "Unable to analyze process with pid 202 (try as root?)\n"
              "Unable to analyze process worker [100] (try as root?)\n");
}

}  // namespace
