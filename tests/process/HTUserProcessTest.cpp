#include "process/HTRegionFigures.h"
#include "process/HTUserProcessTestSupport.h"

#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"

#include <cstring>
#include <tuple>

namespace {

using Region = HTFakePlatform::Region;

const HTMemoryRegion& regionAt(const HTUserProcess& process, uint64_t start)
{
    for (const auto& region : process.memoryRegions())
        if (region->start() == start) return *region;
    ADD_FAILURE() << "no region at " << start;
    static HTMemoryRegion none;
    return none;
}

int64_t auxValue(const std::shared_ptr<HTAuxDataMap>& data, const char* key)
{
    auto datum = std::dynamic_pointer_cast<HTAuxData>(data->find(key));
    return datum ? datum->value() : -1;
}

}  // namespace

TEST_F(HTUserProcessTest, CreationReadsHeftLedgerAndIdleExitStatus)
{
    setBreakdown(true);
    platform_->ledgerTemplate = std::vector<std::string>{"cpu_time", "page_table", "wired_mem"};
    HTFakePlatform::Process& script = addTarget();
    script.rusage = rusage_info_v4{40 * kPage, 90 * kPage};
    script.ledgerBalances = std::vector<int64_t>{7, 3 * static_cast<int64_t>(kPage), 9};

    auto process = gathered();
    EXPECT_EQ(process->idleExitStatus(), HTIdleExitStatusNotControlled);
    // The page-table ledger becomes a region of its own.
    ASSERT_EQ(process->memoryRegions().size(), 1u);
    EXPECT_EQ(process->memoryRegions()[0]->dirtySize(), 3 * kPage);

    auto data = process->auxData();
    ASSERT_NE(data, nullptr);
    EXPECT_EQ(auxValue(data, "phys_heft"), static_cast<int64_t>(40 * kPage));
    EXPECT_EQ(auxValue(data, "phys_heft_peak"), static_cast<int64_t>(90 * kPage));
    EXPECT_FALSE(std::dynamic_pointer_cast<HTAuxData>(data->find("phys_heft"))->shouldAggregate());

    // The template is read once per run; a negative balance counts as 0.
    platform_->addProcess(kPid + 1, 1, "other").ledgerBalances = std::vector<int64_t>{0, -5, 0};
    auto other = std::make_shared<HTUserProcess>(platform_);
    ASSERT_TRUE(other->initWithBsdInfo(platform_->process(kPid + 1)->info));
    other->gatherData();
    EXPECT_TRUE(other->memoryRegions().empty());
    EXPECT_EQ(platform_->ledgerTemplateReads, 1);
    // No physical heft, no auxiliary data.
    EXPECT_EQ(other->auxData(), nullptr);
}

TEST_F(HTUserProcessTest, LedgerFailuresLeaveNoPageTableRegion)
{
    setBreakdown(true);
    addTarget().ledgerErrno = EPERM;
    platform_->ledgerTemplate = std::vector<std::string>{"page_table"};
    auto process = gathered();
    EXPECT_EQ(process->warnings(),
              std::vector<std::string>{std::string("target [500]: Unable to retrieve ledger entry info - ") +
                                       std::strerror(EPERM)});
    EXPECT_TRUE(process->memoryRegions().empty());

    // An unreadable template: a message on standard error, no warning.
    HTUserProcessProbe::_forgetLedgerTemplate();
    platform_->ledgerTemplate.reset();
    testing::internal::CaptureStderr();
    auto second = gathered();
    EXPECT_NE(testing::internal::GetCapturedStderr().find("Unable to retrieve ledger template info"),
              std::string::npos);
    EXPECT_TRUE(second->warnings().empty());
    EXPECT_TRUE(second->memoryRegions().empty());
}

