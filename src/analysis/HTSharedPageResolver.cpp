#include "analysis/HTSharedPageResolver.h"

#include "base/HTAssert.h"
#include "base/HTMix.h"
#include "model/HTMemoryRegion.h"
#include "model/HTSharedPageList.h"
#include "model/HTSubrangeBuilder.h"
#include "process/HTProcess.h"

#include <algorithm>
#include <array>
#include <unordered_map>
#include <utility>

namespace {

// Objects of pages shared after a fork have identities of their own: the
// top two bits 00 keep them apart from files (1x) and anonymous memory (01).
constexpr uint64_t kIdentityNamespaceBits = uint64_t{3} << 62;

// The identity of the object of the pages that the process set `set` maps
// and that its first process maps through its region `region`.
uint64_t sharedObjectId(uint32_t set, uint32_t region)
{
    uint64_t id = htMix(htMix(set) ^ (uint64_t{region} << 32 | 0x5A5A)) & ~kIdentityNamespaceBits;
    return id == 0 ? 1 : id;
}

// Subtracts without wrapping.
uint64_t less(uint64_t value, uint64_t taken) { return value > taken ? value - taken : 0; }

}  // namespace

// A region with a page list, with its process's place in the list.
struct HTSharedPageResolver::Candidate {
    std::shared_ptr<HTMemoryRegion> region;
    uint32_t process;
    uint64_t pageSize;
    // The number of the region's first identified page (see registerPages).
    uint32_t firstOrdinal = 0;
};

// Sets of processes, each a sorted list of places in the process list,
// under small numbers from 1 (0 stands for a page one process alone maps).
// Pages are met sorted by identity, and neighbouring identities mostly
// belong to one fork family, so the set last asked for is tried first.
class HTSharedPageResolver::ProcessSets {
public:
    uint32_t setOf(const std::vector<uint32_t>& members)
    {
        if (last_ != 0 && members == lastMembers_) return last_;
        auto found = numbers_.try_emplace(members, static_cast<uint32_t>(numbers_.size() + 1)).first;
        lastMembers_ = members;
        last_ = found->second;
        return last_;
    }

private:
    struct Hash {
        size_t operator()(const std::vector<uint32_t>& members) const
        {
            uint64_t hash = members.size();
            for (uint32_t member : members) hash = htMix(hash ^ member);
            return static_cast<size_t>(hash);
        }
    };
    std::unordered_map<std::vector<uint32_t>, uint32_t, Hash> numbers_;
    std::vector<uint32_t> lastMembers_;
    uint32_t last_ = 0;
};

HTSharedPageResolver::HTSharedPageResolver(const ProcessList& processes)
    : processes_(processes), sets_(std::make_unique<ProcessSets>())
{
}

HTSharedPageResolver::~HTSharedPageResolver() = default;

void HTSharedPageResolver::resolve()
{
    for (uint32_t index = 0; index < processes_.size(); ++index) {
        const HTProcess& process = *processes_[index];
        for (const auto& region : process.memoryRegions())
            if (region->sharedPageList()) candidates_.push_back(Candidate{region, index, process.pageSize(), 0});
    }
    if (candidates_.empty()) return;
    registerPages();
    cutRegions();
    candidates_.clear();
    pages_.clear();
    pages_.shrink_to_fit();
    sets_.reset();
}

void HTSharedPageResolver::registerPages()
{
    // Every identified page gets a number, in the order of the candidates
    // and of their pages: consecutive pages of one region have consecutive
    // numbers.
    IdentifiedPages identified;
    size_t total = 0;
    for (const Candidate& candidate : candidates_) total += candidate.region->sharedPageList()->identifiedPages();
    identified.reserve(total);
    uint32_t ordinal = 0;
    for (Candidate& candidate : candidates_) {
        candidate.firstOrdinal = ordinal;
        const HTSharedPageList& list = *candidate.region->sharedPageList();
        for (const HTSharedPageList::Run& run : list.runs()) {
            if (run.firstIdentity == HTSharedPageList::kNoIdentity) continue;
            for (uint32_t i = 0; i < run.count; ++i)
                identified.push_back(IdentifiedPage{list.identity(run, i), ordinal++, candidate.process});
        }
    }

    // Sorted by identity, the pages of one identity lie together, in the
    // order they were numbered, so with their processes in ascending order.
    sortByIdentity(identified);
    pages_.assign(identified.size(), PageSet{});
    std::vector<uint32_t> members;
    for (size_t first = 0, next; first < identified.size(); first = next) {
        members.clear();
        for (next = first; next < identified.size() && identified[next].identity == identified[first].identity;
             ++next) {
            if (members.empty() || members.back() != identified[next].process)
                members.push_back(identified[next].process);
        }
        // A page that one process alone maps stays its own (set 0).
        const uint32_t set = members.size() > 1 ? sets_->setOf(members) : 0;
        for (size_t at = first; at < next; ++at)
            pages_[identified[at].ordinal] = PageSet{set, identified[first].ordinal};
    }
}

