// The built heft measuring a family of processes that share memory only
// because they forked: anonymous memory the parent wrote, pages it pushed to
// swap and a file it mapped privately, all still mapped by the children
// where they did not write them. Every process's heft holds all the pages it
// maps; the summary holds each page once, and the tables show each page with
// exactly the processes that map it. The figures are checked against the
// kernel's own count of the family's distinct memory.

#include "e2e/HTE2EReport.h"

#include <rapidjson/document.h>

#include <optional>

namespace {

using namespace heft_e2e;

constexpr const char* kUnidentifiedNotice =
    "Memory shared after fork may be counted more than once: telling its pages apart needs root\n";
constexpr uint64_t kFileSize = 8 * kMiB;

// Beyond what the layout program writes, a process writes a few pages of
// anonymous memory of its own (the C library's and the allocator's), and a
// child a few more after the fork; a table of the layout may hold this much
// over it.
constexpr uint64_t kSlack = 128 * 1024;

// What a process's own table holds besides its page tables (which no other
// process can share).
uint64_t ownDirtyBesidesPageTables(const rapidjson::Value* process)
{
    const rapidjson::Value* categories = process ? member(*process, "categories") : nullptr;
    uint64_t total = 0;
    if (categories && categories->IsObject()) {
        for (const auto& entry : categories->GetObject())
            total += entry.name == "page table" ? 0 : number(entry.value, "dirty");
    }
    return total;
}

class HTForkSharingE2ETest : public HTE2EReportTest {
protected:
    void SetUp() override
    {
        if (geteuid() != 0) GTEST_SKIP() << "telling pages shared after a fork apart needs the page frames (root)";
        HTE2EReportTest::SetUp();
    }