TEST_F(HTUserProcessTest, EmptyProcessEndsTheWalkAtOnce)
{
    addTarget();
    auto process = gathered();
    EXPECT_TRUE(process->hasMemoryRegions());
    EXPECT_TRUE(process->memoryRegions().empty());
    EXPECT_TRUE(process->errors().empty());
    EXPECT_TRUE(process->warnings().empty());
    // An empty shared region needs no bisection.
    EXPECT_EQ(platform_->regionLookups, 1);
    EXPECT_EQ(platform_->basicRegionLookups, 0);
}

TEST_F(HTUserProcessTest, SizesFromPageCounts)
{
    HTFakePlatform::Process& script = addTarget();
    // The last has more dirtied than resident: clamped, not wrapped.
    script.regions = {withPages(anonymous(0x10000, 12), 10, 4, 2), withPages(anonymous(0x20000, 8), 5, 5),
                      anonymous(0x30000, 8), withPages(anonymous(0x40000, 4), 2, 3)};
    script.regions[0].info.pages_reusable = 3;
    script.regions[1].purgeState = VM_PURGABLE_VOLATILE;
    script.regions[2].purgeState = VM_PURGABLE_EMPTY;

    // Without the breakdown, resident anonymous memory that is not
    // reusable is dirty.
    auto process = gathered();
    ASSERT_EQ(process->memoryRegions().size(), 4u);
    EXPECT_EQ(figures(regionAt(*process, 0x10000)), (HTRegionFigures{7 * kPage, 2 * kPage, 0, 3 * kPage}));
    EXPECT_EQ(regionAt(*process, 0x10000).object_id(), script.regions[0].info.object_id_full);
    EXPECT_EQ(figures(regionAt(*process, 0x20000)), (HTRegionFigures{0, 0, 0, 5 * kPage}));
    EXPECT_EQ(regionAt(*process, 0x30000).reclaimableSize(), 8 * kPage);

    // With it, the kernel's dirtied count.
    setBreakdown(true);
    process = gathered();
    EXPECT_EQ(figures(regionAt(*process, 0x10000)), (HTRegionFigures{4 * kPage, 2 * kPage, 3 * kPage, 3 * kPage}));
    EXPECT_EQ(regionAt(*process, 0x40000).cleanNonSpecSize(), 0u);
}

TEST_F(HTUserProcessTest, RegionsAreNamedByImageFileOrTag)
{
    HTFakePlatform::Process& script = addTarget();
    auto file = [](uint64_t start, uint64_t pages, std::optional<std::string> path) {
        Region region = anonymous(start, pages);
        region.info.external_pager = 1;
        region.path = std::move(path);
        return region;
    };
    Region text = file(0x400000, 4, "/usr/bin/target");
    text.info.share_mode = SM_COW;
    Region stack = anonymous(0x700000, 2);
    stack.info.user_tag = 30;
    stack.info.user_wired_count = 1;
    // An older kernel's short record: the 32-bit object id stands in.
    stack.infoCount = VM_REGION_SUBMAP_INFO_COUNT_64 - 2;
    stack.info.object_id = 0x1234;
    script.regions = {text, file(0x500000, 2, "/var/data.db"), file(0x600000, 2, std::nullopt), stack};
    script.images = {{"/usr/bin/target", 0x400000, {{"__TEXT", 0x400000, 4 * kPage}}}};
    platform_->realpaths["/usr/bin/target"] = "/opt/target/bin/target";

    // {start, name, detailed name, segment, wired, object id} of each region.
    using Row = std::tuple<uint64_t, std::optional<std::string>, std::optional<std::string>, int, bool, uint64_t>;
    std::vector<Row> rows;
    auto process = gathered();
    for (const auto& r : process->memoryRegions())
        rows.emplace_back(r->start(), r->name(), r->detailedName(), r->segment(), r->wired(), r->object_id());
    const uint64_t fileId = 0x4000000000000000;
    EXPECT_EQ(rows,
              (std::vector<Row>{
                  {0x400000, "__TEXT", "/opt/target/bin/target", HTSegmentText, false, fileId | 0x400000},
                  {0x500000, "mapped file", "/var/data.db", HTSegmentNoImage, false, fileId | 0x500000},
                  {0x600000, "mapped file", std::nullopt, HTSegmentNoImage, false, fileId | 0x600000},
                  {0x700000, HTMemoryRegion::categoryNameForTag(30), std::nullopt, HTSegmentNoImage, true, 0x1234},
              }));
}