void HTSharedPageResolver::sortByIdentity(IdentifiedPages& pages)
{
    // A radix sort a byte at a time from the lowest: stable, and a few
    // passes over the pages where a comparison sort takes twenty. Bytes
    // that are the same in every identity are skipped; frame and swap slot
    // numbers are small, so most high bytes are.
    constexpr unsigned kBytes = sizeof(uint64_t);
    std::vector<std::array<uint32_t, 256>> counts(kBytes);
    for (const IdentifiedPage& page : pages)
        for (unsigned byte = 0; byte < kBytes; ++byte) ++counts[byte][(page.identity >> (8 * byte)) & 0xFF];

    IdentifiedPages sorted;
    for (unsigned byte = 0; byte < kBytes; ++byte) {
        const unsigned shift = 8 * byte;
        std::array<uint32_t, 256>& count = counts[byte];
        if (pages.empty() || count[(pages[0].identity >> shift) & 0xFF] == pages.size()) continue;
        uint32_t offset = 0;
        for (uint32_t& slot : count) offset += std::exchange(slot, offset);
        sorted.resize(pages.size());
        for (const IdentifiedPage& page : pages) sorted[count[(page.identity >> shift) & 0xFF]++] = page;
        pages.swap(sorted);
    }
}

uint32_t HTSharedPageResolver::candidateOfOrdinal(uint32_t ordinal, uint32_t hint) const
{
    // Pages of one run mostly come from the same region.
    if (hint < candidates_.size() && candidates_[hint].firstOrdinal <= ordinal &&
        (hint + 1 == candidates_.size() || ordinal < candidates_[hint + 1].firstOrdinal))
        return hint;
    auto after =
        std::upper_bound(candidates_.begin(), candidates_.end(), ordinal,
                         [](uint32_t value, const Candidate& candidate) { return value < candidate.firstOrdinal; });
    return static_cast<uint32_t>(after - candidates_.begin()) - 1;
}

uint32_t HTSharedPageResolver::stretchOfPages(uint32_t ordinal, uint32_t limit, uint32_t firstMapping) const
{
    const PageSet& first = pages_[ordinal];
    // An object's pages stay together only while they come from one region
    // of its first process.
    const uint32_t regionEnd =
        firstMapping + 1 < candidates_.size() ? candidates_[firstMapping + 1].firstOrdinal : UINT32_MAX;
    uint32_t length = 1;
    while (length < limit) {
        const PageSet& next = pages_[ordinal + length];
        if (next.set != first.set) break;
        if (first.set != 0 && (next.firstOrdinal != first.firstOrdinal + length || next.firstOrdinal >= regionEnd))
            break;
        ++length;
    }
    return length;
}

void HTSharedPageResolver::cutRegions()
{
    size_t next = 0;
    while (next < candidates_.size()) {
        // The candidates of one process, and the pieces cut from each.
        const uint32_t process = candidates_[next].process;
        std::unordered_map<const HTMemoryRegion*, std::vector<std::shared_ptr<HTMemoryRegion>>> piecesOf;
        for (; next < candidates_.size() && candidates_[next].process == process; ++next) {
            std::vector<std::shared_ptr<HTMemoryRegion>> pieces;
            cutRegion(candidates_[next], pieces);
            if (!pieces.empty()) piecesOf.emplace(candidates_[next].region.get(), std::move(pieces));
        }
        if (piecesOf.empty()) continue;

        // The pieces follow their region in the walk's order.
        HTProcess& owner = *processes_[process];
        std::vector<std::shared_ptr<HTMemoryRegion>> regions;
        regions.reserve(owner.memoryRegions().size() + piecesOf.size());
        for (const auto& region : owner.memoryRegions()) {
            regions.push_back(region);
            auto found = piecesOf.find(region.get());
            if (found != piecesOf.end()) regions.insert(regions.end(), found->second.begin(), found->second.end());
        }
        owner.setMemoryRegions(std::move(regions));
    }
}

