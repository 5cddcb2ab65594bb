#include "process/HTRegionFigures.h"
#include "process/HTUserProcessTestSupport.h"

#include <string>
#include <vector>

namespace {

using Region = HTFakePlatform::Region;

// The shared region of a 64-bit ARM system.
constexpr uint64_t kBase = 0x180000000;
constexpr uint64_t kPrivate = 0x100000000;
constexpr int32_t kPresent = VM_PAGE_QUERY_PAGE_PRESENT;
// Where most tests put their one writable mapping.
constexpr uint64_t kStart = kBase + 0x100000;

class HTUserProcessSharedCacheTest : public HTUserProcessTest {
protected:
    HTUserProcessSharedCacheTest()
    {
        // One private region below the shared region, for the bisection
        // to find.
        addTarget().regions = {anonymous(kPrivate, 4)};
    }

    // A mapping of the shared cache; its record's object id is 0x4242.
    Region& addMapping(uint64_t start, uint64_t pages, bool writable, uint64_t offset = 0)
    {
        Region region;
        region.start = start;
        region.size = pages * kPage;
        region.info.protection = VM_PROT_READ;
        region.info.max_protection = VM_PROT_READ | (writable ? VM_PROT_WRITE : 0);
        region.info.share_mode = SM_COW;
        region.info.external_pager = 1;
        region.info.offset = offset;
        region.info.object_id_full = 0x4242;
        target().regions.push_back(region);
        return target().regions.back();
    }

    void addImage(const std::string& path, std::vector<HTPlatformImageSegment> segments)
    {
        target().images.push_back({path, segments.front().start, std::move(segments)});
    }

    std::shared_ptr<HTMachUserProcess> gatheredMach() { return gathered<HTMachUserProcess>(); }

    static std::vector<std::shared_ptr<HTMemoryRegion>> pieces(const HTUserProcess& process)
    {
        std::vector<std::shared_ptr<HTMemoryRegion>> result;
        for (const auto& region : process.memoryRegions())
            if (region->inSharedCache()) result.push_back(region);
        return result;
    }
};

struct Piece {
    uint64_t start;
    uint64_t end;
    std::string name;
    uint8_t segment;
    bool unused;
    bool operator==(const Piece&) const = default;
};

std::ostream& operator<<(std::ostream& out, const Piece& piece)
{
    return out << std::hex << "[" << piece.start << ", " << piece.end << ") " << piece.name << " seg "
               << int(piece.segment) << (piece.unused ? " unused" : "");
}

std::vector<Piece> layout(const std::vector<std::shared_ptr<HTMemoryRegion>>& regions)
{
    std::vector<Piece> result;
    for (const auto& region : regions)
        result.push_back({region->start(), region->end(), region->name().value_or(""), region->segment(),
                          region->unusedSharedCacheRegion()});
    return result;
}

const std::string kUnused = "unused rtld shared cache area";

}  // namespace

TEST_F(HTUserProcessSharedCacheTest, MappingWithoutImageIsOneUnusedPiece)
{
    const uint64_t start = kBase + 0x200000;
    addMapping(start, 8, true, 0x30000).info.user_wired_count = 1;

    auto process = gatheredMach();
    ASSERT_EQ(process->memoryRegions().size(), 2u);
    EXPECT_FALSE(process->memoryRegions()[0]->inSharedCache());
    auto shared = pieces(*process);
    ASSERT_EQ(layout(shared), (std::vector<Piece>{{start, start + 8 * kPage, kUnused, HTSegmentNotSet, true}}));
    // Past the bisection's answer the mapping is looked up whole: the
    // record is built, with object id 1.
    EXPECT_GT(platform_->basicRegionLookups, 0);
    EXPECT_EQ(shared[0]->object_id(), 1u);
    EXPECT_EQ(shared[0]->offset(), 0x30000u);
    EXPECT_EQ(shared[0]->share_mode(), SM_COW);
    EXPECT_TRUE(shared[0]->wired());
    // Page-aligned at both ends: nothing to measure.
    EXPECT_EQ(figures(*shared[0]), HTRegionFigures{});
    EXPECT_TRUE(platform_->pageQueries.empty());

    // A hidden process contributes nothing from the shared region.
    auto hidden = created<HTMachUserProcess>();
    hidden->setHiddenFromDisplay(true);
    hidden->gatherData();
    ASSERT_EQ(hidden->memoryRegions().size(), 1u);
    EXPECT_EQ(hidden->memoryRegions()[0]->start(), kPrivate);

    // Without a private region below it, the mapping comes from the
    // recursive walk with its own record.
    target().regions.erase(target().regions.begin());
    auto bare = gatheredMach();
    ASSERT_EQ(bare->memoryRegions().size(), 1u);
    EXPECT_EQ(bare->memoryRegions()[0]->object_id(), 0x4242u);
}

