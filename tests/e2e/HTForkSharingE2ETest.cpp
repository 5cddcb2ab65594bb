// The built heft measuring a family that shares memory only because it
// forked: anonymous memory the parent wrote, pages it pushed to swap and a
// file it mapped privately, still mapped by the children where they did not
// write them. Each process's heft holds all the pages it maps; the summary
// holds each page once, and the tables show each page with exactly the
// processes that map it.

#include "e2e/HTE2ESupport.h"

#include <optional>

namespace {

using namespace heft_e2e;

constexpr const char* kUnidentifiedNotice =
    "Memory shared after fork may be counted more than once: telling its pages apart needs root\n";
constexpr uint64_t kFileSize = 8 * kMiB;
// A process writes a few pages of its own (the C library's, the
// allocator's) besides what it lays out; a table may hold this much more.
constexpr uint64_t kSlack = 128 * 1024;

// What a parent lays out before and after forking its children: `shared`
// bytes written, of which child i overwrites slice i and then writes `own`
// bytes of its own; then, optionally, a separate mapping pushed to swap or a
// file mapped privately (directive 1); last, `after` bytes written.
struct Family {
    uint64_t shared = 64 * kMiB, children = 4, slice = kMiB, own = 8 * kMiB, after = 16 * kMiB;
    std::vector<std::string> extra;

    std::vector<std::string> directives() const
    {
        std::vector<std::string> all = {"anon", n(shared)};
        all.insert(all.end(), extra.begin(), extra.end());
        all.insert(all.end(), {"fork", n(children), n(slice), n(own), "anon", n(after)});
        return all;
    }
};

std::set<int> membersOf(const HTLayoutChild& family, const Family& layout)
{
    const std::vector<uint64_t>& children = family.line(layout.extra.empty() ? 1 : 2);
    std::set<int> all(children.begin(), children.end());
    all.insert(family.pid());
    return all;
}

uint64_t ownDirtyBesidesPageTables(const rapidjson::Value* process)
{
    uint64_t total = 0;
    const rapidjson::Value* categories = member(process, "categories");
    if (categories && categories->IsObject())
        for (const auto& entry : categories->GetObject())
            total += entry.name == "page table" ? 0 : number(&entry.value, "dirty");
    return total;
}

class HTForkSharingE2ETest : public HTE2EReportTest {
protected:
    void SetUp() override
    {
        if (geteuid() != 0) GTEST_SKIP() << "telling pages shared after a fork apart needs the page frames (root)";
        HTE2EReportTest::SetUp();
    }

    // Writes the file at `path` a MiB at a time (written at once, it may land
    // in folios big enough for the parent to map by the page-middle
    // directory, which fork does not copy), written back or left dirty.
    static void writeFile(const std::string& path, bool writtenBack)
    {
        int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        ASSERT_GE(fd, 0) << std::strerror(errno);
        std::string block(kMiB, '\x5a');
        for (uint64_t written = 0; written < kFileSize; written += kMiB)
            ASSERT_EQ(write(fd, block.data(), kMiB), static_cast<ssize_t>(kMiB));
        EXPECT_TRUE(!writtenBack || fsync(fd) == 0) << std::strerror(errno);
        close(fd);
    }

    void layOutAndMeasure(const Family& layout)
    {
        family_.emplace(layout.directives());
        ASSERT_TRUE(family_->ready());
        members_ = membersOf(*family_, layout);
        ASSERT_EQ(members_.size(), layout.children + 1);
        text_ = runForReport({"-t", family_->pidString()}, report_);
    }

    const rapidjson::Value* summary(const std::string& category)
    {
        return member(member(&report_, "summary"), category);
    }

