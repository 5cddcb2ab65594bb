#pragma once

#include "model/HTMemoryTotals.h"

#include <cstddef>
#include <cstdint>
#include <vector>

// The kind a page counts as, in sub-ranges and page lists.
enum class HTPageKind : uint8_t { None, Dirty, Swapped, Reclaimable, Clean };

// The totals of `bytes` of one kind; wired too when the region is wired.
HTMemoryTotals htTotalsForPageKind(HTPageKind kind, uint64_t bytes, bool wired);

// The populated pages of one region whose pages other processes may map as
// well (private memory after a fork), page by page: each page's kind and,
// where the kernel named the page, its identity (0 for a page that only
// this process maps). The analysis matches identities across processes
// once every process is gathered, and turns the list into sub-ranges.
//
// Pages are kept as runs of consecutive pages of one kind, identified or
// not; identities are stored only for identified pages, so a page costs
// eight bytes at most.
class HTSharedPageList {
public:
    struct Run {
        uint32_t firstPage;      // index of the first page in the region
        uint32_t count;          // pages in the run
        uint32_t firstIdentity;  // index of the first identity; kNoIdentity when unidentified
        HTPageKind kind;
    };
    static constexpr uint32_t kNoIdentity = UINT32_MAX;

    // Appends page `page` (indexes must ascend) of a kind other than None.
    void addPage(uint32_t page, HTPageKind kind, uint64_t identity);
    // Appends `count` pages from `page` that no identity names, as many
    // calls of addPage would, in one step.
    void addUnidentifiedPages(uint32_t page, uint32_t count, HTPageKind kind);

    const std::vector<Run>& runs() const { return runs_; }
    // The identity of the run's `i`-th page; the run must be identified.
    uint64_t identity(const Run& run, uint32_t i) const { return identities_[run.firstIdentity + i]; }
    size_t identifiedPages() const { return identities_.size(); }

private:
    std::vector<Run> runs_;
    std::vector<uint64_t> identities_;
};
