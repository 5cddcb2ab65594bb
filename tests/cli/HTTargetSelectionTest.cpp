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

    static HTHeftArgs argsWithTargets(std::vector<std::string> operands, std::vector<int32_t> pids = {},
                                      std::vector<std::string> excluded = {})
    {
        auto set = [](const std::vector<std::string>& values) {
            HTOrderedStringSet made;
            for (const auto& value : values) made.add(value);
            return made;
        };
        HTHeftArgs args;
        args.setPotentialTargetProcesses(set(operands));
        HTHeftArgs::PidMap pidMap;
        for (int32_t pid : pids) pidMap.set(pid, std::nullopt);
        args.setTargetPids(pidMap);
        args.setExcludedPidsOrProcesses(set(excluded));
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

TEST_F(HTTargetSelectionTest, SelectionUnderEachOption)
{
    enum Option { kNone = 0, kAll = 1, kChildren = 2, kUnmapped = 4, kSkipClean = 8 };
    // 100 and 201 may exit when idle and are clean; 203 may too but is dirty.
    for (int32_t pid : {100, 201, 203}) {
        platform_->process(pid)->dirtyErrno = 0;
        platform_->process(pid)->dirtyFlags =
            PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT | (pid == 203 ? PROC_DIRTY_IS_DIRTY : 0);
    }
    struct Row {
        const char* what;
        std::vector<std::string> operands;
        std::vector<int32_t> pids;
        std::vector<std::string> excluded;
        int options;
        std::vector<int32_t> selected;
        std::string standardError;
    } rows[] = {
        {"a name selects every process of that name; pid 100 is reached twice, selected once",
         {"worker", "100", "init"},
         {},
         {},
         kNone,
         {100, 201, 203, 1},
         ""},
        {"unknown operands are reported and the others kept; a pid with more after it is a name",
         {"nosuchthing", "shell", "99999", "100 x"},
         {},
         {},
         kNone,
         {200},
         "Unable to find pid for process matching 'nosuchthing'\n"
         "Unable to find pid for process matching '99999'\n"
         "Unable to find pid for process matching '100 x'\n"},
        {"heft leaves itself out; exclusions that match nothing stay silent",
         {"heft", "worker"},
         {kOwnPid},
         {"201", "helper", "nosuchthing"},
         kNone,
         {501, 100, 203},
         ""},
        {"heft alone", {}, {kOwnPid}, {}, kNone, {}, ""},
        {"descendants come after the exclusions, heft's own pid among them",
         {"shell"},
         {},
         {"202"},
         kChildren,
         {200, 201, 202, 500, 501, 203},
         ""},
        {"an excluded target has no descendants to add", {}, {202}, {"helper"}, kChildren, {}, ""},
        {"all but heft and the excluded; operands not looked at",
         {"nosuchthing"},
         {1},
         {"worker"},
         kAll,
         {0, 1, 200, 202, 501},
         ""},
        {"all", {}, {}, {}, kAll, {0, 1, 100, 200, 201, 202, 203, 501}, ""},
        {"the unmapped search adds every other process but the kernel and the excluded",
         {},
         {201},
         {"init"},
         kUnmapped,
         {100, 200, 202, 203, 501, 201},
         ""},
        {"idle-exit clean processes skipped", {"worker", "shell"}, {}, {}, kSkipClean, {203, 200}, ""},
        {"only idle-exit clean processes", {}, {100, 201}, {}, kSkipClean, {}, ""},
    };
    for (const Row& row : rows) {
        HTHeftArgs args = argsWithTargets(row.operands, row.pids, row.excluded);
        args.setTargetAll(row.options & kAll);
        args.setTargetChildren(row.options & kChildren);
        args.setSearchForUnmapped(row.options & kUnmapped);
        args.setSkipIdleExitClean(row.options & kSkipClean);
        Selection selection = select(args);
        ASSERT_TRUE(selection.processes) << row.what;
        EXPECT_EQ(selection.pids(), row.selected) << row.what;
        EXPECT_EQ(selection.standardError, row.standardError) << row.what;
        // Only the unmapped search hides processes: all but the ones asked for.
        for (const auto& process : *selection.processes)
            EXPECT_EQ(process->hiddenFromDisplay(), (row.options & kUnmapped) && process->pid() != 201) << row.what;
    }

    // Names found stay with their pids, unless the pid was given too; -t
    // finds descendants by pid.
    HTHeftArgs named = argsWithTargets({"worker", "100"});
    select(named);
    EXPECT_EQ(named.targetPids().find(201)->value_or(""), "worker");
    EXPECT_FALSE(*named.targetPids().find(100));
    HTHeftArgs children = argsWithTargets({"shell"});
    children.setTargetChildren(true);
    select(children);
    for (const auto& [pid, name] : children.targetPids()) EXPECT_FALSE(name) << pid;
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