namespace {

// One piece of a region: the pages of one shared object, with their runs
// at the addresses of the object's first process.
struct Piece {
    uint64_t objectId;
    std::shared_ptr<HTMemoryRegion> region;
    std::unique_ptr<HTSubrangeBuilder> runs;
    HTMemoryTotals totals;
    uint64_t pages = 0;
};

std::shared_ptr<HTMemoryRegion> makePiece(const HTMemoryRegion& region, uint64_t objectId, uint64_t start,
                                          uint64_t offset)
{
    auto piece = std::make_shared<HTMemoryRegion>();
    piece->setStart(start);
    piece->setOffset(offset);
    piece->setUser_tag(region.user_tag());
    piece->setSegment(region.segment());
    piece->setName(region.name());
    piece->setDetailedName(region.detailedName());
    piece->setWired(region.wired());
    // The same pages in every process that maps them: shared, not the
    // process's own copy.
    piece->setShare_mode(SM_SHARED);
    piece->setObject_id(objectId);
    return piece;
}

void addTotals(HTMemoryTotals& sum, const HTMemoryTotals& more)
{
    sum.dirty += more.dirty;
    sum.swapped += more.swapped;
    sum.clean += more.clean;
    sum.reclaimable += more.reclaimable;
    sum.wired += more.wired;
}

}  // namespace

void HTSharedPageResolver::cutRegion(const Candidate& candidate, std::vector<std::shared_ptr<HTMemoryRegion>>& cut)
{
    HTMemoryRegion& region = *candidate.region;
    const std::unique_ptr<HTSharedPageList> list = region.takeSharedPageList();
    const uint64_t page = candidate.pageSize;
    HTSubrangeBuilder own(&region, page);
    std::vector<Piece> pieces;
    size_t lastPiece = 0;

    auto pieceFor = [&](uint64_t objectId, uint64_t start, uint64_t offset) -> Piece& {
        if (lastPiece < pieces.size() && pieces[lastPiece].objectId == objectId) return pieces[lastPiece];
        for (lastPiece = 0; lastPiece < pieces.size(); ++lastPiece)
            if (pieces[lastPiece].objectId == objectId) return pieces[lastPiece];
        Piece made{objectId, makePiece(region, objectId, start, offset), nullptr, {}, 0};
        made.runs = std::make_unique<HTSubrangeBuilder>(made.region.get(), page);
        pieces.push_back(std::move(made));
        return pieces.back();
    };

    uint32_t firstMapping = 0;
    uint32_t ordinal = candidate.firstOrdinal;
    for (const HTSharedPageList::Run& run : list->runs()) {
        const bool identified = run.firstIdentity != HTSharedPageList::kNoIdentity;
        for (uint32_t i = 0; i < run.count;) {
            const uint64_t index = uint64_t{run.firstPage} + i;
            const PageSet* entry = identified ? &pages_[ordinal] : nullptr;
            if (entry != nullptr && entry->set != 0)
                firstMapping = candidateOfOrdinal(entry->firstOrdinal, firstMapping);
            // The stretch of pages from here that go to one place, taken
            // whole: the region's own, or one object's consecutive pages.
            const uint32_t length = identified ? stretchOfPages(ordinal, run.count - i, firstMapping) : run.count - i;
            const uint64_t bytes = uint64_t{length} * page;
            if (entry != nullptr && entry->set != 0) {
                // The object's pages lie in the order the first process
                // maps them: the same place in every process's piece.
                const uint64_t offset = uint64_t{entry->firstOrdinal} * page;
                const uint64_t address = region.start() + index * page;
                Piece& piece = pieceFor(sharedObjectId(entry->set, firstMapping), address, offset);
                piece.runs->addRun(offset, bytes, run.kind);
                addTotals(piece.totals, htTotalsForPageKind(run.kind, bytes, false));
                piece.pages += length;
            } else {
                own.addRun(region.offset() + index * page, bytes, run.kind);
            }
            if (identified) ordinal += length;
            i += length;
        }
    }
    own.flush();

    HTMemoryTotals moved;
    for (Piece& piece : pieces) {
        piece.runs->flush();
        HTMemoryRegion& made = *piece.region;
        made.setSize(piece.pages * page);
        made.setDirtySize(piece.totals.dirty);
        made.setSwappedSize(piece.totals.swapped);
        made.setCleanNonSpecSize(piece.totals.clean);
        made.setReclaimableSize(piece.totals.reclaimable);
        addTotals(moved, piece.totals);
        cut.push_back(piece.region);
    }
    // What the region keeps is what it held less what moved; the kernel's
    // counts and the pages' kinds may differ by a page read a moment apart.
    region.setDirtySize(less(region.dirtySize(), moved.dirty));
    region.setSwappedSize(less(region.swappedSize(), moved.swapped));
    region.setCleanNonSpecSize(less(region.cleanNonSpecSize(), moved.clean));
    region.setReclaimableSize(less(region.reclaimableSize(), moved.reclaimable));
}