TEST_F(HTUserProcessTest, OwnedObjectsGiveMappedRegionsTheirSizesAndTheRestFakeRegions)
{
    setBreakdown(true);
    HTFakePlatform::Process& script = addTarget();
    Region kernelFake = withPages(anonymous(0x90000, 2), 2, 2);
    kernelFake.info.user_tag = HTFakeRegionTag;
    script.regions = {withPages(anonymous(0x10000, 8, 0x77), 8, 8), kernelFake};
    script.ownedVmObjects = std::vector<HTFakePlatform::OwnedVmObject>{
        // object, virtual, resident, wired, reusable, compressed, flags
        {0x77, 8 * kPage, 5 * kPage, 0, 1 * kPage, 2 * kPage, 0},
        {0x88, 16 * kPage, 6 * kPage, 1 * kPage, 2 * kPage, 3 * kPage, 0},
        {0x99, 4 * kPage, 4 * kPage, 3 * kPage, 0, 1 * kPage, 1u << 4},  // volatile
        {0xAA, 4 * kPage, 4 * kPage, 0, 0, 4 * kPage, 1},                // not charged
    };

    // The kernel's own fake region gives way to the owned-object list; the
    // objects no region maps follow in the kernel's order, without address.
    using Row = std::tuple<uint64_t, bool, uint64_t, uint64_t, bool, HTRegionFigures>;
    std::vector<Row> rows;
    auto process = gathered();
    for (const auto& r : process->memoryRegions())
        rows.emplace_back(r->object_id(), r->ownedExclusivelyByParentProcess(), r->start(), r->size(), r->wired(),
                          figures(*r));
    EXPECT_EQ(rows,
              (std::vector<Row>{
                  {0x77, true, 0x10000, 8 * kPage, false, {4 * kPage, 2 * kPage, 0, kPage}},
                  {0x88, true, HTNoAddress, 16 * kPage, true, {4 * kPage, 3 * kPage, 0, 2 * kPage}},
                  {0x99, true, HTNoAddress, 4 * kPage, true, {3 * kPage, 0, 0, 0}},
                  {0xAA, true, HTNoAddress, 4 * kPage, false, {}},
              }));
    EXPECT_EQ(process->memoryRegions()[1]->name(), "Owned physical heft (unmapped)");
    EXPECT_TRUE(process->warnings().empty());
}

TEST_F(HTUserProcessTest, OwnedObjectListGrowingBetweenAsksIsReadWhole)
{
    setBreakdown(true);
    HTFakePlatform::Process& script = addTarget();
    std::vector<HTFakePlatform::OwnedVmObject> objects;
    for (uint64_t i = 1; i <= 40; ++i) objects.push_back({i << 12, kPage, kPage, 0, 0, 0, 0});
    script.ownedVmObjects = objects;
    // The first ask saw none of them.
    script.ownedVmObjectsLengthHint = sizeof(uint64_t);
    auto process = gathered();
    ASSERT_EQ(process->memoryRegions().size(), 40u);
    EXPECT_EQ(process->memoryRegions().back()->object_id(), 40u << 12);

    // A failure other than "not there" is a warning.
    script.ownedVmObjectsErrno = EPERM;
    auto failed = gathered();
    std::string expected = std::string("target [500]: vm.get_owned_vmobjects - ") + std::strerror(EPERM);
    EXPECT_EQ(takeNotices(), std::vector<std::string>{expected});
    EXPECT_EQ(failed->warnings(), std::vector<std::string>{expected});
}