    // Lays out `layout`, first writing the file it maps (when it maps one),
    // written back or left dirty in the page cache; then runs heft on the
    // family.
    void layOutAndMeasure(const PreforkLayout& layout, bool writtenBack = true)
    {
        if (layout.path != "-") {
            // Written a MiB at a time: written at once, the file may land in
            // page cache folios big enough for the parent to map by the
            // page-middle directory, which fork does not copy, and the
            // children would not share the pages this test is about.
            int fd = open(layout.path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
            ASSERT_GE(fd, 0) << std::strerror(errno);
            std::string block(kMiB, '\x5a');
            for (uint64_t written = 0; written < kFileSize; written += kMiB) {
                ASSERT_EQ(write(fd, block.data(), kMiB), static_cast<ssize_t>(kMiB));
            }
            EXPECT_TRUE(!writtenBack || fsync(fd) == 0) << std::strerror(errno);
            close(fd);
        }
        family_.emplace(layout);
        ASSERT_TRUE(family_->ready());
        text_ = runForReport({"-t", std::to_string(family_->parent())}, report_);
    }

    // The summary counts each page of the family once, as the kernel's
    // shares do when summed over the family. 1%: heft and the kernel's
    // figures are read a moment apart, in which the children's stacks and
    // the C library's data may change by a page or two; a page counted once
    // per process would be off by far more. Every process's heft still holds
    // all the pages it maps.
    void expectSummaryIsTheFamilysDistinctMemory()
    {
        uint64_t kernel = 0;
        for (int pid : family_->all()) kernel += kernelHeft(pid, true);
        EXPECT_NEAR(static_cast<double>(number(report_["summary"]["total"], "dirty")), static_cast<double>(kernel),
                    static_cast<double>(kernel) / 100);
        for (int pid : family_->all()) expectHeftMatchesKernel(report_, pid);
    }

    std::optional<LaidOutFamily> family_;
    rapidjson::Document report_;
    Outcome text_;
};

TEST_F(HTForkSharingE2ETest, ForkedAndSwappedMemoryCountsOnceWithExactlyTheProcessesThatMapIt)
{
    SwapArea swap;  // without one the paged-out pages stay in memory, dirty
    const PreforkLayout layout{.pagedOut = 16 * kMiB};
    ASSERT_NO_FATAL_FAILURE(layOutAndMeasure(layout));
    expectSummaryIsTheFamilysDistinctMemory();
    EXPECT_NE(text_.standardOutput.find(
                  "\nSummary Heft: " + std::to_string(number(report_["summary"]["total"], "dirty")) + " B\n"),
              std::string::npos);

    // Untouched by the children, the shared mapping is the five's; the slice
    // a child wrote is its own copy, and the parent's original is left to
    // the other four. Dirty figures include the swapped pages.
    const uint64_t untouched = layout.shared - layout.children * layout.slice;
    EXPECT_PRED3(between, figure(sharedBy(report_, family_->all()), kUntagged, "dirty"), untouched, untouched + kSlack);
    for (pid_t child : family_->children()) {
        SCOPED_TRACE("child " + std::to_string(child));
        EXPECT_GE(figure(processIn(report_, child), kUntagged, "dirty"), layout.own + layout.slice);
        EXPECT_LE(ownDirtyBesidesPageTables(processIn(report_, child)), layout.own + layout.slice + kSlack);
        std::set<int> others = family_->all();
        others.erase(child);
        uint64_t slice = figure(sharedBy(report_, others), kUntagged, "dirty");
        EXPECT_PRED3(between, slice, layout.slice, layout.slice + kSlack);
    }
    EXPECT_GE(figure(processIn(report_, family_->parent()), kUntagged, "dirty"), layout.after);
    EXPECT_LE(ownDirtyBesidesPageTables(processIn(report_, family_->parent())), layout.after + kSlack);

    // Every process maps the same swap slots; nothing else of the family is
    // out (there is no memory pressure that would push it). The slots stay
    // as they are while the family sits still.
    uint64_t swappedOnce = kernelField(mappingAt(family_->parent(), family_->sharedAddress()), "Swap");
    EXPECT_EQ(number(report_["summary"]["total"], "swapped"), swappedOnce);
    EXPECT_EQ(figure(sharedBy(report_, family_->all()), kUntagged, "swapped"), swappedOnce);
    if (!swap.available() || family_->pageoutError() != 0) {
        GTEST_SKIP() << "no swap (" << swap.reason() << ") or MADV_PAGEOUT: " << std::strerror(family_->pageoutError());
    }
    EXPECT_GT(swappedOnce, layout.pagedOut / 2) << "the kernel left most pages in memory";
}

TEST_F(HTForkSharingE2ETest, PrivateFileMappingCountsItsCopiesAndItsFilePagesOnce)
{
    for (bool writtenBack : {true, false}) {
        const char* name = writtenBack ? "written-back.bin" : "still-dirty.bin";
        SCOPED_TRACE(name);
        const PreforkLayout layout{.shared = 4 * kMiB,
                                   .slice = 64 * 1024,
                                   .own = kMiB,
                                   .after = kMiB,
                                   .file = "written",
                                   .path = directory_.file(name)};
        ASSERT_NO_FATAL_FAILURE(layOutAndMeasure(layout, writtenBack));

        // The parent wrote the first half (its copies, which the children
        // inherit) and read the second (the file's pages, whether still
        // dirty in the page cache or written back). Each counts once.
        const std::string category = "mapped file " + layout.path;
        const rapidjson::Value* summary = member(report_["summary"], category);
        ASSERT_NE(summary, nullptr);
        EXPECT_EQ(number(*summary, "dirty") + number(*summary, "clean"), kFileSize)
            << "the parent's own table holds " << figure(processIn(report_, family_->parent()), category, "dirty");
        EXPECT_GE(number(*summary, "dirty"), kFileSize / 2);
        EXPECT_TRUE(!writtenBack || number(*summary, "dirty") == kFileSize / 2) << number(*summary, "dirty");
        EXPECT_GE(figure(sharedBy(report_, family_->all()), category, "dirty"), kFileSize / 2);

        // Writeback may clean the file's pages after heft read them, never
        // the other way round.
        for (int pid : family_->all()) expectHeftMatchesKernel(report_, pid, writtenBack ? 0 : kFileSize / 2);
    }
}

TEST_F(HTForkSharingE2ETest, SummaryHoldsTheFilePagesOnlyTheParentHasResident)
{
    // A read-only private mapping has no copies, so fork leaves the child's
    // page tables for it empty: only the parent has the file's pages mapped,
    // in two runs with a gap between them.
    const PreforkLayout layout{.shared = kMiB,
                               .children = 1,
                               .slice = 64 * 1024,
                               .own = kMiB,
                               .after = kMiB,
                               .file = "read",
                               .path = directory_.file("read.bin")};
    ASSERT_NO_FATAL_FAILURE(layOutAndMeasure(layout));
    const std::string category = "mapped file " + layout.path;

    uint64_t residentInParent = kernelField(mappingAt(family_->parent(), family_->fileAddress()), "Rss");
    EXPECT_GE(residentInParent, kFileSize / 2);
    EXPECT_EQ(kernelField(mappingAt(family_->children()[0], family_->fileAddress()), "Rss"), 0u);
    // The parent sees the pages in its own table and in the ones it shares.
    uint64_t parentClean = figure(processIn(report_, family_->parent()), category, "clean");
    for (const auto& shared : arrayIn(report_, "shared")) {
        bool mine = shared.HasMember("specific_to_pid") ? shared["specific_to_pid"].GetInt() == family_->parent()
                                                        : pidsOf(shared).count(family_->parent()) != 0;
        if (mine) parentClean += figure(&shared, category, "clean");
    }
    EXPECT_GE(parentClean, residentInParent);
    const rapidjson::Value* summary = member(report_["summary"], category);
    ASSERT_NE(summary, nullptr);
    EXPECT_PRED3(between, number(*summary, "clean"), parentClean, kFileSize);
}

TEST_F(HTForkSharingE2ETest, WithoutRootHeftMeasuresItsOwnProcessesAndSaysOnceThatForkedMemoryMayCountTwice)
{
    if (access(kSetpriv, X_OK) != 0) GTEST_SKIP() << kSetpriv << " is needed to change the user";
    ASSERT_EQ(chmod(directory_.path.c_str(), 0777), 0);
    const PreforkLayout layout{.shared = 4 * kMiB, .children = 3, .slice = 64 * 1024, .own = kMiB, .after = kMiB};
    LaidOutFamily family(layout, kNobody);
    ASSERT_TRUE(family.ready());
    const std::string path = directory_.file("nobody.json");
    std::vector<std::string> arguments = {"-v", "-j", path, "1"};
    for (int pid : family.all()) arguments.push_back(std::to_string(pid));

    // Init is not nobody's to read: it is left out, and the rest measured.
    Outcome outcome = runHeftAsNobody(arguments);
    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    EXPECT_NE(outcome.standardError.find("Unable to analyze process with pid 1 (try as root?)\n"), std::string::npos)
        << outcome.standardError;
    size_t first = outcome.standardError.find(kUnidentifiedNotice);
    EXPECT_NE(first, std::string::npos) << outcome.standardError;
    EXPECT_EQ(outcome.standardError.find(kUnidentifiedNotice, first + 1), std::string::npos) << outcome.standardError;
    rapidjson::Document report;
    ASSERT_TRUE(loadReport(path, report));
    EXPECT_EQ(processIn(report, 1), nullptr);
    // Without root the page flags are hidden, but the region figures come
    // from the processes' own smaps, which their owner may read in full.
    for (int pid : family.all()) expectHeftMatchesKernel(report, pid);
    const rapidjson::Value* process = processIn(report, family.parent());
    ASSERT_NE(process, nullptr);
    const rapidjson::Value& region = regionAt(*process, family.sharedAddress());
    EXPECT_EQ(number(region, "dirty"), layout.shared);

    // Root tells the pages apart, and has nothing to say.
    outcome = runHeft({"-t", std::to_string(family.parent())});
    EXPECT_EQ(outcome.status, 0);
    EXPECT_EQ(outcome.standardError.find(kUnidentifiedNotice), std::string::npos) << outcome.standardError;
}

}  // namespace
