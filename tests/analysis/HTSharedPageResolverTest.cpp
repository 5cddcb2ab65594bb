// Memory shared after a fork, where the pages cannot be told apart or are
// a file's. How shared pages count in reports is shown by the fork-sharing
// scenarios of HTReportGoldenTest.

#include "analysis/HTHeftTestSupport.h"
#include "model/HTMemoryRegion.h"
#include "process/HTUserProcess.h"

namespace {

using HTSharedPageResolverTest = HTAnalysisTest;

TEST_F(HTSharedPageResolverTest, WithoutIdentitiesEachProcessKeepsItsOwnCopy)
{
    platform_->sharedPagesIdentifiable = false;
    auto parent = forkedProcess(platform_, 100, {1, 2}, 0, settings_);
    EXPECT_EQ(gathered({parent, forkedProcess(platform_, 101, {1, 2}, 0, settings_)})->_total().dirty, 4 * kPage);
    EXPECT_TRUE(parent->sharedPagesUnidentified());

    // Sharing analysis off: nothing is named, nothing is noticed.
    settings_.sharingAnalysisDisabled = true;
    auto alone = forkedProcess(platform_, 102, {1, 2}, 0, settings_);
    alone->gatherData();
    EXPECT_FALSE(alone->sharedPagesUnidentified());
    EXPECT_EQ(alone->memoryRegions().front()->sharedPageList(), nullptr);
}

TEST_F(HTSharedPageResolverTest, PrivateFileMappingKeepsTheFilesPagesApartFromItsCopies)
{
    settings_.breakDownPhysHeft = true;
    constexpr uint64_t kStart = 0x10000;
    constexpr int32_t kCopied = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY | VM_PAGE_QUERY_PAGE_COPIED;
    constexpr int32_t kFilePage = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL;
    HTHeft::ProcessList processes;
    for (int32_t pid : {100, 101}) {
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
        auto made = std::make_shared<HTUserProcess>(platform_);
        made->setSettings(settings_);
        ASSERT_TRUE(made->initWithBsdInfo(process.info));
        processes.push_back(made);
    }
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
