#pragma once

#include "base/HTHugePageAllocator.h"

#include <cstdint>
#include <memory>
#include <vector>

class HTMemoryRegion;
class HTProcess;

// Memory that several processes map after a fork: the same physical pages
// in each, with no kernel object to name them. Gathering records, for each
// region that may hold such pages, its pages with the identities the kernel
// gives them. Once every process is gathered, and before the regions are
// routed to their objects, the resolver finds which processes map each page
// and cuts the regions accordingly:
//
// - pages that only one of the analysed processes maps stay in their region,
//   as sub-ranges of the region's own object;
// - pages mapped by a set of processes move to a new region, one per
//   object. An object is the pages with the same set of mapping processes
//   that the first of them (in the order of the process list) maps through
//   the same region; it is named after that region. Every process's piece
//   of an object holds the same pages, placed in the order in which that
//   first process maps them, so the object counts each page once while each
//   process is still charged with all of them.
//
// The piece regions follow their region in the process's region list; the
// page lists are released.
class HTSharedPageResolver {
public:
    using ProcessList = std::vector<std::shared_ptr<HTProcess>>;

    explicit HTSharedPageResolver(const ProcessList& processes);
    ~HTSharedPageResolver();
    HTSharedPageResolver(const HTSharedPageResolver&) = delete;
    HTSharedPageResolver& operator=(const HTSharedPageResolver&) = delete;

    // Cuts every region that recorded a page list. Called once.
    void resolve();

private:
    struct Candidate;
    class ProcessSets;
    // A page with the identity the kernel gave it, its number, and the
    // place of its process in the process list.
    struct IdentifiedPage {
        uint64_t identity;
        uint32_t ordinal;
        uint32_t process;
    };
    // What the resolver found of a page, by its number: the set of
    // processes that map it (0 when one process alone does), and the
    // number the page got in the first region that met it.
    struct PageSet {
        uint32_t set = 0;
        uint32_t firstOrdinal = 0;
    };

    // Sorts the pages by identity, keeping the order of pages of one
    // identity.
    using IdentifiedPages = std::vector<IdentifiedPage, HTHugePageAllocator<IdentifiedPage>>;
    static void sortByIdentity(IdentifiedPages& pages);

    void registerPages();
    void cutRegions();
    void cutRegion(const Candidate& candidate, std::vector<std::shared_ptr<HTMemoryRegion>>& pieces);
    // How many pages from the one numbered `ordinal` (at most `limit`) go
    // where it goes: pages one process alone maps, or the next pages of
    // the same object, laid out after it in the region `firstMapping`.
    uint32_t stretchOfPages(uint32_t ordinal, uint32_t limit, uint32_t firstMapping) const;
    // The candidate whose pages got the number; `hint` is tried first.
    uint32_t candidateOfOrdinal(uint32_t ordinal, uint32_t hint) const;

    const ProcessList& processes_;
    std::vector<Candidate> candidates_;
    std::vector<PageSet, HTHugePageAllocator<PageSet>> pages_;
    std::unique_ptr<ProcessSets> sets_;
};
