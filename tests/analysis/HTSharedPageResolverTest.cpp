// Memory shared after a fork, from scripted page identities through to the
// objects, groups and totals of the analysis: each page counts once in the
// summary, shows in the tables of exactly the processes that map it, and
// counts in full in each of their hefts.

#include "analysis/HTHeftTestSupport.h"
#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"
#include "process/HTProcessGroup.h"
#include "process/HTUserProcess.h"

#include <set>

namespace {

constexpr uint64_t kStart = 0x10000;
constexpr int32_t kParent = 100, kFirstChild = 101, kSecondChild = 102;
constexpr int32_t kDirtyPage = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;

class HTSharedPageResolverTest : public HTAnalysisTest {
protected:
    void SetUp() override { settings_.breakDownPhysHeft = true; }

    // Private anonymous mappings of `identities.size()` written pages from
    // kStart, `regionPages` pages a mapping (all in one when 0), with a page
    // of gap between them; a page's identity is 0 when only its process
    // maps it.
    void addForkedProcess(int32_t pid, const std::vector<uint64_t>& identities, size_t regionPages = 0)
    {
        HTFakePlatform::Process& process = platform_->addProcess(pid, kParent, "worker");
        if (regionPages == 0) regionPages = identities.size();
        for (size_t first = 0; first < identities.size(); first += regionPages) {
            const size_t pages = std::min(regionPages, identities.size() - first);
            HTFakePlatform::Region region;
            region.start = kStart + first / regionPages * (regionPages + 1) * kPage;
            region.size = pages * kPage;
            region.info.protection = VM_PROT_READ | VM_PROT_WRITE;
            region.info.share_mode = SM_COW;
            region.info.ref_count = 2;
            region.info.pages_resident = region.info.pages_dirtied = static_cast<uint32_t>(pages);
            region.info.object_id_full = 0x4000000000000000 | static_cast<uint64_t>(pid) << 8 | first;
            process.regions.push_back(region);
            for (size_t i = 0; i < pages; ++i) {
                process.dispositions[region.start + i * kPage] = kDirtyPage;
                if (identities[first + i]) process.pageIdentities[region.start + i * kPage] = identities[first + i];
            }
        }
    }

    HTHeft::ProcessList created(const std::vector<int32_t>& pids)
    {
        HTHeft::ProcessList processes;
        for (int32_t pid : pids) {
            auto process = std::make_shared<HTUserProcess>(platform_);
            process->setSettings(settings_);
            EXPECT_TRUE(process->initWithBsdInfo(platform_->process(pid)->info));
            processes.push_back(process);
        }
        return processes;
    }