TEST_F(HTUserProcessTest, HeldFakeRegionGivesUpWhatMappedRegionsCharged)
{
    // Small pages let the kernel's counts express the sub-page figures.
    platform_->pageSize = 1024;
    setBreakdown(true);
    HTFakePlatform::Process& script = addTarget();
    // Purgeable memory without an owned-object list counts as owned: 4096
    // bytes in all.
    Region purgeable = withPages(anonymous(0x10000, 4), 4, 4);
    purgeable.size = 4 * 1024;
    purgeable.purgeState = VM_PURGABLE_NONVOLATILE;
    Region fake = withPages(anonymous(0x20000, 1), 1, 1, 1);
    fake.size = 4 * 1024;
    fake.info.user_tag = HTFakeRegionTag;
    script.regions = {purgeable, fake, anonymous(0x30000, 1)};

    auto process = gathered();
    // Only the owned region: the fake one had too little to give, and the
    // walk ended at the first real region after it.
    ASSERT_EQ(process->memoryRegions().size(), 1u);
    EXPECT_TRUE(process->memoryRegions()[0]->ownedExclusivelyByParentProcess());
    EXPECT_EQ(process->memoryRegions()[0]->dirtySize(), 4096u);
    EXPECT_EQ(process->warnings(),
              std::vector<std::string>{"target [500]: Heft changed while analyzing \u2013 unmapped owned physical "
                                       "heft may be over-counted by 2048 bytes"});
    EXPECT_EQ(platform_->regionLookups, 3);
}

TEST_F(HTUserProcessTest, HeldFakeRegionWithRoomLeftIsAppendedWithoutAddress)
{
    setBreakdown(true);
    HTFakePlatform::Process& script = addTarget();
    Region purgeable = withPages(anonymous(0x10000, 1), 1, 1);
    purgeable.purgeState = VM_PURGABLE_VOLATILE;  // no owned dirty: owned total stays 0
    Region tagged = withPages(anonymous(0x20000, 2), 2, 2);
    tagged.purgeState = VM_PURGABLE_NONVOLATILE;  // owned: 2 pages
    Region fake = withPages(anonymous(0x30000, 8), 8, 8);
    fake.info.user_tag = HTFakeRegionTag;
    fake.info.object_id_full = 0;
    fake.info.object_id = 0x5151;
    script.regions = {purgeable, tagged, fake};
    script.ledgerBalances = std::vector<int64_t>{5 * static_cast<int64_t>(kPage)};
    platform_->ledgerTemplate = std::vector<std::string>{"page_table"};

    auto process = gathered();
    const auto& regions = process->memoryRegions();
    ASSERT_EQ(regions.size(), 4u);
    EXPECT_EQ(regions[1]->dirtySize(), 2 * kPage);
    const HTMemoryRegion& held = *regions[2];
    EXPECT_TRUE(held.isFake());
    EXPECT_EQ(held.start(), HTNoAddress);
    EXPECT_EQ(held.object_id(), 0x5151u);
    EXPECT_EQ(held.dirtySize(), 6 * kPage);
    EXPECT_TRUE(process->warnings().empty());

    // The page tables come last.
    const HTMemoryRegion& pageTables = *regions[3];
    EXPECT_EQ(pageTables.name(), "page table");
    EXPECT_EQ(pageTables.size(), 5 * kPage);
    EXPECT_EQ(figures(pageTables), (HTRegionFigures{5 * kPage, 0, 0, 0}));
    EXPECT_EQ(pageTables.start(), HTNoAddress);
    EXPECT_EQ(pageTables.object_id(), 0xFFFFFFFFFFFFFFFFu);
    EXPECT_EQ(pageTables.share_mode(), SM_PRIVATE);

    // Without the breakdown there is no ledger and no page-table region.
    HTUserProcessProbe::_forgetLedgerTemplate();
    setBreakdown(false);
    auto plain = gathered();
    for (const auto& region : plain->memoryRegions()) EXPECT_NE(region->name(), "page table");
}

namespace {

constexpr const char* kExitedNotice =
    ": exited while being read; the report shows what was read, marked \"(process exited)\"";

}  // namespace

