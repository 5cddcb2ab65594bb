// A family sharing memory since it forked: each heft holds all the pages the process maps, the summary each page
// once, and the tables each page with exactly the processes that map it.

#include "e2e/HTE2ESupport.h"

namespace {

using namespace heft_e2e;
using testing::HasSubstr, testing::Not;

constexpr const char* kUnidentifiedNotice =
    "Memory shared after fork may be counted more than once: telling its pages apart needs root\n";
constexpr const char* kNeedsRoot = "telling pages shared after a fork apart needs the page frames (root)";
constexpr uint64_t kFileSize = 8 * kMiB;
// What a table may hold besides the layout: pages the C library and the allocator write.
constexpr uint64_t kSlack = 128 * 1024;

// The parent writes `shared`, lays out `extra`, forks children (each writes a slice and `own`), writes `after`.
struct Family {
    uint64_t shared = 4 * kMiB, children = 4, slice = 64 * 1024, own = kMiB, after = kMiB;
    std::vector<std::string> extra;

    std::vector<std::string> directives() const
    {
        std::vector<std::string> all = {"anon", n(shared)};
        all.insert(all.end(), extra.begin(), extra.end());
        all.insert(all.end(), {"fork", n(children), n(slice), n(own), "anon", n(after)});
        return all;
    }
    std::set<int> members(const HTLayoutChild& parent) const
    {
        const std::vector<uint64_t>& pids = parent.line(extra.empty() ? 1 : 2);
        std::set<int> all(pids.begin(), pids.end());
        all.insert(parent.pid());
        return all;
    }
};

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
    void measureFamily(const Family& layout)
    {
        ASSERT_TRUE(layOutAndMeasure(layout.directives(), {"-t"}));
        members_ = layout.members(*child_);
        ASSERT_EQ(members_.size(), layout.children + 1);
    }

    const rapidjson::Value* summary(const char* category) { return member(member(&report_, "summary"), category); }

    std::set<int> members_;
};

TEST_F(HTForkSharingE2ETest, ForkedAndSwappedMemoryCountsOnceWithExactlyTheProcessesThatMapIt)
{
    if (geteuid() != 0) GTEST_SKIP() << kNeedsRoot;
    SwapArea swap;  // without one the paged-out pages stay in memory, dirty
    const Family layout{64 * kMiB, 4, kMiB, 8 * kMiB, 16 * kMiB, {"pageout", n(16 * kMiB)}};
    ASSERT_NO_FATAL_FAILURE(measureFamily(layout));
    const pid_t parent = child_->pid();

    // Each page once, as the kernel's shares summed over the family; 1% for pages written between the two reads.
    uint64_t kernel = 0;
    for (int pid : members_) kernel += kernelHeft(pid, true);
    const uint64_t total = number(summary("total"), "dirty");
    EXPECT_NEAR(static_cast<double>(total), static_cast<double>(kernel), static_cast<double>(kernel) / 100);
    for (int pid : members_) expectHeftMatchesKernel(report_, pid);
    EXPECT_THAT(text_.standardOutput, HasSubstr("\nSummary Heft: " + n(total) + " B\n"));
    EXPECT_THAT(text_.standardError, Not(HasSubstr(kUnidentifiedNotice)));  // root tells them apart

    // What the children left untouched, the swapped pages too (dirty figures include swap), is the five's; the slice
    // a child wrote is its own copy, and the parent's original the other four's.
    const uint64_t untouched = layout.shared - layout.children * layout.slice + 16 * kMiB;
    EXPECT_PRED3(between, figure(sharedBy(report_, members_), kUntagged, "dirty"), untouched, untouched + kSlack);
    for (int pid : members_) {
        SCOPED_TRACE("pid " + n(pid));
        const uint64_t own = pid == parent ? layout.after : layout.own + layout.slice;
        EXPECT_GE(figure(processIn(report_, pid), kUntagged, "dirty"), own);
        EXPECT_LE(ownDirtyBesidesPageTables(processIn(report_, pid)), own + kSlack);
        if (pid == parent) continue;
        std::set<int> others = members_;
        others.erase(pid);
        EXPECT_PRED3(between, figure(sharedBy(report_, others), kUntagged, "dirty"), layout.slice,
                     layout.slice + kSlack);
    }

    // Every process maps the same swap slots, which stay as they are; nothing else of the family is out.
    uint64_t swapped = kernelField(mappingAt(parent, child_->value(1)), "Swap");
    EXPECT_EQ(number(summary("total"), "swapped"), swapped);
    EXPECT_EQ(figure(sharedBy(report_, members_), kUntagged, "swapped"), swapped);
    if (!swap.available || child_->value(1, 1) != 0)
        GTEST_SKIP() << "no swap (" << swap.reason << ") or MADV_PAGEOUT failed";
    EXPECT_GT(swapped, 8 * kMiB) << "the kernel left most pages in memory";
}

