#include "cli/HTHeftMain.h"

#include "base/HTNoticeLog.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTProcess.h"

#include <gtest/gtest.h>

#include <cerrno>
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
        HTNoticeLog::standardError().take();
        platform_->ownPid = 500;
        platform_->addProcess(1, 0, "init", "/sbin/init");
        platform_->addProcess(42, 1, "worker", "/usr/bin/worker");
    }
    void TearDown() override { HTProcess::_clearGlobalErrors(); }

    // The exit status, then what the run wrote to standard output and error.
    std::tuple<int, std::string, std::string> run(std::vector<std::string> arguments)
    {
        arguments.insert(arguments.begin(), "heft");
        std::vector<char*> argv;
        for (auto& argument : arguments) argv.push_back(argument.data());
        argv.push_back(nullptr);
        testing::internal::CaptureStdout();
        testing::internal::CaptureStderr();
        const int status = heftMain(static_cast<int>(arguments.size()), argv.data(), platform_);
        std::string standardError = testing::internal::GetCapturedStderr();
        return {status, testing::internal::GetCapturedStdout(), standardError};
    }

    std::shared_ptr<HTFakePlatform> platform_ = std::make_shared<HTFakePlatform>();
};

TEST_F(HTHeftMainTest, OnlyTheBreakdownModeAsksWhichObjectsAProcessOwns)
{
    const char* kDirtyAnalysis = "VM Object Dirty Analysis: Enabled\n";
    auto [status, out, error] = run({"--vmObjectDirty", "42"});
    EXPECT_EQ(status, 0);
    EXPECT_NE(out.find(kDirtyAnalysis), std::string::npos) << out;
    EXPECT_EQ(platform_->ownedVmObjectQueries, 0);

    std::tie(status, out, error) = run({"42"});
    EXPECT_EQ(std::make_tuple(status, out.find(kDirtyAnalysis), error), std::make_tuple(0, std::string::npos, ""));
    EXPECT_NE(out.find("\nworker [42]: 64-bit\tHeft: "), std::string::npos) << out;
    EXPECT_GT(platform_->ownedVmObjectQueries, 0);
}

TEST_F(HTHeftMainTest, TheJSONFileIsOpenedFirstAndGoneWhenTheRunFails)
{
    char directory[] = "/tmp/heft-main-XXXXXX";
    ASSERT_NE(mkdtemp(directory), nullptr);
    platform_->outOfMemoryInWalk = true;
    EXPECT_EQ(run({"-j", std::string(directory) + "/out.json", "42"}),
              std::make_tuple(1, "", "heft: out of memory while gathering the processes' memory\n"));
    // The JSON file begun before the gathering is gone with its directory entry.
    EXPECT_EQ(rmdir(directory), 0) << std::strerror(errno);
    platform_->outOfMemoryInWalk = false;
    auto [status, out, error] = run({"-j", std::string(directory) + "/out.json", "42"});
    EXPECT_EQ(status, 1);
    EXPECT_EQ(error,
              "Unable to open JSON output file '" + std::string(directory) + "/out.json': No such file or directory\n");
}

TEST_F(HTHeftMainTest, AllProcessesAndUnmappedNeedRootNamingProcessesDoesNot)
{
    platform_->euid = 1000;
    EXPECT_EQ(run({"-a"}), std::make_tuple(1, "", "Must run as root.\n"));
    EXPECT_EQ(run({"--unmapped", "42"}), std::make_tuple(1, "", "Must run as root.\n"));
    EXPECT_EQ(std::get<0>(run({"worker"})), 0);
    // A command-line error is reported before privileges are looked at.
    auto [status, out, error] = run({"-a", "-f", "bad"});
    EXPECT_EQ(status, 1);
    EXPECT_EQ(error.rfind("Unrecognized argument to -f", 0), 0u) << error;
}

TEST_F(HTHeftMainTest, WhatBefellTheProcessesFollowsTheGatheringEscaped)
{
    // A zombie whose name would split the line and drive the terminal.
    HTFakePlatform::Process& zombie = platform_->addProcess(43, 1, "evil\n\x1B[7m");
    zombie.info.pbi_status = SZOMB;
    zombie.regionFailureIndex = 0;
    auto [status, out, error] = run({"43"});
    EXPECT_EQ(status, 0);
    EXPECT_EQ(error,
              "evil\\n\\x1B[7m [43]: had exited and was not yet reaped (a zombie) when read; "
              "marked \"(zombie)\" in the report\n");
}

}  // namespace