TEST_F(HTUserProcessTest, WalkFailuresBecomeWarningsOnlyForGoneOrZombieProcesses)
{
    HTFakePlatform::Process& script = addTarget();
    script.regions = {anonymous(0x10000, 1), anonymous(0x20000, 1), anonymous(0x30000, 1)};
    script.regionFailureIndex = 1;

    // The process exits during the walk: what was read stays, with a warning.
    auto process = created();
    script.exited = true;
    process->gatherData();
    EXPECT_EQ(process->memoryRegions().size(), 1u);
    EXPECT_TRUE(process->errors().empty());
    EXPECT_EQ(process->warnings(), std::vector<std::string>{"target [500]: process is gone (process exited)"});
    EXPECT_EQ(takeNotices(), std::vector<std::string>{std::string("target [500]") + kExitedNotice});
    script.exited = false;

    // The process as the kernel describes it after the failure, the code the
    // walk met, and what the process and standard error then say.
    // What the process and standard error say; a warning or an error is
    // "target [500]: " and the text given, none when empty.
    struct Case {
        uint32_t status, flags;
        kern_return_t code;
        std::string warning, error, notice;
    };
    const std::string bailOut = "bailing out for process target [500]; data may be incomplete! (its memory map "
                                "could not be read: ";
    const std::string zombie =
        "target [500]: had exited and was not yet reaped (a zombie) when read; marked \"(zombie)\" in the report";
    const Case cases[] = {
        {SZOMB, 0, MACH_SEND_INVALID_DEST, "process is gone (zombie)", "", zombie},
        // Killed, not yet a zombie: its memory is going already.
        {SRUN, PROC_FLAG_INEXIT, MACH_SEND_INVALID_DEST, "process is gone (process exited)", "",
         std::string("target [500]") + kExitedNotice},
        // A running process, or another code: an error.
        {SRUN, 0, MACH_SEND_INVALID_DEST, "", "process is gone", bailOut + "process is gone)"},
        {SRUN, PROC_FLAG_INEXIT, KERN_FAILURE, "", "failure", bailOut + "failure)"},
    };
    auto said = [](const std::string& text) {
        return text.empty() ? std::vector<std::string>{} : std::vector<std::string>{"target [500]: " + text};
    };
    for (const Case& test : cases) {
        script.info.pbi_status = test.status;
        script.info.pbi_flags = PROC_FLAG_LP64 | test.flags;
        script.regionFailureCode = test.code;
        auto failed = gathered();
        EXPECT_EQ(failed->warnings(), said(test.warning)) << test.notice;
        EXPECT_EQ(failed->errors(), said(test.error)) << test.notice;
        EXPECT_EQ(takeNotices(), std::vector<std::string>{test.notice});
    }

    // Out of descriptors, at the walk or at the task port: said once in the
    // run, with the cure, instead of once per process.
    const std::string outOfDescriptors = "Too many open files: raise the open-file limit (ulimit -n)";
    script.info.pbi_status = SRUN;
    script.info.pbi_flags = PROC_FLAG_LP64;
    script.regionFailureCode = HT_KERN_ERRNO_BASE | EMFILE;
    testing::internal::CaptureStderr();
    auto walked = gathered();
    script.taskResult = HT_KERN_ERRNO_BASE | ENFILE;
    EXPECT_FALSE(std::make_shared<HTUserProcess>(platform_)->initWithBsdInfo(script.info));
    EXPECT_EQ(testing::internal::GetCapturedStderr(), outOfDescriptors + "\n");
    EXPECT_EQ(HTProcess::globalErrors(), std::vector<std::string>{outOfDescriptors});
    EXPECT_EQ(walked->errors(), std::vector<std::string>{"target [500]: Too many open files"});
    EXPECT_TRUE(takeNotices().empty());
    script.taskResult = KERN_SUCCESS;

    // Gone once its regions were read: the page query of every region
    // fails, and the process says so once.
    setBreakdown(true);
    script.regionFailureIndex.reset();
    script.regions = {anonymous(0x10000, 2), anonymous(0x20000, 2)};
    for (auto& region : script.regions) {
        region.info.share_mode = SM_COW;
        region.info.pages_resident = region.info.pages_dirtied = 1;
    }
    auto gone = created();
    script.exited = true;
    gone->gatherData();
    EXPECT_EQ(gone->warnings(), std::vector<std::string>{"target [500]: invalid argument (process exited)"});
    EXPECT_EQ(takeNotices(), std::vector<std::string>{std::string("target [500]") + kExitedNotice});
}

