// The built heft measuring a family of processes that share memory only
// because they forked: anonymous memory the parent wrote, pages it pushed to
// swap and a file it mapped privately, all still mapped by the children
// where they did not write them. Every process's heft holds all the pages it
// maps; the summary holds each page once, and the tables show each page with
// exactly the processes that map it. The figures are checked against the
// kernel's own count of the family's distinct memory.

#include "e2e/HTE2EReport.h"
#include "e2e/HTE2ESupport.h"

#include <rapidjson/document.h>

#include <set>

namespace {

using namespace heft_e2e;

constexpr const char* kUntagged = "untagged (\"VM_ALLOCATE\")";
constexpr const char* kUnidentifiedNotice =
    "Memory shared after fork may be counted more than once: telling its pages apart needs root\n";

// Beyond what the layout program writes, a process writes a few pages of
// anonymous memory of its own (the C library's and the allocator's), and a
// child a few more after the fork; a table of the layout may hold this much
// over it.
constexpr uint64_t kSlack = 128 * 1024;

std::set<int> pidsOf(const rapidjson::Value& shared)
{
    std::set<int> pids;
    if (shared.HasMember("pids") && shared["pids"].IsArray()) {
        for (const auto& pid : shared["pids"].GetArray()) pids.insert(pid.GetInt());
    }
    return pids;
}

// The table common to exactly `pids`; null when there is none.
const rapidjson::Value* sharedBy(const rapidjson::Document& report, const std::set<int>& pids)
{
    if (!report.HasMember("shared") || !report["shared"].IsArray()) return nullptr;
    for (const auto& shared : report["shared"].GetArray()) {
        if (!shared.HasMember("specific_to_pid") && pidsOf(shared) == pids) return &shared;
    }
    return nullptr;
}

uint64_t figure(const rapidjson::Value* owner, const std::string& category, const char* key)
{
    const rapidjson::Value* found = owner ? categoryIn(*owner, category) : nullptr;
    return found ? number(*found, key) : 0;
}

// What a process's own table holds besides its page tables (which no other
// process can share).
uint64_t ownDirtyBesidesPageTables(const rapidjson::Value* process)
{
    uint64_t total = 0;
    const rapidjson::Value* categories = process ? member(*process, "categories") : nullptr;
    if (!categories || !categories->IsObject()) return 0;
    for (const auto& entry : categories->GetObject()) {
        if (std::string(entry.name.GetString()) != "page table") total += number(entry.value, "dirty");
    }
    return total;
}

// A category's figure as `pid` sees it: its own table and every table shared
// with it, in the view it is given of them.
uint64_t figureAsSeenBy(const rapidjson::Document& report, pid_t pid, const std::string& category, const char* key)
{
    uint64_t total = figure(processIn(report, pid), category, key);
    for (const auto& shared : report["shared"].GetArray()) {
        bool mine = shared.HasMember("specific_to_pid") ? shared["specific_to_pid"].GetInt() == pid
                                                        : pidsOf(shared).count(pid) != 0;
        if (mine) total += figure(&shared, category, key);
    }
    return total;
}

void writeFile(const std::string& path, uint64_t size, bool writtenBack)
{
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    ASSERT_GE(fd, 0) << std::strerror(errno);
    std::string block(kMiB, '\x5a');
    for (uint64_t written = 0; written < size; written += block.size()) {
        ASSERT_EQ(write(fd, block.data(), block.size()), static_cast<ssize_t>(block.size()));
    }
    EXPECT_TRUE(!writtenBack || fsync(fd) == 0) << std::strerror(errno);
    close(fd);
}

class HTForkSharingE2ETest : public testing::Test {
protected:
    void SetUp() override
    {
        if (geteuid() != 0) GTEST_SKIP() << "telling pages shared after a fork apart needs the page frames (root)";
        ASSERT_TRUE(directory_.ok()) << "mkdtemp: " << std::strerror(errno);
        if (LayoutProgram::shared().path().empty()) GTEST_SKIP() << LayoutProgram::shared().reason();
    }

    Outcome measure(const LaidOutFamily& family, rapidjson::Document& report)
    {
        std::string path = directory_.file("family.json");
        unlink(path.c_str());
        Outcome outcome = runHeft({"-v", "-w", "-f", "bytes", "-j", path, "-t", std::to_string(family.parent())});
        EXPECT_EQ(outcome.status, 0) << outcome.standardError;
        loadReport(path, report);
        return outcome;
    }