TEST_F(HTUserProcessSharedCacheTest, ImagesCutMappingsIntoPieces)
{
    const uint64_t first = kBase + 0x100000;
    const uint64_t second = kBase + 0x200000;
    addMapping(first, 16, false, 0x8000);
    addMapping(second, 8, false);
    addImage("/usr/lib/libsystem.dylib", {{"__TEXT", first + 0x1800, 0x1000}});
    addImage("/usr/lib/libother.dylib", {{"__LINKEDIT", second + kPage, 0x800}});

    auto shared = pieces(*gatheredMach());
    ASSERT_EQ(layout(shared),
              (std::vector<Piece>{
                  {first, first + 0x1800, kUnused, HTSegmentNotSet, true},
                  {first + 0x1800, first + 0x2800, "__TEXT", HTSegmentText, false},
                  {first + 0x2800, first + 16 * kPage, kUnused, HTSegmentNotSet, true},
                  {second, second + kPage, kUnused, HTSegmentNotSet, true},
                  // An aligned segment takes the padding up to the boundary.
                  {second + kPage, second + 2 * kPage, "__LINKEDIT", HTSegmentLinkEdit, false},
                  {second + 2 * kPage, second + 8 * kPage, kUnused, HTSegmentNotSet, true},
              }));
    EXPECT_EQ(shared[1]->detailedName(), "/usr/lib/libsystem.dylib");
    EXPECT_EQ(shared[1]->offset(), 0x8000u + 0x1800);
    EXPECT_EQ(shared[2]->offset(), 0x8000u + 0x2800);
    EXPECT_EQ(shared[4]->detailedName(), "rtld shared cache");
    EXPECT_FALSE(shared[0]->detailedName().has_value());
    // Read-only pieces are never measured.
    EXPECT_TRUE(platform_->pageQueries.empty());
}

TEST_F(HTUserProcessSharedCacheTest, PageQueriesCountASharedPageOnce)
{
    addMapping(kStart, 4, true);
    addImage("/usr/lib/liba.dylib", {{"__DATA", kStart, 0x1800}});
    addImage("/usr/lib/libb.dylib", {{"__DATA", kStart + 0x1800, 0x1800}});
    target().dispositions[kStart] = kPresent;
    target().dispositions[kStart + kPage] = kPresent | VM_PAGE_QUERY_PAGE_DIRTY | VM_PAGE_QUERY_PAGE_EXTERNAL;
    target().dispositions[kStart + 2 * kPage] = VM_PAGE_QUERY_PAGE_PAGED_OUT;
    target().dispositions[kStart + 3 * kPage] = kPresent;

    // A page-aligned piece: resident anonymous pages are dirty, clean file
    // pages are nothing, paged-out pages are swapped.
    const uint64_t other = kBase + 0x200000;
    addMapping(other, 3, true);
    addImage("/usr/lib/libc.dylib", {{"__DATA", other, 3 * kPage}});
    target().dispositions[other] = kPresent;
    target().dispositions[other + kPage] = kPresent | VM_PAGE_QUERY_PAGE_EXTERNAL;
    target().dispositions[other + 2 * kPage] = VM_PAGE_QUERY_PAGE_PAGED_OUT;

    auto shared = pieces(*gatheredMach());
    ASSERT_EQ(shared.size(), 4u);
    // The second piece's first page comes from the query of the piece before;
    // the trailing unused piece is page-aligned: not measured.
    EXPECT_TRUE(shared[2]->unusedSharedCacheRegion());
    const std::vector<HTRegionFigures> measured = {{0x1800, 0, 0, 0}, {0x800, kPage, 0, 0}, {}, {kPage, kPage, 0, 0}};
    for (size_t i = 0; i < measured.size(); ++i) EXPECT_EQ(figures(*shared[i]), measured[i]) << "piece " << i;
    EXPECT_EQ(platform_->pageQueries,
              (HTPageQueries{{kStart, 2 * kPage}, {kStart + 2 * kPage, kPage}, {other, 3 * kPage}}));
}

TEST_F(HTUserProcessSharedCacheTest, UnusedPieceGetsItsLastPageFromTheNextQuery)
{
    addMapping(kStart, 4, true);
    addImage("/usr/lib/liba.dylib", {{"__DATA", kStart + 0x1800, 0x1800}});
    target().dispositions[kStart] = kPresent;
    target().dispositions[kStart + kPage] = kPresent;
    target().dispositions[kStart + 2 * kPage] = VM_PAGE_QUERY_PAGE_PAGED_OUT;

    auto shared = pieces(*gatheredMach());
    ASSERT_EQ(shared.size(), 3u);
    // The unused piece's own pages are not queried; its part of the page it
    // shares with the image is measured by the image's query.
    EXPECT_TRUE(shared[0]->unusedSharedCacheRegion());
    EXPECT_EQ(figures(*shared[0]), (HTRegionFigures{0x800, 0, 0, 0}));
    EXPECT_EQ(figures(*shared[1]), (HTRegionFigures{0x800, kPage, 0, 0}));
    EXPECT_EQ(platform_->pageQueries, (HTPageQueries{{kStart + kPage, 2 * kPage}}));
}

TEST_F(HTUserProcessSharedCacheTest, FailedPageQueryStopsTheWalk)
{
    addMapping(kStart, 4, true);
    addImage("/usr/lib/liba.dylib", {{"__DATA", kStart, 4 * kPage}});
    addMapping(kBase + 0x200000, 4, true);
    target().pageQueryFailureAddress = kStart + kPage;

    auto process = gatheredMach();
    EXPECT_EQ(takeNotices(),
              (std::vector<std::string>{"target [500]: its pages could not be read (invalid argument); data may "
                                        "be incomplete",
                                        "bailing out for process target [500]; data may be incomplete!"}));
    EXPECT_EQ(process->errors(), std::vector<std::string>{"target [500]: invalid argument"});
    // Nothing of the failed mapping or after it.
    EXPECT_TRUE(pieces(*process).empty());
    EXPECT_EQ(process->memoryRegions().size(), 1u);

    // The same failure on a process that has gone is a warning.
    auto gone = created<HTMachUserProcess>();
    target().exited = true;
    gone->gatherData();
    EXPECT_EQ(takeNotices().size(), 1u);
    EXPECT_TRUE(gone->errors().empty());
    EXPECT_EQ(gone->warnings(), std::vector<std::string>{"target [500]: invalid argument (process exited)"});
}