// --- sub-ranges ----------------------------------------------------------------

namespace {

struct Span {
    uint64_t start, size, dirty, swapped, clean, reclaimable, wired;
    bool operator==(const Span&) const = default;
};

std::ostream& operator<<(std::ostream& out, const Span& span)
{
    return out << "[" << span.start << "+" << span.size << " d" << span.dirty << " s" << span.swapped << " c"
               << span.clean << " r" << span.reclaimable << " w" << span.wired << "]";
}

std::vector<Span> spans(const HTMemoryRegion& region)
{
    std::vector<Span> result;
    if (!region.subrangeList()) return result;
    for (const HTRangeListNode* node = region.subrangeList()->head(); node; node = node->next)
        result.push_back(
            {node->start, node->size, node->dirty, node->swapped, node->clean, node->reclaimable, node->wired});
    return result;
}

}  // namespace

class HTUserProcessSubrangeTest : public HTUserProcessTest {
protected:
    HTUserProcessSubrangeTest()
    {
        setBreakdown(true);
        // An owned-object list that names none of the regions.
        addTarget().ownedVmObjects = std::vector<HTFakePlatform::OwnedVmObject>{};
    }

    // Shared memory of `pages` pages at `start`, with mixed page counts.
    Region& addShared(uint64_t start, uint64_t pages, uint64_t offset = 0)
    {
        Region region = anonymous(start, pages);
        region.info.share_mode = SM_SHARED;
        region.info.offset = offset;
        region.info.pages_resident = static_cast<uint32_t>(pages - 1);
        region.info.pages_dirtied = 1;
        target().regions.push_back(region);
        return target().regions.back();
    }
};

TEST_F(HTUserProcessSubrangeTest, RunsOfOneKindBecomeSubranges)
{
    const int32_t present = VM_PAGE_QUERY_PAGE_PRESENT;
    const int32_t dirty = present | VM_PAGE_QUERY_PAGE_DIRTY;
    addShared(0x100000, 5, 0x40000);
    std::vector<int32_t> kinds = {dirty, dirty, 0, present, present};
    for (size_t i = 0; i < kinds.size(); ++i) target().dispositions[0x100000 + i * kPage] = kinds[i];

    // Paged-out beats dirty; reusable pages are reclaimable; volatile
    // objects make every present page reclaimable.
    addShared(0x200000, 4).info.user_wired_count = 1;
    target().dispositions[0x200000] = dirty | VM_PAGE_QUERY_PAGE_PAGED_OUT;
    target().dispositions[0x201000] = present | VM_PAGE_QUERY_PAGE_REUSABLE;
    target().dispositions[0x203000] = present;
    addShared(0x300000, 3).purgeState = VM_PURGABLE_VOLATILE;
    target().dispositions[0x300000] = present;
    target().dispositions[0x302000] = dirty;

    // Runs whose disposition the backend knows whole give the same runs as
    // pages queried one by one, without a query.
    for (bool uniformRuns : {false, true}) {
        SCOPED_TRACE(uniformRuns ? "uniform runs" : "pages queried");
        platform_->uniformRuns = uniformRuns;
        platform_->pageQueries.clear();
        auto process = gathered();
        EXPECT_EQ(spans(regionAt(*process, 0x100000)),
                  (std::vector<Span>{{0x40000, 2 * kPage, 2 * kPage, 0, 0, 0, 0},
                                     {0x40000 + 3 * kPage, 2 * kPage, 0, 0, 2 * kPage, 0, 0}}));
        // Adjacent runs of different kinds stay apart, so that each page keeps its kind.
        EXPECT_EQ(spans(regionAt(*process, 0x200000)),
                  (std::vector<Span>{{0, kPage, 0, kPage, 0, 0, kPage},
                                     {kPage, kPage, 0, 0, 0, kPage, kPage},
                                     {3 * kPage, kPage, 0, 0, kPage, 0, kPage}}));
        EXPECT_EQ(spans(regionAt(*process, 0x300000)),
                  (std::vector<Span>{{0, kPage, 0, 0, 0, kPage, 0}, {2 * kPage, kPage, kPage, 0, 0, 0, 0}}));
        EXPECT_EQ(platform_->pageQueries.empty(), uniformRuns);
    }
}