    // The summary counts each page of the family once, as the kernel's
    // shares do when summed over the family. 1%: heft and the kernel's
    // figures are read a moment apart, in which the children's stacks and
    // the C library's data may change by a page or two; a page counted once
    // per process would be off by far more.
    void expectSummaryIsTheFamilysDistinctMemory(const rapidjson::Document& report, const LaidOutFamily& family)
    {
        uint64_t kernel = 0;
        for (int pid : family.all()) kernel += kernelShareOfHeft(pid);
        EXPECT_NEAR(static_cast<double>(number(report["summary"]["total"], "dirty")), static_cast<double>(kernel),
                    static_cast<double>(kernel) / 100);
        // Every process's heft still holds all the pages it maps. Anonymous
        // memory of blocked processes stays as it is: the two agree exactly.
        for (int pid : family.all()) {
            const rapidjson::Value* process = processIn(report, pid);
            ASSERT_NE(process, nullptr) << "pid " << pid;
            EXPECT_EQ(number(*process, "heft"), kernelHeft(pid)) << "pid " << pid;
        }
    }

    TempDir directory_;
};

TEST_F(HTForkSharingE2ETest, ForkedMemoryCountsOnceWithExactlyTheProcessesThatMapIt)
{
    const PreforkLayout layout;
    LaidOutFamily family(layout);
    ASSERT_TRUE(family.ready());
    rapidjson::Document report;
    Outcome text = measure(family, report);
    expectSummaryIsTheFamilysDistinctMemory(report, family);
    EXPECT_NE(text.standardOutput.find("\nSummary Heft: " +
                                       std::to_string(number(report["summary"]["total"], "dirty")) + " B\n"),
              std::string::npos);

    // Untouched by the children, the shared mapping is the five's; the slice
    // a child wrote is its own copy, and the parent's original is left to
    // the other four.
    const uint64_t untouched = layout.shared - layout.children * layout.slice;
    EXPECT_GE(figure(sharedBy(report, family.all()), kUntagged, "dirty"), untouched);
    EXPECT_LE(figure(sharedBy(report, family.all()), kUntagged, "dirty"), untouched + kSlack);
    for (pid_t child : family.children()) {
        SCOPED_TRACE("child " + std::to_string(child));
        EXPECT_GE(figure(processIn(report, child), kUntagged, "dirty"), layout.own + layout.slice);
        EXPECT_LE(ownDirtyBesidesPageTables(processIn(report, child)), layout.own + layout.slice + kSlack);
        std::set<int> others = family.all();
        others.erase(child);
        EXPECT_GE(figure(sharedBy(report, others), kUntagged, "dirty"), layout.slice);
        EXPECT_LE(figure(sharedBy(report, others), kUntagged, "dirty"), layout.slice + kSlack);
    }
    EXPECT_GE(figure(processIn(report, family.parent()), kUntagged, "dirty"), layout.after);
    EXPECT_LE(ownDirtyBesidesPageTables(processIn(report, family.parent())), layout.after + kSlack);
}

TEST_F(HTForkSharingE2ETest, PagesSwappedBeforeTheForkCountOnce)
{
    SwapArea swap;
    if (!swap.available()) GTEST_SKIP() << "no swap: " << swap.reason();
    const PreforkLayout layout{.pagedOut = 16 * kMiB};
    LaidOutFamily family(layout);
    ASSERT_TRUE(family.ready());
    if (family.pageoutError() != 0) GTEST_SKIP() << "MADV_PAGEOUT: " << std::strerror(family.pageoutError());
    rapidjson::Document report;
    measure(family, report);

    // Every process maps the same swap slots; nothing else of the family is
    // out (there is no memory pressure that would push it). The slots stay
    // as they are while the family sits still.
    uint64_t swappedOnce = smapsOfMappingAt(family.parent(), family.sharedAddress())["Swap"];
    EXPECT_GT(swappedOnce, layout.pagedOut / 2) << "the kernel left most pages in memory";
    EXPECT_EQ(number(report["summary"]["total"], "swapped"), swappedOnce);
    EXPECT_EQ(figure(sharedBy(report, family.all()), kUntagged, "swapped"), swappedOnce);
    expectSummaryIsTheFamilysDistinctMemory(report, family);
}

TEST_F(HTForkSharingE2ETest, PrivateFileMappingCountsItsCopiesAndItsFilePagesOnce)
{
    constexpr uint64_t kFileSize = 8 * kMiB;
    for (bool writtenBack : {true, false}) {
        const char* name = writtenBack ? "written-back.bin" : "still-dirty.bin";
        SCOPED_TRACE(name);
        const PreforkLayout layout{.shared = 4 * kMiB, .slice = 64 * 1024, .own = kMiB, .after = kMiB, .file = "written",
                            .path = directory_.file(name)};
        ASSERT_NO_FATAL_FAILURE(writeFile(layout.path, kFileSize, writtenBack));
        LaidOutFamily family(layout);
        ASSERT_TRUE(family.ready());
        rapidjson::Document report;
        measure(family, report);
        const std::string category = "mapped file " + layout.path;

        // The parent wrote the first half (its copies, which the children
        // inherit) and read the second (the file's pages, whether still
        // dirty in the page cache or written back). Each counts once.
        const rapidjson::Value* summary = member(report["summary"], category);
        ASSERT_NE(summary, nullptr);
        EXPECT_EQ(number(*summary, "dirty") + number(*summary, "clean"), kFileSize)
            << "the parent's own table holds " << figure(processIn(report, family.parent()), category, "dirty");
        EXPECT_GE(number(*summary, "dirty"), kFileSize / 2);
        if (writtenBack) {
            EXPECT_EQ(number(*summary, "dirty"), kFileSize / 2);
            EXPECT_EQ(number(*summary, "clean"), kFileSize / 2);
        }
        EXPECT_GE(figure(sharedBy(report, family.all()), category, "dirty"), kFileSize / 2);

        // Writeback may clean the file's pages after heft read them, never
        // the other way round.
        for (int pid : family.all()) {
            uint64_t heft = number(*processIn(report, pid), "heft");
            EXPECT_GE(heft, kernelHeft(pid)) << "pid " << pid;
            EXPECT_LE(heft, kernelHeft(pid) + (writtenBack ? 0 : kFileSize / 2)) << "pid " << pid;
        }
    }
}

TEST_F(HTForkSharingE2ETest, SummaryHoldsTheFilePagesOnlyTheParentHasResident)
{
    // A read-only private mapping has no copies, so fork leaves the child's
    // page tables for it empty: only the parent has the file's pages mapped,
    // in two runs with a gap between them.
    constexpr uint64_t kFileSize = 8 * kMiB;
    const PreforkLayout layout{.shared = kMiB, .children = 1, .slice = 64 * 1024, .own = kMiB, .after = kMiB,
                        .file = "read", .path = directory_.file("read.bin")};
    ASSERT_NO_FATAL_FAILURE(writeFile(layout.path, kFileSize, true));
    LaidOutFamily family(layout);
    ASSERT_TRUE(family.ready());
    rapidjson::Document report;
    measure(family, report);
    const std::string category = "mapped file " + layout.path;

    uint64_t residentInParent = smapsOfMappingAt(family.parent(), family.fileAddress())["Rss"];
    EXPECT_GE(residentInParent, kFileSize / 2);
    EXPECT_EQ(smapsOfMappingAt(family.children()[0], family.fileAddress())["Rss"], 0u);
    uint64_t parentClean = figureAsSeenBy(report, family.parent(), category, "clean");
    EXPECT_GE(parentClean, residentInParent);
    const rapidjson::Value* summary = member(report["summary"], category);
    ASSERT_NE(summary, nullptr);
    EXPECT_GE(number(*summary, "clean"), parentClean);
    EXPECT_LE(number(*summary, "clean"), kFileSize);
}

TEST_F(HTForkSharingE2ETest, WithoutRootHeftSaysOnceThatForkedMemoryMayCountTwice)
{
    if (access(kSetpriv, X_OK) != 0) GTEST_SKIP() << kSetpriv << " is needed to change the user";
    const PreforkLayout layout{.shared = 4 * kMiB, .children = 3, .slice = 64 * 1024, .own = kMiB, .after = kMiB};
    LaidOutFamily family(layout, kNobody);
    ASSERT_TRUE(family.ready());
    const std::string parent = std::to_string(family.parent());

    Outcome outcome = runHeftAsNobody({"-t", parent});
    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    size_t first = outcome.standardError.find(kUnidentifiedNotice);
    EXPECT_NE(first, std::string::npos) << outcome.standardError;
    EXPECT_EQ(outcome.standardError.find(kUnidentifiedNotice, first + 1), std::string::npos)
        << outcome.standardError;

    // Root tells the pages apart, and has nothing to say.
    outcome = runHeft({"-t", parent});
    EXPECT_EQ(outcome.status, 0);
    EXPECT_EQ(outcome.standardError.find(kUnidentifiedNotice), std::string::npos) << outcome.standardError;
}

}  // namespace