    // Each group of the process, as its pids, with the dirty bytes the
    // process sees in it.
    static std::map<std::set<int32_t>, uint64_t> tablesOf(HTHeftProbe& heft, HTProcess& process)
    {
        std::map<std::set<int32_t>, uint64_t> tables;
        auto sharing = heft._sharingData();
        for (const auto& group : *sharing->processToProcessGroups().find(process.pid())) {
            std::set<int32_t> pids;
            for (const auto& member : group->processes()) pids.insert(member->pid());
            tables[pids] = heft._total(sharing->processGroupToObjects().find(*group), &process).dirty;
        }
        return tables;
    }
};

TEST_F(HTSharedPageResolverTest, PagesCountOnceAndShowWithExactlyTheirMappers)
{
    // Pages 1 to 3 are shared by all three; page 4 by the parent and the
    // first child (the second wrote its own copy); the parent's fifth page
    // is shared with a process outside the analysis, so it is its own.
    addForkedProcess(kParent, {1, 2, 3, 4, 5, 0});
    addForkedProcess(kFirstChild, {1, 2, 3, 4, 0, 0});
    addForkedProcess(kSecondChild, {1, 2, 3, 0, 0, 0});
    HTHeft::ProcessList processes = created({kParent, kFirstChild, kSecondChild});
    auto heft = gathered(processes);

    // Three pages shared by all, one by two, and 2 + 2 + 3 pages of each
    // process's own.
    EXPECT_EQ(heft->_total().dirty, 11 * kPage);
    for (const auto& process : processes) EXPECT_EQ(*heft->pidToHeft().find(process->pid()), 6 * kPage);
    using Tables = std::map<std::set<int32_t>, uint64_t>;
    EXPECT_EQ(tablesOf(*heft, *processes[0]),
              (Tables{{{kParent}, 2 * kPage},
                      {{kParent, kFirstChild, kSecondChild}, 3 * kPage},
                      {{kParent, kFirstChild}, kPage}}));
    EXPECT_EQ(tablesOf(*heft, *processes[2]),
              (Tables{{{kSecondChild}, 3 * kPage}, {{kParent, kFirstChild, kSecondChild}, 3 * kPage}}));

    // The pieces follow their region and keep its name; the region keeps
    // what is its own.
    const auto& regions = processes[1]->memoryRegions();
    ASSERT_EQ(regions.size(), 3u);
    EXPECT_EQ(regions[0]->dirtySize(), 2 * kPage);
    EXPECT_EQ(regions[1]->dirtySize() + regions[2]->dirtySize(), 4 * kPage);
    EXPECT_EQ(regions[1]->name(), regions[0]->name());
    EXPECT_EQ(regions[1]->start(), kStart);
    EXPECT_EQ(regions[1]->sharedPageList(), nullptr);
    EXPECT_EQ(regions[0]->sharedPageList(), nullptr);
}

TEST_F(HTSharedPageResolverTest, PagesMappedInAnotherOrderCountOnce)
{
    // The child maps the parent's shared pages in another order, and runs
    // of them across the parent's two mappings: 2 and 4 lie apart in the
    // parent, 3 and 6 at the end of one of its mappings and the start of
    // the next. The parent's 1 and 5 are its own.
    addForkedProcess(kParent, {1, 2, 5, 3, 6, 4}, 4);
    addForkedProcess(kFirstChild, {2, 4, 3, 6});
    auto heft = gathered(created({kParent, kFirstChild}));
    EXPECT_EQ(heft->_total().dirty, 6 * kPage);
    EXPECT_EQ(*heft->pidToHeft().find(kFirstChild), 4 * kPage);
}

TEST_F(HTSharedPageResolverTest, WithoutIdentitiesEachProcessKeepsItsOwnCopy)
{
    settings_.breakDownPhysHeft = false;
    platform_->sharedPagesIdentifiable = false;
    addForkedProcess(kParent, {1, 2});
    addForkedProcess(kFirstChild, {1, 2});
    HTHeft::ProcessList processes = created({kParent, kFirstChild});
    EXPECT_EQ(gathered(processes)->_total().dirty, 4 * kPage);
    EXPECT_TRUE(static_cast<HTUserProcess&>(*processes[0]).sharedPagesUnidentified());

    // Sharing analysis off: nothing is named, nothing is noticed.
    settings_.sharingAnalysisDisabled = true;
    auto process = created({kParent}).front();
    process->gatherData();
    EXPECT_FALSE(static_cast<HTUserProcess&>(*process).sharedPagesUnidentified());
    EXPECT_EQ(process->memoryRegions().front()->sharedPageList(), nullptr);
}

TEST_F(HTSharedPageResolverTest, PrivateFileMappingKeepsTheFilesPagesApartFromItsCopies)
{
    constexpr int32_t kCopied = kDirtyPage | VM_PAGE_QUERY_PAGE_COPIED;
    constexpr int32_t kFilePage = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL;
    for (int32_t pid : {kParent, kFirstChild}) {
        HTFakePlatform::Process& process = platform_->addProcess(pid, 1, "reader");
        HTFakePlatform::Region region;
        region.start = kStart;
        region.size = 8 * kPage;
        region.info.protection = VM_PROT_READ | VM_PROT_WRITE;
        region.info.inheritance = VM_INHERIT_COPY;
        region.info.share_mode = SM_COW;
        region.info.external_pager = 1;
        region.info.pages_resident = 4;
        region.info.pages_dirtied = region.info.pages_shared_now_private = 2;
        region.info.object_id_full = 0x8000000000000077;
        region.path = "/data/table";
        process.regions.push_back(region);
        process.dispositions = {{kStart, kCopied},
                                {kStart + kPage, kCopied},
                                {kStart + 2 * kPage, kFilePage},
                                {kStart + 3 * kPage, kFilePage}};
    }
    HTHeft::ProcessList processes = created({kParent, kFirstChild});
    auto heft = gathered(processes);

    // Each process's two copies are its own; the file's two pages count
    // once, clean.
    EXPECT_EQ(heft->_total().dirty, 4 * kPage);
    EXPECT_EQ(heft->_total().clean, 2 * kPage);
    const auto& regions = processes[0]->memoryRegions();
    ASSERT_EQ(regions.size(), 2u);
    EXPECT_EQ(regions[0]->object_id(), processes[1]->memoryRegions()[0]->object_id());
    EXPECT_NE(regions[1]->object_id(), processes[1]->memoryRegions()[1]->object_id());
    EXPECT_EQ(regions[1]->dirtySize(), 2 * kPage);
    EXPECT_EQ(regions[0]->cleanNonSpecSize(), 2 * kPage);
    EXPECT_EQ(*regions[1]->name(), "mapped file");
}

}  // namespace