TEST_F(HTUserProcessSubrangeTest, LargeRegionsAreQueriedInChunksAndRunsCrossThem)
{
    const uint64_t start = 0x10000000;
    addShared(start, 5000);
    for (uint64_t i = 10; i < 4200; ++i) target().dispositions[start + i * kPage] = VM_PAGE_QUERY_PAGE_DIRTY;
    for (uint64_t i = 4201; i < 5000; ++i) target().dispositions[start + i * kPage] = VM_PAGE_QUERY_PAGE_PRESENT;

    auto process = gathered();
    // Only the populated runs are queried, a chunk of at most 4096 pages at a time.
    EXPECT_EQ(platform_->pageQueries,
              (HTPageQueries{{start + 10 * kPage, 4096 * kPage},
                             {start + 4106 * kPage, 94 * kPage},
                             {start + 4201 * kPage, 799 * kPage}}));
    EXPECT_EQ(spans(regionAt(*process, start)),
              (std::vector<Span>{{10 * kPage, 4190 * kPage, 4190 * kPage, 0, 0, 0, 0},
                                 {4201 * kPage, 799 * kPage, 0, 0, 799 * kPage, 0, 0}}));
}

TEST_F(HTUserProcessSubrangeTest, EmptyStretchesOfSparseRegionsAreNotQueried)
{
    // A 64 GiB reservation with two dirty pages far apart: only those two
    // pages are queried, and the runs land where a query of every page
    // would have put them.
    const uint64_t start = 0x100000000;
    const uint64_t pages = 16 * 1024 * 1024;
    addShared(start, pages, 0x1000);
    const uint64_t far = pages - 5000;
    target().dispositions[start + 7 * kPage] = VM_PAGE_QUERY_PAGE_DIRTY;
    target().dispositions[start + far * kPage] = VM_PAGE_QUERY_PAGE_DIRTY;

    auto process = gathered();
    EXPECT_EQ(platform_->pageQueries, (HTPageQueries{{start + 7 * kPage, kPage}, {start + far * kPage, kPage}}));
    EXPECT_EQ(spans(regionAt(*process, start)),
              (std::vector<Span>{{0x1000 + 7 * kPage, kPage, kPage, 0, 0, 0, 0},
                                 {0x1000 + far * kPage, kPage, kPage, 0, 0, 0, 0}}));
}

TEST_F(HTUserProcessSubrangeTest, NoSubrangesWhenSharingAnalysisIsOffOrProcessHidden)
{
    addShared(0x100000, 3);
    target().dispositions[0x100000] = VM_PAGE_QUERY_PAGE_DIRTY;
    settings_.sharingAnalysisDisabled = true;
    EXPECT_EQ(gathered()->memoryRegions()[0]->subrangeList(), nullptr);

    settings_.sharingAnalysisDisabled = false;
    auto hidden = created();
    hidden->setHiddenFromDisplay(true);
    hidden->gatherData();
    EXPECT_EQ(hidden->memoryRegions()[0]->subrangeList(), nullptr);
    EXPECT_TRUE(platform_->pageQueries.empty());
}