    std::optional<HTLayoutChild> family_;
    std::set<int> members_;
    rapidjson::Document report_;
    Outcome text_;
};

TEST_F(HTForkSharingE2ETest, ForkedAndSwappedMemoryCountsOnceWithExactlyTheProcessesThatMapIt)
{
    SwapArea swap;  // without one the paged-out pages stay in memory, dirty
    const Family layout{.extra = {"pageout", n(16 * kMiB)}};
    ASSERT_NO_FATAL_FAILURE(layOutAndMeasure(layout));

    // The summary counts each page once, as the kernel's shares summed over
    // the family do. 1%: the two are read a moment apart, in which stacks
    // and the C library's data may change by a page or two; a page counted
    // once a process would be off by far more.
    uint64_t kernel = 0;
    for (int pid : members_) kernel += kernelHeft(pid, true);
    const uint64_t total = number(summary("total"), "dirty");
    EXPECT_NEAR(static_cast<double>(total), static_cast<double>(kernel), static_cast<double>(kernel) / 100);
    for (int pid : members_) expectHeftMatchesKernel(report_, pid);
    EXPECT_NE(text_.standardOutput.find("\nSummary Heft: " + n(total) + " B\n"), std::string::npos);

    // Untouched by the children, the shared mapping and the swapped one are
    // the five's; the slice a child wrote is its own copy, and the parent's
    // original is left to the other four. Dirty figures include swap.
    const uint64_t untouched = layout.shared - layout.children * layout.slice + 16 * kMiB;
    EXPECT_PRED3(between, figure(sharedBy(report_, members_), kUntagged, "dirty"), untouched, untouched + kSlack);
    for (int child : members_) {
        if (child == family_->pid()) continue;
        SCOPED_TRACE("child " + n(child));
        EXPECT_GE(figure(processIn(report_, child), kUntagged, "dirty"), layout.own + layout.slice);
        EXPECT_LE(ownDirtyBesidesPageTables(processIn(report_, child)), layout.own + layout.slice + kSlack);
        std::set<int> others = members_;
        others.erase(child);
        EXPECT_PRED3(between, figure(sharedBy(report_, others), kUntagged, "dirty"), layout.slice,
                     layout.slice + kSlack);
    }
    EXPECT_GE(figure(processIn(report_, family_->pid()), kUntagged, "dirty"), layout.after);
    EXPECT_LE(ownDirtyBesidesPageTables(processIn(report_, family_->pid())), layout.after + kSlack);

    // Every process maps the same swap slots, which stay as they are while
    // the family sits still; nothing else of it is out.
    uint64_t swapped = kernelField(mappingAt(family_->pid(), family_->value(1)), "Swap");
    EXPECT_EQ(number(summary("total"), "swapped"), swapped);
    EXPECT_EQ(figure(sharedBy(report_, members_), kUntagged, "swapped"), swapped);
    if (!swap.available() || family_->value(1, 1) != 0)
        GTEST_SKIP() << "no swap (" << swap.reason() << ") or MADV_PAGEOUT failed";
    EXPECT_GT(swapped, 8 * kMiB) << "the kernel left most pages in memory";
}

TEST_F(HTForkSharingE2ETest, PrivateFileMappingsCountTheirCopiesAndTheirFilePagesOnce)
{
    // Written: the parent wrote the first half (its copies, which the
    // children inherit) and read the second (the file's pages, still dirty
    // in the page cache or written back). Read: a read-only mapping has no
    // copies, so fork leaves the child's page tables for it empty, and only
    // the parent has the file's pages, in two runs with a gap between them.
    for (const char* how : {"written", "read"}) {
        for (bool writtenBack : {true, false}) {
            if (how == std::string("read") && !writtenBack) continue;
            const std::string path = directory_.file(writtenBack ? "written-back.bin" : "dirty.bin");
            SCOPED_TRACE(std::string(how) + " " + path);
            ASSERT_NO_FATAL_FAILURE(writeFile(path, writtenBack));
            const Family layout{.shared = 4 * kMiB,
                                .children = how == std::string("read") ? 1u : 4u,
                                .slice = 64 * 1024,
                                .own = kMiB,
                                .after = kMiB,
                                .extra = {"private", path, how}};
            ASSERT_NO_FATAL_FAILURE(layOutAndMeasure(layout));
            const std::string category = "mapped file " + path;
            const uint64_t dirty = number(summary(category), "dirty"), clean = number(summary(category), "clean");
            if (how == std::string("written")) {
                EXPECT_EQ(dirty + clean, kFileSize);
                EXPECT_GE(dirty, kFileSize / 2);
                EXPECT_TRUE(!writtenBack || dirty == kFileSize / 2) << dirty;
                EXPECT_GE(figure(sharedBy(report_, members_), category, "dirty"), kFileSize / 2);
                // Writeback may clean pages after heft read them, never the
                // other way round.
                for (int pid : members_) expectHeftMatchesKernel(report_, pid, writtenBack ? 0 : kFileSize / 2);
                continue;
            }
            const pid_t child = *members_.begin() == family_->pid() ? *members_.rbegin() : *members_.begin();
            uint64_t resident = kernelField(mappingAt(family_->pid(), family_->value(1)), "Rss");
            EXPECT_GE(resident, kFileSize / 2);
            EXPECT_EQ(kernelField(mappingAt(child, family_->value(1)), "Rss"), 0u);
            // The parent sees the pages in its own table and the ones it shares.
            uint64_t parentClean = figure(processIn(report_, family_->pid()), category, "clean");
            for (const auto& shared : arrayIn(report_, "shared")) {
                bool mine = shared.HasMember("specific_to_pid") ? shared["specific_to_pid"].GetInt() == family_->pid()
                                                                : pidsOf(shared).count(family_->pid()) != 0;
                if (mine) parentClean += figure(&shared, category, "clean");
            }
            EXPECT_GE(parentClean, resident);
            EXPECT_PRED3(between, clean, parentClean, kFileSize);
        }
    }
}

TEST_F(HTForkSharingE2ETest, WithoutRootHeftMeasuresItsOwnProcessesAndSaysOnceThatForkedMemoryMayCountTwice)
{
    if (access(kSetpriv, X_OK) != 0) GTEST_SKIP() << kSetpriv << " is needed to change the user";
    if (!everyoneMayRun(kHeftBinary) || !everyoneMayRun(HEFT_LAYOUT_PROGRAM))
        GTEST_SKIP() << "the user nobody may not run the programs of this build tree";
    ASSERT_EQ(chmod(directory_.path.c_str(), 0777), 0);
    const Family layout{.shared = 4 * kMiB, .children = 3, .slice = 64 * 1024, .own = kMiB, .after = kMiB, .extra = {}};
    HTLayoutChild family(layout.directives(), kNobody);
    ASSERT_TRUE(family.ready());
    const std::string path = directory_.file("nobody.json");
    std::vector<std::string> arguments = {"-v", "-j", path};
    for (int pid : membersOf(family, layout)) arguments.push_back(n(pid));

    // The notice comes once, however many processes share forked memory.
    Outcome outcome = runHeftAsNobody(arguments);
    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    size_t first = outcome.standardError.find(kUnidentifiedNotice);
    EXPECT_NE(first, std::string::npos) << outcome.standardError;
    EXPECT_EQ(outcome.standardError.find(kUnidentifiedNotice, first + 1), std::string::npos) << outcome.standardError;
    rapidjson::Document report;
    ASSERT_TRUE(loadReport(path, report));
    // Without root the page flags are hidden, but the region figures come
    // from the processes' own smaps, which their owner may read in full.
    for (int pid : membersOf(family, layout)) expectHeftMatchesKernel(report, pid);
    EXPECT_EQ(number(regionAt(processIn(report, family.pid()), family.value(0)), "dirty"), layout.shared);

    // Root tells the pages apart, and has nothing to say.
    outcome = runHeft({"-t", family.pidString()});
    EXPECT_EQ(outcome.status, 0);
    EXPECT_EQ(outcome.standardError.find(kUnidentifiedNotice), std::string::npos) << outcome.standardError;
}

}  // namespace
