// The built heft measuring live child processes whose memory the test lays
// out itself: written, swapped, lazily freed and locked anonymous memory, a
// segment shared by two processes, a shared file mapping and the C library's
// image, checked in the JSON document and in the text report against the
// layout and against the kernel's own figures for the same process.

#include "e2e/HTE2EReport.h"

#include <sys/mman.h>

#include <rapidjson/document.h>

#include <algorithm>

namespace {

using namespace heft_e2e;

using HTLiveProcessE2ETest = HTE2EReportTest;

TEST_F(HTLiveProcessE2ETest, AnonymousMemoryIsDirtySwappedReclaimableOrWiredAsLaidOut)
{
    constexpr uint64_t kWritten = 64 * kMiB;
    constexpr uint64_t kFreed = 16 * kMiB;
    constexpr uint64_t kLocked = 4 * kMiB;
    constexpr uint64_t kPagedOut = 16 * kMiB;
    SwapArea swap;  // without one the paged-out pages stay in memory, dirty
    auto n = [](uint64_t value) { return std::to_string(value); };
    LaidOutChild child({"anonymous", n(kWritten), n(kFreed), n(kLocked), n(kPagedOut)});
    ASSERT_TRUE(child.ready());

    rapidjson::Document report;
    Outcome text = runForReport({child.pidString()}, report);
    expectHeftMatchesKernel(report, child.pid());
    const rapidjson::Value* process = processIn(report, child.pid());
    ASSERT_NE(process, nullptr);
    const uint64_t locked = child.value(3) == 0 ? kLocked : 0;

    // Each mapping is one region of its exact size. Every written page is
    // resident and dirty (nothing pushes a blocked child's pages out on a
    // machine without memory pressure), so the figures are exact.
    const rapidjson::Value& written = regionAt(*process, child.value(0));
    EXPECT_EQ(number(written, "addr"), child.value(0));
    EXPECT_EQ(number(written, "vsize"), kWritten);
    EXPECT_EQ(number(written, "dirty") + number(written, "swapped"), kWritten);
    EXPECT_EQ(number(written, "reclaimable") + number(written, "wired"), 0u);
    EXPECT_EQ(nameOf(written), kUntagged);

    // Lazily freed pages are the kernel's to take at any moment, so heft's
    // figure lies between what the kernel still holds after heft ran and the
    // whole mapping; they are neither dirty nor part of the heft.
    const rapidjson::Value& freed = regionAt(*process, child.value(1));
    uint64_t lazyFreeAfter = kernelField(mappingAt(child.pid(), child.value(1)), "LazyFree");
    EXPECT_PRED3(between, number(freed, "reclaimable"), lazyFreeAfter, kFreed);
    EXPECT_GT(lazyFreeAfter, kFreed / 2) << "the kernel reclaimed the freed pages at once";
    EXPECT_EQ(number(freed, "dirty"), kFreed - number(freed, "reclaimable") - number(freed, "clean"));

    // A locked region is wired in full (locked pages cannot leave memory).
    if (locked) {
        const rapidjson::Value& region = regionAt(*process, child.value(2));
        EXPECT_EQ(number(region, "vsize"), kLocked);
        EXPECT_EQ(number(region, "wired"), kLocked);
        EXPECT_EQ(number(region, "dirty"), kLocked);
    }

    // Swapped pages stay out while the child does not touch them: heft's
    // figure is the kernel's, exactly, and the rest of the mapping is dirty.
    const bool pagedOut = swap.available() && child.value(5) == 0;
    uint64_t swapped = kernelField(mappingAt(child.pid(), child.value(4)), "Swap");
    EXPECT_TRUE(!pagedOut || swapped > kPagedOut / 2) << "the kernel left most pages in memory: " << swapped;
    const rapidjson::Value& out = regionAt(*process, child.value(4));
    EXPECT_EQ(number(out, "swapped"), swapped);
    EXPECT_EQ(number(out, "dirty") + number(out, "swapped"), kPagedOut);

    // The category holds the four regions at least, its dirty figure their
    // swapped bytes too; other anonymous memory of the child (its
    // allocator's) adds to it.
    const rapidjson::Value* untagged = categoryIn(*process, kUntagged);
    ASSERT_NE(untagged, nullptr) << text.standardOutput;
    EXPECT_GE(number(*untagged, "dirty"), kWritten + locked + kPagedOut);
    EXPECT_GE(number(*untagged, "swapped"), swapped);
    EXPECT_GE(number(*untagged, "reclaimable"), number(freed, "reclaimable"));
    EXPECT_GE(number(*untagged, "wired"), locked);
    EXPECT_GE(number(*untagged, "regions"), 4u);

    // The text report of the same run shows the same figures.
    EXPECT_NE(text.standardOutput.find(" [" + child.pidString() +
                                       "]: 64-bit\tHeft: " + std::to_string(number(*process, "heft")) + " B ("),
              std::string::npos)
        << text.standardOutput;
    expectTextRowShows(text.standardOutput, kUntagged, untagged);
    if (!locked) GTEST_SKIP() << "mlock: " << std::strerror(static_cast<int>(child.value(3))) << "; not checked";
    if (!pagedOut) GTEST_SKIP() << "no swap (" << swap.reason() << ") or MADV_PAGEOUT failed; swap not checked";
}

TEST_F(HTLiveProcessE2ETest, SegmentSharedByTwoProcessesCountsOnce)
{
    constexpr uint64_t kSize = 32 * kMiB;
    // Both children inherit the segment, and write every page of it.
    int segment = memfd_create("heft-e2e-segment", 0);
    ASSERT_GE(segment, 0) << std::strerror(errno);
    ASSERT_EQ(ftruncate(segment, static_cast<off_t>(kSize)), 0) << std::strerror(errno);
    const std::string segmentPath = "/proc/self/fd/" + std::to_string(segment);
    LaidOutChild first({"file", segmentPath, std::to_string(kSize)});
    LaidOutChild second({"file", segmentPath, std::to_string(kSize)});
    close(segment);
    ASSERT_TRUE(first.ready());
    ASSERT_TRUE(second.ready());

    rapidjson::Document report;
    Outcome outcome = runForReport({first.pidString(), second.pidString()}, report);
    uint64_t hefts = 0;
    for (const LaidOutChild* child : {&first, &second}) {
        expectHeftMatchesKernel(report, child->pid());
        const rapidjson::Value* process = processIn(report, child->pid());
        ASSERT_NE(process, nullptr);
        EXPECT_EQ(categoryIn(*process, "shared memory"), nullptr) << "the segment is listed as one process's own";
        const rapidjson::Value& region = regionAt(*process, child->value(0));
        EXPECT_EQ(nameOf(region), "shared memory");
        EXPECT_EQ(number(region, "dirty"), kSize);
        hefts += number(*process, "heft");
    }

    // Both map the whole segment, so it belongs to neither alone: it is in
    // exactly one shared table, the one of the two of them, whole. Shared
    // memory is named by its kind alone.
    int tablesWithSegment = 0;
    for (const auto& shared : arrayIn(report, "shared")) tablesWithSegment += !!categoryIn(shared, "shared memory");
    EXPECT_EQ(tablesWithSegment, 1);
    const rapidjson::Value* both = sharedBy(report, {first.pid(), second.pid()});
    EXPECT_EQ(figure(both, "shared memory", "dirty"), kSize);
    EXPECT_EQ(figure(both, "shared memory", "regions"), 2u);

    // Nothing else is one object with the same pages in both processes: their
    // private memory, the library pages each copied on write and their page
    // tables are each their own. So the summary is the two hefts less
    // exactly one copy of the segment.
    uint64_t totalHeft = number(report, "total heft");
    EXPECT_EQ(totalHeft + kSize, hefts);
    EXPECT_EQ(totalHeft, number(report["summary"]["total"], "dirty"));

    // The text report names the other process over the shared table.
    const std::string name = nameOf(*processIn(report, first.pid()));
    for (const LaidOutChild* other : {&first, &second}) {
        EXPECT_NE(outcome.standardOutput.find("Shared with " + name + " [" + other->pidString() + "]:\n"),
                  std::string::npos)
            << outcome.standardOutput;
    }
}

TEST_F(HTLiveProcessE2ETest, FileMappingsAndLibrariesAreNamedByPath)
{
    constexpr uint64_t kSize = 8 * kMiB;
    const std::string path = directory_.file("mapped.bin");
    std::ofstream(path).close();
    std::filesystem::resize_file(path, kSize);
    LaidOutChild child({"file", path, std::to_string(kSize)});
    ASSERT_TRUE(child.ready());

    rapidjson::Document report;
    Outcome text = runForReport({child.pidString()}, report);
    // Writeback may clean the file's written pages at any moment after heft
    // read them (never the other way round while the child sits still).
    std::string mapping = mappingAt(child.pid(), child.value(0));
    uint64_t fileDirtyAfter = kernelField(mapping, "Private_Dirty") + kernelField(mapping, "Shared_Dirty");
    expectHeftMatchesKernel(report, child.pid(), kSize - fileDirtyAfter);
    const rapidjson::Value* process = processIn(report, child.pid());
    ASSERT_NE(process, nullptr);

    // All its pages are resident, dirty until written back and clean after.
    const rapidjson::Value* file = categoryIn(*process, "mapped file " + path);
    ASSERT_NE(file, nullptr) << text.standardOutput;
    EXPECT_EQ(number(*file, "dirty") + number(*file, "clean"), kSize);
    EXPECT_GE(number(*file, "dirty"), fileDirtyAfter);
    EXPECT_EQ(number(*file, "regions"), 1u);
    const rapidjson::Value& region = regionAt(*process, child.value(0));
    EXPECT_EQ(nameOf(region), "mapped file " + path);
    expectTextRowShows(text.standardOutput, "mapped file " + path, file);

    // The C library is an image: its segments are named by their role and
    // its path, its code among them.
    const rapidjson::Value* categories = member(*process, "categories");
    ASSERT_TRUE(categories && categories->IsObject());
    auto libcText = std::find_if(categories->MemberBegin(), categories->MemberEnd(), [](const auto& entry) {
        std::string name = entry.name.GetString();
        return name.starts_with("__TEXT /") && name.find("/libc.so") != std::string::npos;
    });
    ASSERT_NE(libcText, categories->MemberEnd()) << text.standardOutput;
    EXPECT_GT(number(libcText->value, "clean") + number(libcText->value, "dirty"), 0u);
}

TEST_F(HTLiveProcessE2ETest, ProcessWhoseMainThreadExitedIsMeasuredThroughALiveThread)
{
    constexpr uint64_t kWritten = 64 * kMiB;
    LaidOutChild child({"leader-exit", std::to_string(kWritten)});
    ASSERT_TRUE(child.ready());
    const auto worker = static_cast<pid_t>(child.value(1));

    rapidjson::Document report;
    Outcome text = runForReport({child.pidString()}, report);
    // The main thread's files read an empty address space; the worker's read
    // the process's, and so do heft's.
    expectHeftMatchesKernel(report, child.pid(), 0, worker);
    const rapidjson::Value* process = processIn(report, child.pid());
    ASSERT_NE(process, nullptr);
    EXPECT_EQ(number(regionAt(*process, child.value(0)), "dirty"), kWritten);
    // It is alive: neither a zombie nor gone.
    EXPECT_EQ(member(*process, "warnings"), nullptr) << text.standardOutput;
    EXPECT_EQ(member(*process, "errors"), nullptr) << text.standardOutput;
}

TEST_F(HTLiveProcessE2ETest, ManyProcessesUnderALowOpenFileLimit)
{
    PreforkLayout layout;
    layout.children = 300;
    layout.shared = layout.children * kMiB / 16;
    layout.slice = kMiB / 16;
    layout.own = layout.after = kMiB;
    LaidOutFamily family(layout);
    ASSERT_EQ(family.children().size(), static_cast<size_t>(layout.children));
    std::vector<std::string> arguments = {"heft", "-j", directory_.file("many.json")};
    for (pid_t pid : family.all()) arguments.push_back(std::to_string(pid));

    // Far more processes than heft may open files, a limit it cannot raise:
    // it measures every one all the same.
    Outcome outcome = runProgram(kHeftBinary, arguments, 64);
    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    EXPECT_EQ(outcome.standardError.find("open files"), std::string::npos) << outcome.standardError;
    rapidjson::Document report;
    ASSERT_TRUE(loadReport(directory_.file("many.json"), report));
    for (pid_t pid : family.all()) {
        const rapidjson::Value* process = processIn(report, pid);
        ASSERT_NE(process, nullptr) << "pid " << pid;
        EXPECT_EQ(member(*process, "errors"), nullptr) << "pid " << pid;
    }
}

TEST_F(HTLiveProcessE2ETest, ProcessesExitingDuringTheRunLeaveAWholeReport)
{
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    // Short-lived processes keep coming and going while heft runs: each maps
    // and writes some memory and exits after a few milliseconds.
    LaidOutChild churn({"churn"});
    ASSERT_TRUE(churn.ready());
    const std::string path = directory_.file("all.json");
    int runsWithExitedProcesses = 0;
    for (int run = 0; run < 10; ++run) {
        SCOPED_TRACE("run " + std::to_string(run));
        // The test's own process is left out: built with a sanitizer, it
        // reserves terabytes of shadow memory, and measuring that is not what
        // this test is about. The first run adds --unmapped, which -a makes
        // redundant: it says so and runs as -a alone.
        std::vector<std::string> arguments = {"-a", "-x", std::to_string(getpid()), "-j", path};
        if (run == 0) arguments.push_back("--unmapped");
        Outcome outcome = runHeft(arguments);
        EXPECT_EQ(outcome.status, 0) << outcome.standardError;
        EXPECT_NE(outcome.standardOutput.find("\nSummary Heft: "), std::string::npos)
            << outcome.standardOutput.substr(0, 2000);
        // Processes that end while heft looks at them add lines of their own.
        EXPECT_EQ(outcome.standardError.starts_with("NOTICE: '--unmapped' is redundant when using -a/--all\n"),
                  run == 0)
            << outcome.standardError;
        rapidjson::Document report;
        EXPECT_TRUE(loadReport(path, report) && report.HasMember("total heft"));
        EXPECT_GT(arrayIn(report, "processes").Size(), 1u);
        if (outcome.standardError.find("(process exited)") != std::string::npos) ++runsWithExitedProcesses;
    }
    RecordProperty("runsThatSawAProcessExit", runsWithExitedProcesses);
}

}  // namespace
