#include "model/HTSharedPageList.h"

#include "base/HTAssert.h"

HTMemoryTotals htTotalsForPageKind(HTPageKind kind, uint64_t bytes, bool wired)
{
    HTMemoryTotals totals;
    switch (kind) {
    case HTPageKind::Dirty:
        totals.dirty = bytes;
        break;
    case HTPageKind::Swapped:
        totals.swapped = bytes;
        break;
    case HTPageKind::Reclaimable:
        totals.reclaimable = bytes;
        break;
    case HTPageKind::Clean:
        totals.clean = bytes;
        break;
    case HTPageKind::None:
        break;
    }
    if (wired && kind != HTPageKind::None) totals.wired = bytes;
    return totals;
}

void HTSharedPageList::addPage(uint32_t page, HTPageKind kind, uint64_t identity)
{
    HT_ASSERT("HTSharedPageList", kind != HTPageKind::None, "kind != HTPageKind::None");
    const bool identified = identity != 0;
    if (!runs_.empty()) {
        Run& last = runs_.back();
        HT_ASSERT("HTSharedPageList", page >= last.firstPage + last.count, "pages ascend");
        if (page == last.firstPage + last.count && last.kind == kind &&
            (last.firstIdentity != kNoIdentity) == identified) {
            ++last.count;
            if (identified) identities_.push_back(identity);
            return;
        }
    }
    Run run{page, 1, kNoIdentity, kind};
    if (identified) {
        run.firstIdentity = static_cast<uint32_t>(identities_.size());
        identities_.push_back(identity);
    }
    runs_.push_back(run);
}

void HTSharedPageList::addUnidentifiedPages(uint32_t page, uint32_t count, HTPageKind kind)
{
    HT_ASSERT("HTSharedPageList", kind != HTPageKind::None, "kind != HTPageKind::None");
    if (count == 0) return;
    if (!runs_.empty()) {
        Run& last = runs_.back();
        HT_ASSERT("HTSharedPageList", page >= last.firstPage + last.count, "pages ascend");
        if (page == last.firstPage + last.count && last.kind == kind && last.firstIdentity == kNoIdentity) {
            last.count += count;
            return;
        }
    }
    runs_.push_back(Run{page, count, kNoIdentity, kind});
}
