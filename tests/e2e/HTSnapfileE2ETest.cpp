// Processes saved as snapfiles and read back report as they did live, to the byte.

#include "e2e/HTE2ESupport.h"

namespace {

using namespace heft_e2e;

// Waits until the kernel shows `pid` stopped, so that nothing changes between the two runs.
bool stop(pid_t pid)
{
    kill(pid, SIGSTOP);
    for (int tries = 0; tries < 500; ++tries, usleep(2000))
        if (readFile("/proc/" + n(pid) + "/stat").find(") T ") != std::string::npos) return true;
    return false;
}

std::string withoutSnapfileMarks(std::string text)
{
    for (size_t at; (at = text.find(" (snapfile)")) != std::string::npos;) text.erase(at, 11);
    return text;
}

TEST(HTSnapfileE2ETest, SnapfilesOfAStoppedProcessAndAForkedFamilyReportAsTheLiveProcesses)
{
    if (geteuid() != 0) GTEST_SKIP() << "telling pages shared after a fork apart, and swap, need root";
    SwapArea swap;
    TempDir directory;
    const std::string data = directory.file("data");
    ASSERT_EQ(truncate(std::ofstream(data).good() ? data.c_str() : "", 4 * kMiB), 0);
    // Forked memory partly overwritten and partly swapped out, a shared and a private file mapping.
    HTLayoutChild family({"anon", n(8 * kMiB), "pageout", n(2 * kMiB), "file", data, n(4 * kMiB), n(kMiB), "private",
                          data, "written", "fork", "3", n(256 * 1024), n(kMiB)});
    HTLayoutChild single({"anon", n(3 * kMiB)});
    ASSERT_TRUE(family.ready() && single.ready());
    std::set<pid_t> pids = {family.pid(), single.pid()};
    for (uint64_t child : family.line(4)) pids.insert(static_cast<pid_t>(child));
    for (pid_t pid : pids) ASSERT_TRUE(stop(pid)) << pid;

    // Each mode is saved with the snapfiles and read back in it.
    for (const char* mode : {"-w", "--vmObjectDirty"}) {
        SCOPED_TRACE(mode);
        const std::string saved = directory.file(mode + 1);
        ASSERT_EQ(mkdir(saved.c_str(), 0700), 0);
        std::vector<std::string> live = {"-w", "-v", "-f", "bytes", "-j", saved + ".json", mode, "--snapshot-dir",
                                         saved};
        for (pid_t pid : pids) live.push_back(n(pid));
        const Outcome liveRun = runHeft(live);
        ASSERT_EQ(liveRun.status, 0) << liveRun.standardError;

        std::vector<std::string> snapfiles = {"-w", "-v", "-f", "bytes", "-j", saved + ".snap.json"};
        for (const auto& entry : std::filesystem::directory_iterator(saved)) snapfiles.push_back(entry.path());
        EXPECT_EQ(snapfiles.size(), 6 + pids.size());
        const Outcome snapRun = runHeft(snapfiles);
        ASSERT_EQ(snapRun.status, 0) << snapRun.standardError;
        EXPECT_NE(snapRun.standardOutput.find("] (snapfile): 64-bit\tHeft: "), std::string::npos);
        EXPECT_EQ(withoutSnapfileMarks(snapRun.standardOutput), liveRun.standardOutput);
        EXPECT_EQ(snapRun.standardError, liveRun.standardError);
        EXPECT_EQ(readFile(saved + ".snap.json"), readFile(saved + ".json"));
    }
}

}  // namespace
