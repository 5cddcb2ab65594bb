// The built heft measuring children whose memory the test lays out, against the layout and the kernel's figures.

#include "e2e/HTE2ESupport.h"

namespace {

using namespace heft_e2e;
using testing::HasSubstr, testing::Not;

using HTLiveProcessE2ETest = HTE2EReportTest;

TEST_F(HTLiveProcessE2ETest, AnonymousMemoryIsDirtySwappedReclaimableOrWiredAsLaidOut)
{
    SwapArea swap;  // without one the paged-out pages stay in memory, dirty
    ASSERT_TRUE(
        layOutAndMeasure({"anon", n(64 * kMiB), "free", n(16 * kMiB), "lock", n(4 * kMiB), "pageout", n(16 * kMiB)}));
    const HTLayoutChild& child = *child_;
    expectHeftMatchesKernel(report_, child.pid());
    const rapidjson::Value* process = processIn(report_, child.pid());
    ASSERT_NE(process, nullptr);
    const bool locked = child.value(2, 1) == 0, pagedOut = swap.available && child.value(3, 1) == 0;

    // One region a mapping, its figures as laid out, which a blocked child's pages stay, except lazily freed ones: the
    // kernel may take them at any moment, so heft's lie between what is left after it ran and the whole.
    const uint64_t lazyFree = kernelField(mappingAt(child.pid(), child.value(1)), "LazyFree"),
                   swapped = kernelField(mappingAt(child.pid(), child.value(3)), "Swap");
    EXPECT_GT(lazyFree, 8 * kMiB) << "the kernel reclaimed the freed pages at once";
    EXPECT_TRUE(!pagedOut || swapped > 8 * kMiB) << "the kernel left most pages in memory: " << swapped;
    const struct {
        size_t directive;
        uint64_t size, swapped, reclaimableLeast, reclaimableMost, wired;
    } rows[] = {{0, 64 * kMiB, 0, 0, 0, 0},
                {1, 16 * kMiB, 0, lazyFree, 16 * kMiB, 0},
                {2, 4 * kMiB, 0, 0, 0, locked ? 4 * kMiB : 0},
                {3, 16 * kMiB, swapped, 0, 0, 0}};
    for (const auto& row : rows) {
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
    EXPECT_THAT(text_.standardOutput,
                HasSubstr(" [" + child.pidString() + "]: 64-bit\tHeft: " + n(number(process, "heft")) + " B ("));
    if (!locked) GTEST_SKIP() << "mlock: " << std::strerror(static_cast<int>(child.value(2, 1))) << "; not checked";
    if (!pagedOut) GTEST_SKIP() << "no swap (" << swap.reason << ") or MADV_PAGEOUT failed; swap not checked";
}

TEST_F(HTLiveProcessE2ETest, SegmentSharedByTwoProcessesCountsOnce)
{
    constexpr uint64_t kSize = 32 * kMiB;
    int segment = memfd_create("heft-e2e-segment", 0);
    ASSERT_GE(segment, 0) << std::strerror(errno);
    ASSERT_EQ(ftruncate(segment, static_cast<off_t>(kSize)), 0) << std::strerror(errno);
    // Both children inherit its descriptor, and write all of it.
    const std::vector<std::string> directives = {"file", "/proc/self/fd/" + n(segment), n(kSize), n(kSize)};
    const HTLayoutChild second(directives);
    ASSERT_TRUE(second.ready());
    ASSERT_TRUE(layOutAndMeasure(directives, {second.pidString()}));
    close(segment);
    const HTLayoutChild& first = *child_;
    uint64_t hefts = 0;
    for (const HTLayoutChild* child : {&first, &second}) {
        expectHeftMatchesKernel(report_, child->pid());
        const rapidjson::Value* process = processIn(report_, child->pid());
        EXPECT_EQ(member(member(process, "categories"), "shared memory"), nullptr) << "listed as one's own";
        EXPECT_EQ(nameOf(regionAt(process, child->value(0))), "shared memory");
        EXPECT_EQ(number(regionAt(process, child->value(0)), "dirty"), kSize);
        hefts += number(process, "heft");
        EXPECT_THAT(text_.standardOutput,
                    HasSubstr("Shared with " + nameOf(process) + " [" + child->pidString() + "]:\n"));
    }
    // The segment is whole in exactly one shared table, the two's; the summary is the two hefts less one copy of it.
    int tables = 0;
    for (const auto& shared : arrayIn(&report_, "shared")) tables += figure(&shared, "shared memory", "regions") != 0;
    EXPECT_EQ(tables, 1);
    const rapidjson::Value* both = sharedBy(report_, {first.pid(), second.pid()});
    EXPECT_EQ(figure(both, "shared memory", "dirty"), kSize);
    EXPECT_EQ(figure(both, "shared memory", "regions"), 2u);
    EXPECT_EQ(number(&report_, "total heft") + kSize, hefts);
    EXPECT_EQ(number(&report_, "total heft"), number(member(member(&report_, "summary"), "total"), "dirty"));
}

TEST_F(HTLiveProcessE2ETest, FileMappingsAndLibrariesAreNamedByPath)
{
    constexpr uint64_t kSize = 8 * kMiB;
    const std::string path = directory_.file("mapped.bin");
    std::ofstream(path).close();
    std::filesystem::resize_file(path, kSize);
    ASSERT_TRUE(layOutAndMeasure({"file", path, n(kSize), n(kSize)}));
    // Writeback may clean written pages after heft read them, never the other way round.
    std::string mapping = mappingAt(child_->pid(), child_->value(0));
    uint64_t dirtyAfter = kernelField(mapping, "Private_Dirty") + kernelField(mapping, "Shared_Dirty");
    expectHeftMatchesKernel(report_, child_->pid(), kSize - dirtyAfter);
    const rapidjson::Value* process = processIn(report_, child_->pid());
    const std::string category = "mapped file " + path;
    EXPECT_EQ(figure(process, category, "dirty") + figure(process, category, "clean"), kSize) << text_.standardOutput;
    EXPECT_GE(figure(process, category, "dirty"), dirtyAfter);
    EXPECT_EQ(figure(process, category, "regions"), 1u);
    EXPECT_EQ(nameOf(regionAt(process, child_->value(0))), category);

    // The C library is an image: its code is named by role and path.
    const rapidjson::Value* categories = member(process, "categories");
    ASSERT_TRUE(categories && categories->IsObject());
    auto libc = std::find_if(categories->MemberBegin(), categories->MemberEnd(), [](const auto& entry) {
        std::string name = entry.name.GetString();
        return name.starts_with("__TEXT /") && name.find("/libc.so") != std::string::npos;
    });
    ASSERT_NE(libc, categories->MemberEnd()) << text_.standardOutput;
    EXPECT_GT(number(&libc->value, "clean") + number(&libc->value, "dirty"), 0u);
}

TEST_F(HTLiveProcessE2ETest, ProcessWhoseMainThreadExitedIsMeasuredThroughALiveThread)
{
    ASSERT_TRUE(layOutAndMeasure({"anon", n(64 * kMiB), "exit-main"}));
    expectHeftMatchesKernel(report_, child_->pid(), 0, static_cast<pid_t>(child_->value(1)));
    const rapidjson::Value* process = processIn(report_, child_->pid());
    EXPECT_EQ(number(regionAt(process, child_->value(0)), "dirty"), 64 * kMiB);
    EXPECT_EQ(member(process, "warnings"), nullptr) << text_.standardOutput;
    EXPECT_EQ(member(process, "errors"), nullptr) << text_.standardOutput;
}

TEST_F(HTLiveProcessE2ETest, ManyProcessesUnderALowOpenFileLimit)
{
    // Far more processes than heft may open files, a limit it cannot raise: it measures every one all the same.
    constexpr int kChildren = 300;
    HTLayoutChild family({"anon", n(kChildren * kMiB / 16), "fork", n(kChildren), n(kMiB / 16), n(kMiB)});
    ASSERT_EQ(family.line(1).size(), static_cast<size_t>(kChildren));
    std::vector<std::string> arguments = {"heft", "-j", directory_.file("many.json"), family.pidString()};
    for (uint64_t pid : family.line(1)) arguments.push_back(n(pid));
    Outcome outcome = runProgram(kHeftBinary, arguments, 64);
    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    EXPECT_THAT(outcome.standardError, Not(HasSubstr("open files")));
    ASSERT_TRUE(loadReport(directory_.file("many.json"), report_));
    EXPECT_EQ(arrayIn(&report_, "processes").Size(), kChildren + 1u);
    for (const auto& process : arrayIn(&report_, "processes"))
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
        // Not the test itself, which built with a sanitizer reserves terabytes of shadow memory.
        Outcome outcome = runHeft({"-a", "-x", n(getpid()), "-j", path});
        EXPECT_EQ(outcome.status, 0) << outcome.standardError;
        EXPECT_THAT(outcome.standardOutput, HasSubstr("\nSummary Heft: "));
        EXPECT_TRUE(loadReport(path, report_) && report_.HasMember("total heft"));
        EXPECT_GT(arrayIn(&report_, "processes").Size(), 1u);
    }
}

}  // namespace
