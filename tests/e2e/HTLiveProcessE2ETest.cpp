// The built heft measuring live children whose memory the test lays out:
// written, swapped, lazily freed and locked anonymous memory, a segment
// shared by two processes, a shared file mapping and the C library's image,
// checked against the layout and against the kernel's own figures.

#include "e2e/HTE2ESupport.h"

#include <algorithm>

namespace {

using namespace heft_e2e;

using HTLiveProcessE2ETest = HTE2EReportTest;

TEST_F(HTLiveProcessE2ETest, AnonymousMemoryIsDirtySwappedReclaimableOrWiredAsLaidOut)
{
    SwapArea swap;  // without one the paged-out pages stay in memory, dirty
    HTLayoutChild child({"anon", n(64 * kMiB), "free", n(16 * kMiB), "lock", n(4 * kMiB), "pageout", n(16 * kMiB)});
    ASSERT_TRUE(child.ready());
    rapidjson::Document report;
    Outcome text = runForReport({child.pidString()}, report);
    expectHeftMatchesKernel(report, child.pid());
    const rapidjson::Value* process = processIn(report, child.pid());
    ASSERT_NE(process, nullptr);
    const bool locked = child.value(2, 1) == 0;
    const bool pagedOut = swap.available() && child.value(3, 1) == 0;
    auto kernel = [&](size_t directive, const char* field) {
        return kernelField(mappingAt(child.pid(), child.value(directive)), field);
    };

    // Each mapping is one region of its exact size. A blocked child's pages
    // stay as laid out (no memory pressure here), so these figures are exact,
    // except: lazily freed pages are the kernel's to take at any moment, so
    // heft's figure lies between what is left after heft ran and the whole;
    // swapped pages are what the kernel says after heft ran (nothing brings
    // them back while the child sits still).
    struct Row {
        size_t directive;
        uint64_t size, swapped, reclaimableLeast, reclaimableMost, wired;
    };
    const uint64_t lazyFree = kernel(1, "LazyFree"), swapped = kernel(3, "Swap");
    EXPECT_GT(lazyFree, 8 * kMiB) << "the kernel reclaimed the freed pages at once";
    EXPECT_TRUE(!pagedOut || swapped > 8 * kMiB) << "the kernel left most pages in memory: " << swapped;
    const Row rows[] = {{0, 64 * kMiB, 0, 0, 0, 0},
                        {1, 16 * kMiB, 0, lazyFree, 16 * kMiB, 0},
                        {2, 4 * kMiB, 0, 0, 0, locked ? 4 * kMiB : 0},
                        {3, 16 * kMiB, swapped, 0, 0, 0}};
    for (const Row& row : rows) {
        SCOPED_TRACE("directive " + n(row.directive));
        const rapidjson::Value* region = regionAt(process, child.value(row.directive));
        EXPECT_EQ(number(region, "addr"), child.value(row.directive));
        EXPECT_EQ(number(region, "vsize"), row.size);
        EXPECT_EQ(nameOf(region), kUntagged);
        EXPECT_EQ(number(region, "dirty") + number(region, "swapped") + number(region, "reclaimable") +
                      number(region, "clean"),
                  row.size);
        EXPECT_EQ(number(region, "swapped"), row.swapped);
        EXPECT_PRED3(between, number(region, "reclaimable"), row.reclaimableLeast, row.reclaimableMost);
        EXPECT_EQ(number(region, "wired"), row.wired);
    }
    // The category holds them all, and the child's allocator's memory too.
    EXPECT_GE(figure(process, kUntagged, "dirty"), (locked ? 84 : 80) * kMiB);
    EXPECT_GE(figure(process, kUntagged, "swapped"), swapped);
    EXPECT_GE(figure(process, kUntagged, "regions"), 4u);
    EXPECT_NE(
        text.standardOutput.find(" [" + child.pidString() + "]: 64-bit\tHeft: " + n(number(process, "heft")) + " B ("),
        std::string::npos)
        << text.standardOutput;
    if (!locked) GTEST_SKIP() << "mlock: " << std::strerror(static_cast<int>(child.value(2, 1))) << "; not checked";
    if (!pagedOut) GTEST_SKIP() << "no swap (" << swap.reason() << ") or MADV_PAGEOUT failed; swap not checked";
}

TEST_F(HTLiveProcessE2ETest, SegmentSharedByTwoProcessesCountsOnce)
{
    constexpr uint64_t kSize = 32 * kMiB;
    int segment = memfd_create("heft-e2e-segment", 0);
    ASSERT_GE(segment, 0) << std::strerror(errno);
    ASSERT_EQ(ftruncate(segment, static_cast<off_t>(kSize)), 0) << std::strerror(errno);
    // Both children inherit the segment's descriptor, and write all of it.
    const std::string path = "/proc/self/fd/" + n(static_cast<uint64_t>(segment));
    HTLayoutChild first({"file", path, n(kSize), n(kSize)});
    HTLayoutChild second({"file", path, n(kSize), n(kSize)});
    close(segment);
    ASSERT_TRUE(first.ready() && second.ready());

    rapidjson::Document report;
    Outcome outcome = runForReport({first.pidString(), second.pidString()}, report);
    uint64_t hefts = 0;
    for (const HTLayoutChild* child : {&first, &second}) {
        expectHeftMatchesKernel(report, child->pid());
        const rapidjson::Value* process = processIn(report, child->pid());
        EXPECT_EQ(member(member(process, "categories"), "shared memory"), nullptr) << "listed as one's own";
        EXPECT_EQ(nameOf(regionAt(process, child->value(0))), "shared memory");
        EXPECT_EQ(number(regionAt(process, child->value(0)), "dirty"), kSize);
        hefts += number(process, "heft");
        EXPECT_NE(outcome.standardOutput.find("Shared with " + nameOf(process) + " [" + child->pidString() + "]:\n"),
                  std::string::npos)
            << outcome.standardOutput;
    }
    // The segment is in exactly one shared table, the two's, whole; nothing
    // else is one object with the same pages in both, so the summary is the
    // two hefts less exactly one copy of it.
    int tables = 0;
    for (const auto& shared : arrayIn(report, "shared")) tables += figure(&shared, "shared memory", "regions") != 0;
    EXPECT_EQ(tables, 1);
    const rapidjson::Value* both = sharedBy(report, {first.pid(), second.pid()});
    EXPECT_EQ(figure(both, "shared memory", "dirty"), kSize);
    EXPECT_EQ(figure(both, "shared memory", "regions"), 2u);
    EXPECT_EQ(number(&report, "total heft") + kSize, hefts);
    EXPECT_EQ(number(&report, "total heft"), number(member(member(&report, "summary"), "total"), "dirty"));
}

TEST_F(HTLiveProcessE2ETest, FileMappingsAndLibrariesAreNamedByPath)
{
    constexpr uint64_t kSize = 8 * kMiB;
    const std::string path = directory_.file("mapped.bin");
    std::ofstream(path).close();
    std::filesystem::resize_file(path, kSize);
    HTLayoutChild child({"file", path, n(kSize), n(kSize)});
    ASSERT_TRUE(child.ready());
    rapidjson::Document report;
    Outcome text = runForReport({child.pidString()}, report);
    // Writeback may clean the written pages at any moment after heft read
    // them, never the other way round while the child sits still.
    std::string mapping = mappingAt(child.pid(), child.value(0));
    uint64_t dirtyAfter = kernelField(mapping, "Private_Dirty") + kernelField(mapping, "Shared_Dirty");
    expectHeftMatchesKernel(report, child.pid(), kSize - dirtyAfter);
    const rapidjson::Value* process = processIn(report, child.pid());
    const std::string category = "mapped file " + path;
    EXPECT_EQ(figure(process, category, "dirty") + figure(process, category, "clean"), kSize) << text.standardOutput;
    EXPECT_GE(figure(process, category, "dirty"), dirtyAfter);
    EXPECT_EQ(figure(process, category, "regions"), 1u);
    EXPECT_EQ(nameOf(regionAt(process, child.value(0))), category);

    // The C library is an image: its code is named by role and path.
    const rapidjson::Value* categories = member(process, "categories");
    ASSERT_TRUE(categories && categories->IsObject());
    auto libc = std::find_if(categories->MemberBegin(), categories->MemberEnd(), [](const auto& entry) {
        std::string name = entry.name.GetString();
        return name.starts_with("__TEXT /") && name.find("/libc.so") != std::string::npos;
    });
    ASSERT_NE(libc, categories->MemberEnd()) << text.standardOutput;
    EXPECT_GT(number(&libc->value, "clean") + number(&libc->value, "dirty"), 0u);
}

TEST_F(HTLiveProcessE2ETest, ProcessWhoseMainThreadExitedIsMeasuredThroughALiveThread)
{
    HTLayoutChild child({"anon", n(64 * kMiB), "exit-main"});
    ASSERT_TRUE(child.ready());
    rapidjson::Document report;
    Outcome text = runForReport({child.pidString()}, report);
    expectHeftMatchesKernel(report, child.pid(), 0, static_cast<pid_t>(child.value(1)));
    const rapidjson::Value* process = processIn(report, child.pid());
    EXPECT_EQ(number(regionAt(process, child.value(0)), "dirty"), 64 * kMiB);
    EXPECT_EQ(member(process, "warnings"), nullptr) << text.standardOutput;
    EXPECT_EQ(member(process, "errors"), nullptr) << text.standardOutput;
}

TEST_F(HTLiveProcessE2ETest, ManyProcessesUnderALowOpenFileLimit)
{
    // Far more processes than heft may open files, a limit it cannot raise:
    // it measures every one all the same.
    constexpr int kChildren = 300;
    HTLayoutChild family({"anon", n(kChildren * kMiB / 16), "fork", n(kChildren), n(kMiB / 16), n(kMiB)});
    ASSERT_EQ(family.line(1).size(), static_cast<size_t>(kChildren));
    std::vector<std::string> arguments = {"heft", "-j", directory_.file("many.json"), family.pidString()};
    for (uint64_t pid : family.line(1)) arguments.push_back(n(pid));
    Outcome outcome = runProgram(kHeftBinary, arguments, 64);
    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    EXPECT_EQ(outcome.standardError.find("open files"), std::string::npos) << outcome.standardError;
    rapidjson::Document report;
    ASSERT_TRUE(loadReport(directory_.file("many.json"), report));
    EXPECT_EQ(arrayIn(report, "processes").Size(), kChildren + 1u);
    for (const auto& process : arrayIn(report, "processes"))
        EXPECT_EQ(member(&process, "errors"), nullptr) << number(&process, "pid");
}

TEST_F(HTLiveProcessE2ETest, ProcessesExitingDuringTheRunLeaveAWholeReport)
{
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    // Short-lived processes keep coming and going while heft runs.
    HTLayoutChild churn({"churn"});
    ASSERT_TRUE(churn.ready());
    const std::string path = directory_.file("all.json");
    for (int run = 0; run < 3; ++run) {
        SCOPED_TRACE("run " + n(run));
        // The test itself is left out: built with a sanitizer, it reserves
        // terabytes of shadow memory, which is not what this test is about.
        Outcome outcome = runHeft({"-a", "-x", n(getpid()), "-j", path});
        EXPECT_EQ(outcome.status, 0) << outcome.standardError;
        EXPECT_NE(outcome.standardOutput.find("\nSummary Heft: "), std::string::npos);
        rapidjson::Document report;
        EXPECT_TRUE(loadReport(path, report) && report.HasMember("total heft"));
        EXPECT_GT(arrayIn(report, "processes").Size(), 1u);
    }
}

}  // namespace
