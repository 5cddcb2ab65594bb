#include "process/HTTargetSelection.h"
#include "output/HTExpectedReport.h"
#include "platform/fake/HTFakePlatform.h"

#include <gtest/gtest.h>

#include <iterator>
#include <sstream>
#include <string>
#include <vector>

namespace {

constexpr int32_t kOwnPid = 500;

std::vector<std::string> words(const std::string& text)
{
    std::istringstream in(text);
    return {std::istream_iterator<std::string>(in), std::istream_iterator<std::string>()};
}

// A small system: the kernel, init, two shells with a tree of workers below
// one of them, and heft itself next to a second program of the same name.
class HTTargetSelectionTest : public testing::Test {
protected:
    void SetUp() override
    {
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

    // Selects after the request; the pids selected, "!" after a hidden one,
    // or "error" when nothing could be selected.
    std::string select(HTTargetSelection::Request request, HTTargetSelection::Request* after = nullptr)
    {
        HTTargetSelection selection(platform_, settings_, std::move(request));
        HTError error;
        testing::internal::CaptureStderr();
        auto processes = selection.targetProcessesAndError(&error);
        standardError_ = testing::internal::GetCapturedStderr();
        if (after) after->targetPids = selection.targetPids();
        if (!processes) return "error " + std::to_string(error.code) + ": " + error.description.value_or("");
        std::string text;
        for (const auto& process : *processes) {
            text +=
                (text.empty() ? "" : " ") + std::to_string(process->pid()) + (process->hiddenFromDisplay() ? "!" : "");
            EXPECT_EQ(process->breakDownPhysHeft(), settings_.breakDownPhysHeft) << "made with the run's settings";
        }
        return text;
    }

    std::shared_ptr<HTFakePlatform> platform_ = std::make_shared<HTFakePlatform>();
    HTSettings settings_;
    std::string standardError_;
};

TEST_F(HTTargetSelectionTest, SelectionUnderEachOption)
{
    // 100 and 201 may exit when idle and are clean; 203 may too but is dirty.
    for (int32_t pid : {100, 201, 203}) {
        platform_->process(pid)->dirtyErrno = 0;
        platform_->process(pid)->dirtyFlags =
            PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT | (pid == 203 ? PROC_DIRTY_IS_DIRTY : 0);
    }
    const std::string name = "cli/selections";
    std::istringstream lines(contentsOf(std::string(HEFT_TEST_DATA_DIR) + "/reports/" + name + ".scenario"));
    std::string said;
    for (std::string text; std::getline(lines, text);) {
        const HTScenarioLine line(text);
        if (line.kind != "select") continue;
        HTTargetSelection::Request request;
        request.potentialTargetProcesses = words(line.text("operands").value_or(""));
        for (const std::string& pid : words(line.text("pids").value_or("")))
            request.targetPids.set(std::stoi(pid), std::nullopt);
        request.excludedPidsOrProcesses = words(line.text("exclude").value_or(""));
        const std::string options = line.text("options").value_or("");
        request.targetAll = options == "a";
        request.targetChildren = options == "t";
        request.searchForUnmapped = options == "u";
        request.skipIdleExitClean = options == "s";
        said += text + "\n  " + select(request) + "\n" + standardError_;
    }
    expectReport(name + ".txt", said);

    // Names found stay with their pids, unless the pid was given too; -t
    // finds descendants by pid.
    HTTargetSelection::Request named, after;
    named.potentialTargetProcesses = {"worker", "100"};
    settings_.breakDownPhysHeft = false;
    select(named, &after);
    EXPECT_EQ(after.targetPids.find(201)->value_or(""), "worker");
    EXPECT_FALSE(*after.targetPids.find(100));
    named.targetChildren = true;
    select(named, &after);
    for (const auto& [pid, name] : after.targetPids) EXPECT_FALSE(name) << pid;
}

TEST_F(HTTargetSelectionTest, WhatCannotBeFoundOrOpenedIsNamedAsGiven)
{
    // A pid with more after it is a name.
    HTTargetSelection::Request request;
    request.potentialTargetProcesses = {"nosuchthing", "shell", "99999", "100 x"};
    EXPECT_EQ(select(request), "200");
    EXPECT_EQ(standardError_,
              "Unable to find pid for process matching 'nosuchthing'\n"
              "Unable to find pid for process matching '99999'\n"
              "Unable to find pid for process matching '100 x'\n");

    platform_->process(100)->taskResult = KERN_FAILURE;
    platform_->process(202)->taskResult = KERN_FAILURE;
    request = {};
    request.potentialTargetProcesses = {"worker"};
    request.targetPids.set(202, std::nullopt);
    request.targetPids.set(1, std::nullopt);
    EXPECT_EQ(select(request), "1 201 203");
    EXPECT_EQ(standardError_,
              "Unable to analyze process with pid 202 (try as root?)\n"
              "Unable to analyze process worker [100] (try as root?)\n");
}

}  // namespace
