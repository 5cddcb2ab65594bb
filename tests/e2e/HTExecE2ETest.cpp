// heft --exec: programs run to their exit and reported as they were then, their streams and statuses their own.

#include "e2e/HTE2ESupport.h"

#include <sstream>

namespace {

using namespace heft_e2e;
using testing::AllOf, testing::EndsWith, testing::HasSubstr, testing::StartsWith;

using HTExecE2ETest = HTE2EReportTest;

TEST_F(HTExecE2ETest, ProgramIsReportedAsItsMemoryWasWhenItExited)
{
    SwapArea swap;  // without one the paged-out pages stay in memory, dirty
    const std::string path = directory_.file("report.json");
    const Outcome run = runHeft({"-v", "-w", "-f", "bytes", "-j", path, "--exec", "--", HEFT_LAYOUT_PROGRAM, "anon",
                                 n(64 * kMiB), "pageout", n(16 * kMiB), "exit"});
    ASSERT_EQ(run.status, 0) << run.standardError;
    // The program's own lines come first: where it laid out its memory, and whether paging out worked.
    std::istringstream lines(run.standardOutput);
    uint64_t written = 0, pagedOut = 0;
    int writtenError = -1, pageoutError = -1;
    lines >> written >> writtenError >> pagedOut >> pageoutError;
    ASSERT_TRUE(loadReport(path, report_));
    const auto processes = arrayIn(&report_, "processes");
    ASSERT_EQ(processes.Size(), 1u);
    const rapidjson::Value* process = &processes[0];
    EXPECT_THAT(run.standardOutput, HasSubstr("heft-layout [" + n(number(process, "pid")) + "] (corpse): 64-bit"));

    // Its memory was whole at its exit: every laid-out page is there, the paged-out ones in swap. The kernel may
    // keep a few pages of a page-out in memory (one under reclaim at that moment), so half of them is the bound.
    const rapidjson::Value* anon = regionAt(process, written);
    EXPECT_EQ(number(anon, "dirty"), 64 * kMiB);
    const rapidjson::Value* paged = regionAt(process, pagedOut);
    EXPECT_EQ(number(paged, "dirty") + number(paged, "swapped"), 16 * kMiB);
    if (swap.available && pageoutError == 0) {
        EXPECT_GE(number(paged, "swapped"), 8 * kMiB);
    }
    EXPECT_GE(figure(process, kUntagged, "dirty") + figure(process, kUntagged, "swapped"), 80 * kMiB);
    // Its page tables were read before it was let go.
    EXPECT_GT(figure(process, "page table", "dirty"), 0u);
    EXPECT_GE(number(process, "heft"), 80 * kMiB + figure(process, "page table", "dirty"));
}

TEST_F(HTExecE2ETest, StatusesAndStreamsAreTheProgramsOwn)
{
    const std::string header = "======";
    // Its exit status, 128 + the signal that killed it, or the shell's statuses when it cannot be started; its
    // output before the report.
    Outcome run = runHeft({"--exec", "--", "sh", "-c", "echo out; exit 3"});
    EXPECT_EQ(run.status, 3);
    EXPECT_THAT(run.standardOutput, StartsWith("out\n" + header));
    run = runHeft({"--exec", "sh", "-c", "kill -SEGV $$"});
    EXPECT_EQ(run.status, 139);
    EXPECT_THAT(run.standardOutput, HasSubstr("] (corpse): "));
    run = runHeft({"--exec", "--", directory_.file("missing")});
    EXPECT_EQ(run.status, 127);
    EXPECT_THAT(run.standardError, AllOf(HasSubstr("missing: No such file or directory"), EndsWith("\n")));
    EXPECT_EQ(run.standardOutput, "");
    std::ofstream(directory_.file("script")) << "#!/bin/sh\n";
    run = runHeft({"--exec", "--", directory_.file("script")});
    EXPECT_EQ(run.status, 126);
    EXPECT_THAT(run.standardError, HasSubstr("script: Permission denied"));

    // Its environment and ignored signals are the caller's, not what heft set for itself.
    const std::vector<std::string> inherited = {"sh", "-c", "env | sort; grep SigIgn /proc/self/status"};
    const Outcome direct = runProgram("/bin/sh", inherited);
    std::vector<std::string> traced = inherited;
    traced.insert(traced.begin(), {"--exec", "--"});
    EXPECT_THAT(runHeft(traced).standardOutput, StartsWith(direct.standardOutput + header));

    // Its standard input and output: data through it unchanged, the report after.
    std::string data(200000, '\0');
    for (size_t i = 0; i < data.size(); ++i) data[i] = static_cast<char>(i * 7919 % 251);
    std::ofstream(directory_.file("data"), std::ios::binary) << data;
    run =
        runProgram("/bin/sh", {"sh", "-c", "exec \"$0\" --exec -- cat < \"$1\"", kHeftBinary, directory_.file("data")});
    EXPECT_EQ(run.status, 0);
    EXPECT_EQ(run.standardOutput.substr(0, data.size()), data);
    EXPECT_THAT(run.standardOutput.substr(data.size()), StartsWith(header));

    // Ctrl-C reaches the program, not heft: heft leads a process group of its own, and the program interrupts it.
    if (access("/usr/bin/setsid", X_OK) != 0) GTEST_SKIP() << "/usr/bin/setsid is needed for a process group";
    run = runProgram("/bin/sh",
                     {"sh", "-c",
                      "exec /usr/bin/setsid -w \"$0\" --exec -- sh -c "
                      "'trap \"exit 7\" INT; kill -INT 0; sleep 5; exit 1'",
                      kHeftBinary});
    EXPECT_EQ(run.status, 7) << run.standardError;
    EXPECT_THAT(run.standardOutput, HasSubstr("] (corpse): "));
}

TEST_F(HTExecE2ETest, ChildrenAndStopsAreFollowed)
{
    // With -t the processes it starts are reported too, each at its own exit; without, the program alone. Those
    // still running when it ends are let go, and said to be.
    const std::vector<std::string> family = {"--exec", "sh", "-c", "sh -c 'exit 0'; sleep 1 & exit 0"};
    auto corpses = [](const Outcome& outcome) {
        size_t count = 0;
        for (size_t at = 0; (at = outcome.standardOutput.find("(corpse): ", at)) != std::string::npos; ++at) ++count;
        return count;
    };
    EXPECT_EQ(corpses(runHeft(family)), 1u);
    std::vector<std::string> withChildren = family;
    withChildren.insert(withChildren.begin(), "-t");
    const Outcome run = runHeft(withChildren);
    EXPECT_EQ(corpses(run), 2u);
    EXPECT_THAT(run.standardError, HasSubstr("1 process started by the program was still running at its end"));

    // A stop signal stops the program until it is continued, here by a child of its own after a while.
    const Outcome stopped = runHeft(
        {"--exec", "sh", "-c", "(sleep 0.3; echo continued; kill -CONT $$) & kill -STOP $$; echo resumed; wait"});
    EXPECT_THAT(stopped.standardOutput, StartsWith("continued\nresumed\n"));
}

}  // namespace