TEST_F(HTForkSharingE2ETest, PrivateFileMappingsCountTheirCopiesAndTheirFilePagesOnce)
{
    if (geteuid() != 0) GTEST_SKIP() << kNeedsRoot;
    // Written: the parent's copies of the first half, which the children inherit, then file pages. Read: no copies,
    // so the child's page tables for it stay empty; only the parent maps file pages, in two runs.
    for (const auto& [read, writtenBack] : {std::pair{false, true}, std::pair{false, false}, std::pair{true, true}}) {
        const std::string path = directory_.file(writtenBack ? "written-back.bin" : "dirty.bin");
        SCOPED_TRACE((read ? "read " : "written ") + path);
        // A MiB at a time: at once, it may land in folios mapped by page-middle directories, which fork does not copy.
        int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        ASSERT_GE(fd, 0) << std::strerror(errno);
        for (uint64_t written = 0; written < kFileSize; written += kMiB)
            ASSERT_EQ(write(fd, std::string(kMiB, 'Z').data(), kMiB), static_cast<ssize_t>(kMiB));
        EXPECT_TRUE(!writtenBack || fsync(fd) == 0) << std::strerror(errno);
        close(fd);
        const Family layout{.children = read ? 1u : 4u, .extra = {"private", path, read ? "read" : "written"}};
        ASSERT_NO_FATAL_FAILURE(measureFamily(layout));
        const pid_t parent = child_->pid();
        const std::string category = "mapped file " + path;
        const uint64_t dirty = number(summary(category.c_str()), "dirty"),
                       clean = number(summary(category.c_str()), "clean");
        if (!read) {
            EXPECT_EQ(dirty + clean, kFileSize);
            EXPECT_GE(dirty, kFileSize / 2);
            EXPECT_TRUE(!writtenBack || dirty == kFileSize / 2) << dirty;
            EXPECT_GE(figure(sharedBy(report_, members_), category, "dirty"), kFileSize / 2);
            // Writeback may clean pages after heft read them, never the other way round.
            for (int pid : members_) expectHeftMatchesKernel(report_, pid, writtenBack ? 0 : kFileSize / 2);
            continue;
        }
        const auto child = static_cast<pid_t>(child_->value(2));
        uint64_t resident = kernelField(mappingAt(parent, child_->value(1)), "Rss");
        EXPECT_GE(resident, kFileSize / 2);
        EXPECT_EQ(kernelField(mappingAt(child, child_->value(1)), "Rss"), 0u);
        // The parent sees the pages in its own table and the ones it shares.
        uint64_t parentClean = figure(processIn(report_, parent), category, "clean");
        for (const auto& table : arrayIn(&report_, "shared"))
            if (table.HasMember("specific_to_pid") ? number(&table, "specific_to_pid") == static_cast<uint64_t>(parent)
                                                   : pidsOf(table).count(parent) != 0)
                parentClean += figure(&table, category, "clean");
        EXPECT_GE(parentClean, resident);
        EXPECT_PRED3(between, clean, parentClean, kFileSize);
    }
}

TEST_F(HTForkSharingE2ETest, WithoutRootHeftMeasuresItsOwnProcessesAndSaysOnceThatForkedMemoryMayCountTwice)
{
    if (std::string why = whyNobodyCannotRun(); !why.empty()) GTEST_SKIP() << why;
    ASSERT_EQ(chmod(directory_.path.c_str(), 0777), 0);
    const Family layout{.children = 3, .extra = {}};
    HTLayoutChild family(layout.directives(), 65534);  // nobody
    ASSERT_TRUE(family.ready());
    const std::string path = directory_.file("nobody.json");
    std::vector<std::string> arguments = {"-v", "-j", path};
    for (int pid : layout.members(family)) arguments.push_back(n(pid));

    // The notice comes once, however many processes share forked memory.
    Outcome outcome = runHeftAsNobody(arguments);
    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    EXPECT_THAT(outcome.standardError, HoldsOnce(kUnidentifiedNotice));
    rapidjson::Document report;
    ASSERT_TRUE(loadReport(path, report));
    // The page flags are hidden, but the owner may read the processes' smaps, where the region figures come from.
    for (int pid : layout.members(family)) expectHeftMatchesKernel(report, pid);
    EXPECT_EQ(number(regionAt(processIn(report, family.pid()), family.value(0)), "dirty"), layout.shared);
}

}  // namespace
