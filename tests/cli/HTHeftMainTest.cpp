#include "cli/HTHeftMain.h"

#include "base/HTNoticeLog.h"
#include "output/HTExpectedReport.h"
#include "platform/HTSnapfileEdit.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTProcess.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <iterator>
#include <regex>
#include <sstream>
#include <string>
#include <unistd.h>
#include <vector>

namespace {

// Whole runs against a scripted system.
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

TEST_F(HTHeftMainTest, Runs)
{
    const std::string name = "cli/main";
    char pattern[] = "/tmp/heft-main-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    // Snapfiles are written to a directory of the test's own, named DIR in
    // the runs and in what they say.
    const std::string directory = pattern;
    std::istringstream lines(contentsOf(std::string(HEFT_TEST_DATA_DIR) + "/reports/" + name + ".scenario"));
    std::string said;
    for (std::string text; std::getline(lines, text);) {
        const HTScenarioLine line(text);
        if (line.kind == "set") platform_->euid = static_cast<uint32_t>(line.number("euid"));
        if (line.kind == "zombie") {
            HTFakePlatform::Process& zombie = platform_->addProcess(std::stoi(line.argument), 1, *line.text("name"));
            zombie.info.pbi_status = SZOMB;
            zombie.regionFailureIndex = 0;
        }
        if (line.kind == "snapfile") {
            std::ofstream(directory + "/" + line.argument) << editedSnapfile(line.text("edit").value_or(""));
            platform_->existingFiles.insert(directory + "/" + line.argument);
        }
        if (line.kind == "program") {
            platform_->programExits.clear();
            std::istringstream pids(line.text("exits").value_or(""));
            for (int32_t pid; pids >> pid;)
                platform_->programExits.push_back(
                    {pid, nullptr, P_LP64, static_cast<uint32_t>(line.number("dirty")), line.number("pagetable")});
            platform_->programEnd = {static_cast<int>(line.number("start-error")),
                                     static_cast<int>(line.number("trace-error")),
                                     static_cast<int>(line.number("status")), static_cast<int>(line.number("left"))};
        }
        if (line.kind != "run") continue;
        std::istringstream words(std::regex_replace(text.substr(4), std::regex("DIR"), directory));
        std::vector<std::string> arguments{std::istream_iterator<std::string>(words), {}};
        platform_->ownedVmObjectQueries = 0;
        auto [status, out, error] = run(arguments);
        said += text + "\n  status " + std::to_string(status) + ", " + std::to_string(platform_->ownedVmObjectQueries) +
            " owned-object queries\n" + out + (error.empty() ? "" : "standard error:\n" + error) + "\n";
    }
    std::filesystem::remove_all(directory);
    expectReport(name + ".txt", std::regex_replace(said, std::regex(directory), "DIR"));
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

}  // namespace
