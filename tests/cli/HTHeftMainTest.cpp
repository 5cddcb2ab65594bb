#include "cli/HTHeftMain.h"

#include "base/HTNoticeLog.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTProcess.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>
#include <unistd.h>
#include <vector>

namespace {

// The run up to the analysis, against a scripted system. The exact texts
// a user sees are checked end to end on the built program; here the checks
// are about what the run does to the system and in which order.
class HTHeftMainTest : public testing::Test {
protected:
    void SetUp() override
    {
        HTProcess::_clearGlobalErrors();
        HTNoticeLog::standardError().take();
        platform_ = std::make_shared<HTFakePlatform>();
        platform_->ownPid = 500;
        platform_->addProcess(1, 0, "init", "/sbin/init");
        platform_->addProcess(42, 1, "worker", "/usr/bin/worker");
    }

    void TearDown() override { HTProcess::_clearGlobalErrors(); }

    struct Run {
        int status = -1;
        std::string standardOutput;
        std::string standardError;
    };

    Run run(std::vector<std::string> arguments)
    {
        arguments.insert(arguments.begin(), "heft");
        std::vector<char*> argv;
        for (auto& argument : arguments) argv.push_back(argument.data());
        argv.push_back(nullptr);

        Run result;
        testing::internal::CaptureStdout();
        testing::internal::CaptureStderr();
        result.status = heftMain(static_cast<int>(arguments.size()), argv.data(), platform_);
        result.standardError = testing::internal::GetCapturedStderr();
        result.standardOutput = testing::internal::GetCapturedStdout();
        return result;
    }

    std::shared_ptr<HTFakePlatform> platform_;
};

TEST_F(HTHeftMainTest, TheBreakdownModeIsOnUnlessVmObjectDirty)
{
    // Only the breakdown mode asks the kernel which objects a process owns.
    const char* kDirtyAnalysis = "VM Object Dirty Analysis: Enabled\n";
    Run result = run({"--vmObjectDirty", "42"});
    EXPECT_EQ(result.status, 0);
    EXPECT_NE(result.standardOutput.find(kDirtyAnalysis), std::string::npos) << result.standardOutput;
    EXPECT_EQ(platform_->ownedVmObjectQueries, 0);

    result = run({"42"});
    EXPECT_EQ(result.status, 0);
    // The selected process is analysed and reported.
    EXPECT_NE(result.standardOutput.find("\nworker [42]: 64-bit\tHeft: "), std::string::npos) << result.standardOutput;
    EXPECT_EQ(result.standardOutput.find(kDirtyAnalysis), std::string::npos);
    EXPECT_EQ(result.standardError, "");
    EXPECT_GT(platform_->ownedVmObjectQueries, 0);
}

TEST_F(HTHeftMainTest, RunningOutOfMemorySaysWhereAndLeavesNoFile)
{
    char directory[] = "/tmp/heft-main-XXXXXX";
    ASSERT_NE(mkdtemp(directory), nullptr);
    const std::string json = std::string(directory) + "/out.json";
    platform_->outOfMemoryInWalk = true;
    Run result = run({"-j", json, "42"});
    EXPECT_EQ(result.status, 1);
    EXPECT_EQ(result.standardError, "heft: out of memory while gathering the processes' memory\n");
    // The JSON file begun before the gathering is gone with its directory entry.
    EXPECT_EQ(rmdir(directory), 0) << std::strerror(errno);
}

TEST_F(HTHeftMainTest, AllProcessesAndUnmappedNeedRoot)
{
    platform_->euid = 1000;
    for (std::vector<std::string> arguments : {std::vector<std::string>{"-a"}, {"--unmapped", "42"}}) {
        Run result = run(arguments);
        EXPECT_EQ(result.status, 1) << arguments[0];
        EXPECT_EQ(result.standardError, "Must run as root.\n");
        EXPECT_EQ(result.standardOutput, "");
    }

    // Naming processes needs no privilege of its own.
    Run result = run({"worker"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.standardError, "");

    // A command-line error is reported before privileges are looked at.
    result = run({"-a", "-f", "bad"});
    EXPECT_EQ(result.status, 1);
    EXPECT_EQ(result.standardError.rfind("Unrecognized argument to -f", 0), 0u) << result.standardError;
}

TEST_F(HTHeftMainTest, WhatBefellTheProcessesFollowsTheGatheringEscaped)
{
    // A zombie whose name would split the line and drive the terminal.
    HTFakePlatform::Process& zombie = platform_->addProcess(43, 1, "evil\n\x1B[7m");
    zombie.info.pbi_status = SZOMB;
    zombie.regionFailureIndex = 0;
    Run result = run({"43"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.standardError,
              "evil\\n\\x1B[7m [43]: had exited and was not yet reaped (a zombie) when read; "
              "marked \"(zombie)\" in the report\n");
}

}  // namespace
