#include "platform/linux/HTLinuxPageQueries.h"

#include "platform/linux/HTLinuxMappings.h"
#include "platform/linux/HTLinuxTaskPort.h"
#include "platform/linux/HTLiveThread.h"
#include "platform/linux/HTPageDisposition.h"
#include "platform/linux/HTPageQueryChunk.h"
#include "platform/linux/HTPagemapScan.h"
#include "platform/linux/HTPreadFully.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdint>
#include <fcntl.h>
#include <utility>

namespace {

// What the page rules need to know of the mapping at `index`.
HTPageMapping pageMapping(HTLinuxTaskPort& task, size_t index)
{
    const HTSmapsEntry& vma = task.vmas()[index];
    HTPageMapping mapping;
    mapping.sharedMemory = vma.isSharedMemory();
    mapping.hugetlb = vma.hasFlag(HTVmFlagHugetlb);
    mapping.privateFile = vma.kind == HTSmapsKind::File && !vma.shared;
    // Device memory has frames of its own kind.
    if (vma.mapsDeviceMemory()) return mapping;
    // A block device's file systems keep their pages on the device, never in
    // swap (tmpfs and its kin sit on anonymous devices, major number 0), and
    // without a dirty page, counted from the same smaps as the walk, no file
    // page can be dirty.
    mapping.cleanFile =
        vma.kind == HTSmapsKind::File && vma.devMajor != 0 && vma.sharedDirty == 0 && vma.privateDirty == 0;
    // The anonymous pages of a file's mapping are its copies on write: the
    // zero page only fills anonymous memory, and MADV_FREE takes nothing
    // else. Anonymous memory says in smaps what it holds freed, and the
    // kernel whether it may hold a zero page.
    if (vma.kind == HTSmapsKind::File || vma.isSharedMemory())
        mapping.plainAnonymous = true;
    else if (vma.kind != HTSmapsKind::KernelProvided && vma.lazyFree == 0)
        mapping.plainAnonymous = task.mayMapZeroPage(index) == false;
    return mapping;
}

// Whether the mapping can hold private anonymous pages that another process
// maps as well. Smaps says when some page or swap slot of a mapping is
// shared; in a private file mapping, pages shared clean are the file's own,
// and copies shared after a fork are dirty or swapped.
bool mayHoldSharedAnonymousPages(const HTSmapsEntry& vma)
{
    if (vma.shared || vma.hasFlag(HTVmFlagHugetlb) || vma.mapsDeviceMemory()) return false;
    switch (vma.kind) {
    case HTSmapsKind::Anonymous:
    case HTSmapsKind::Heap:
    case HTSmapsKind::Stack:
    case HTSmapsKind::NamedAnonymous:
        return vma.mayShareWithOtherProcesses();
    case HTSmapsKind::File:
        return vma.sharedDirty != 0 || vma.swapPss < vma.swap;
    default:
        return false;
    }
}

// The disposition that every resident page (or, with `swapped`, every
// page swapped out) of the mapping has, when the mapping alone settles it;
// 0 when each page's own entry and flags are needed. A page query of such
// a page answers the same.
int32_t uniformDisposition(const HTSmapsEntry& vma, bool swapped)
{
    if (swapped || vma.hasFlag(HTVmFlagHugetlb) || vma.mapsDeviceMemory()) return 0;
    // Shared memory is all swap-backed: dirty.
    if (vma.shared && vma.isSharedMemory()) return VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;
    // A file of a block device that smaps finds wholly clean, with no
    // anonymous copy in the mapping: every page is the file's, clean.
    if (vma.kind == HTSmapsKind::File && vma.devMajor != 0 && vma.sharedDirty == 0 && vma.privateDirty == 0 &&
        vma.anonymous == 0 && vma.swap == 0)
        return VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL;
    return 0;
}

// Walks ascending page addresses through ascending [start, end) runs.
class HTRunCursor {
public:
    explicit HTRunCursor(const std::vector<std::pair<uint64_t, uint64_t>>& runs) : runs_(runs) {}
    bool contains(uint64_t address)
    {
        while (next_ < runs_.size() && runs_[next_].second <= address) ++next_;
        return next_ < runs_.size() && runs_[next_].first <= address;
    }

private:
    const std::vector<std::pair<uint64_t, uint64_t>>& runs_;
    size_t next_ = 0;
};

// The pagemap entries of the last page query on this thread. Page queries
// and identity queries come in pairs over the same pages; the second one
// takes the entries from here instead of reading them again.
struct HTLastPagemapRead {
    const HTLinuxTaskPort* task = nullptr;
    uint64_t firstPage = 0;
    size_t count = 0;
    HTPageQueryChunk chunk;
};
thread_local HTLastPagemapRead lastPagemapRead;

// Reads `count` (at most a chunk's worth) pagemap entries from `firstPage`.
// A process without an address space reads nothing; a live one reads short
// only past the top of the user address space, where no page is mapped.
kern_return_t readPagemap(HTLinuxTaskPort& task, int pagemap, uint64_t firstPage, size_t count, uint64_t* entries)
{
    ssize_t bytes = htPreadFully(pagemap, entries, count * sizeof(uint64_t), firstPage * sizeof(uint64_t));
    const size_t read = bytes < 0 ? 0 : static_cast<size_t>(bytes) / sizeof(uint64_t);
    kern_return_t result = KERN_SUCCESS;
    if (bytes < 0) {
        result = htMeansGone(errno) ? KERN_INVALID_ARGUMENT : HT_KERN_ERRNO_BASE | errno;
    } else if (read < count) {
        HTLinuxTaskPort::DirectoryUse directory(task);
        if (directory.fd() < 0)
            result = htMeansGone(errno) ? KERN_INVALID_ARGUMENT : HT_KERN_ERRNO_BASE | errno;
        else if (htThreadHasExited(directory.fd()))
            result = KERN_INVALID_ARGUMENT;
    }
    // A failed read ends the walk: its pagemap is let go at once.
    if (result != KERN_SUCCESS) {
        task.closePagemap();
        return result;
    }
    std::fill(entries + read, entries + count, uint64_t{0});
    return KERN_SUCCESS;
}

}  // namespace

int HTLinuxPageQueries::kpageflagsFd()
{
    // Readable only with the right to see physical pages (root); without
    // it every page query follows the pagemap-only rules.
    std::call_once(kpageflagsOnce_, [this] { kpageflags_.reset(::open("/proc/kpageflags", O_RDONLY | O_CLOEXEC)); });
    return kpageflags_.get();
}

kern_return_t HTLinuxPageQueries::pageRangeQuery(HTTaskPort& task, uint64_t address, uint64_t size,
                                                 int32_t* dispositions, uint64_t* count)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    if (linuxTask == nullptr || dispositions == nullptr || count == nullptr) return KERN_INVALID_ARGUMENT;
    const uint64_t pageSize = htKernelPageSize();
    if (address > UINT64_MAX - pageSize || size > UINT64_MAX - pageSize - address) return KERN_INVALID_ARGUMENT;
    const uint64_t firstPage = address / pageSize;
    const uint64_t pages = std::min((address + size + pageSize - 1) / pageSize - firstPage, *count);

    // The mappings tell shared memory and hugetlbfs pages apart, and which
    // pages need their physical page's flags at all.
    kern_return_t loaded = HTLinuxMappings::loadVmas(*linuxTask, false);
    if (loaded == MACH_SEND_INVALID_DEST) return KERN_INVALID_ARGUMENT;
    if (loaded != KERN_SUCCESS) return loaded;
    int pagemap = linuxTask->pagemapFd();
    if (pagemap < 0) return htMeansGone(errno) ? KERN_INVALID_ARGUMENT : HT_KERN_ERRNO_BASE | errno;
    int pageFlagsFd = kpageflagsFd();

    HTPageQueryChunk& chunkData = lastPagemapRead.chunk;
    auto& entries = chunkData.entries;
    lastPagemapRead.task = nullptr;
    const std::vector<HTSmapsEntry>& vmas = linuxTask->vmas();
    size_t vmaIndex = 0;
    // What the page rules need of the mapping in hand, worked out once.
    size_t mappingIndex = SIZE_MAX;
    HTPageMapping vmaMapping;
    for (uint64_t done = 0; done < pages;) {
        size_t chunk = static_cast<size_t>(std::min<uint64_t>(HTPageQueryChunk::kPages, pages - done));
        uint64_t chunkPage = firstPage + done;
        kern_return_t read = readPagemap(*linuxTask, pagemap, chunkPage, chunk, entries.data());
        if (read != KERN_SUCCESS) return read;
        lastPagemapRead.task = linuxTask;
        lastPagemapRead.firstPage = chunkPage;
        lastPagemapRead.count = chunk;

        for (size_t at = 0; at < chunk; ++at) {
            uint64_t pageAddress = (chunkPage + at) * pageSize;
            while (vmaIndex < vmas.size() && vmas[vmaIndex].end <= pageAddress) ++vmaIndex;
            if (vmaIndex < vmas.size() && vmas[vmaIndex].start <= pageAddress) {
                if (vmaIndex != mappingIndex) vmaMapping = pageMapping(*linuxTask, vmaIndex);
                mappingIndex = vmaIndex;
                chunkData.mappings[at] = vmaMapping;
            } else {
                chunkData.mappings[at] = HTPageMapping();
            }
        }
        chunkData.readPageFlags(pageFlagsFd, chunk);
        for (size_t at = 0; at < chunk; ++at) dispositions[done + at] = chunkData.disposition(at);
        done += chunk;
    }
    *count = pages;
    return KERN_SUCCESS;
}

void HTLinuxPageQueries::populatedRuns(HTTaskPort& task, uint64_t start, uint64_t end, std::vector<HTPageRun>& runs)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    int pagemap = linuxTask ? linuxTask->pagemapFd() : -1;
    thread_local std::vector<HTPagemapRun> scanned;
    // A failed scan leaves the page queries to meet the failure themselves.
    if (pagemap < 0 || HTLinuxMappings::loadVmas(*linuxTask, false) != KERN_SUCCESS ||
        !htPagemapPopulatedRuns(pagemap, start, end, scanned)) {
        runs.assign(1, HTPageRun{start, end, 0});
        return;
    }
    linuxTask->noteScan(start, end, scanned);
    runs.clear();
    const std::vector<HTSmapsEntry>& vmas = linuxTask->vmas();
    const HTSmapsEntry* vma = linuxTask->vmaAtOrAbove(start);
    size_t index = vma ? static_cast<size_t>(vma - vmas.data()) : vmas.size();
    for (const HTPagemapRun& run : scanned) {
        // A run may cross from one mapping into the next.
        for (uint64_t at = run.start; at < run.end;) {
            while (index < vmas.size() && vmas[index].end <= at) ++index;
            const bool inside = index < vmas.size() && vmas[index].start <= at;
            const uint64_t to = inside ? std::min(run.end, vmas[index].end) : run.end;
            const int32_t disposition = inside ? uniformDisposition(vmas[index], run.swapped) : 0;
            if (!runs.empty() && runs.back().end == at && runs.back().disposition == disposition)
                runs.back().end = to;
            else
                runs.push_back(HTPageRun{at, to, disposition});
            at = to;
        }
    }
}

bool HTLinuxPageQueries::canIdentifySharedPages()
{
    std::call_once(identifyOnce_, [this] {
        // A page of heft's own that is surely resident: its frame reads as 0
        // unless heft may see frames.
        static volatile uint64_t probe = 0;
        probe = probe + 1;
        HTFileDescriptor fd(::open("/proc/self/pagemap", O_RDONLY | O_CLOEXEC));
        if (!fd.isOpen()) return;
        uint64_t entry = 0;
        const uint64_t page = reinterpret_cast<uintptr_t>(&probe) / htKernelPageSize();
        ssize_t read = htPreadFully(fd.get(), &entry, sizeof(entry), page * sizeof(entry));
        canIdentify_ = read == static_cast<ssize_t>(sizeof(entry)) && htPagemapFrame(entry) != 0;
    });
    return canIdentify_;
}

kern_return_t HTLinuxPageQueries::sharedPageIdentities(HTTaskPort& task, uint64_t address, uint64_t pages,
                                                       uint64_t* identities)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    const uint64_t pageSize = htKernelPageSize();
    if (linuxTask == nullptr || identities == nullptr || address % pageSize != 0 ||
        pages > (UINT64_MAX - address) / pageSize)
        return KERN_INVALID_ARGUMENT;
    std::fill(identities, identities + pages, uint64_t{0});
    if (pages == 0 || !canIdentifySharedPages()) return KERN_SUCCESS;
    kern_return_t loaded = HTLinuxMappings::loadVmas(*linuxTask, false);
    if (loaded == MACH_SEND_INVALID_DEST) return KERN_INVALID_ARGUMENT;
    if (loaded != KERN_SUCCESS) return loaded;

    const uint64_t end = address + pages * pageSize;
    const std::vector<HTSmapsEntry>& vmas = linuxTask->vmas();
    const HTSmapsEntry* first = linuxTask->vmaAtOrAbove(address);
    if (first == nullptr) return KERN_SUCCESS;
    for (size_t index = static_cast<size_t>(first - vmas.data()); index < vmas.size() && vmas[index].start < end;
         ++index) {
        if (!mayHoldSharedAnonymousPages(vmas[index])) continue;
        const uint64_t from = std::max(address, vmas[index].start);
        const uint64_t to = std::min(end, vmas[index].end);
        kern_return_t result = identifyPages(*linuxTask, index, from, to, identities + (from - address) / pageSize);
        if (result != KERN_SUCCESS) return result;
    }
    return KERN_SUCCESS;
}

kern_return_t HTLinuxPageQueries::identifyPages(HTLinuxTaskPort& task, size_t index, uint64_t from, uint64_t to,
                                                uint64_t* identities)
{
    const uint64_t pageSize = htKernelPageSize();
    const HTSmapsEntry& vma = task.vmas()[index];
    const bool swapShared = vma.swapPss < vma.swap;
    int pagemap = task.pagemapFd();
    if (pagemap < 0) return htMeansGone(errno) ? KERN_INVALID_ARGUMENT : HT_KERN_ERRNO_BASE | errno;

    // A read of anonymous memory never written maps a zero page, which is
    // in every process and holds nothing. The kernel lists where they are;
    // a kernel without the scan is asked page by page.
    thread_local std::vector<std::pair<uint64_t, uint64_t>> zeroRuns;
    const bool checkZero = task.mayMapZeroPage(index) != false;
    const bool zeroRunsKnown = checkZero &&
        (task.zeroPageRunsFromScan(from, to, zeroRuns) || htPagemapZeroPageRuns(pagemap, from, to, zeroRuns));
    HTRunCursor zeroPages(zeroRuns);

    thread_local std::array<uint64_t, HTPageQueryChunk::kPages> ownEntries;
    for (uint64_t at = from; at < to;) {
        const size_t chunk = static_cast<size_t>(std::min<uint64_t>(HTPageQueryChunk::kPages, (to - at) / pageSize));
        const uint64_t firstPage = at / pageSize;
        const HTLastPagemapRead& last = lastPagemapRead;
        const uint64_t* entries = ownEntries.data();
        if (last.task == &task && firstPage >= last.firstPage && firstPage + chunk <= last.firstPage + last.count) {
            entries = last.chunk.entries.data() + (firstPage - last.firstPage);
        } else {
            kern_return_t read = readPagemap(task, pagemap, firstPage, chunk, ownEntries.data());
            if (read != KERN_SUCCESS) return read;
        }
        for (size_t i = 0; i < chunk; ++i) {
            uint64_t identity = htSharedPageIdentity(entries[i], swapShared, false);
            // Only a resident page can be a zero page.
            if (identity != 0 && checkZero && (entries[i] & HT_PAGEMAP_PRESENT) != 0) {
                const bool zero =
                    zeroRunsKnown ? zeroPages.contains(at + i * pageSize) : isZeroFrame(htPagemapFrame(entries[i]));
                if (zero) identity = 0;
            }
            *identities++ = identity;
        }
        at += chunk * pageSize;
    }
    return KERN_SUCCESS;
}

bool HTLinuxPageQueries::isZeroFrame(uint64_t frame)
{
    int fd = kpageflagsFd();
    uint64_t flags = 0;
    if (fd < 0 || htPreadFully(fd, &flags, sizeof(flags), frame * sizeof(flags)) != sizeof(flags)) return false;
    return (flags & HT_KPF_ZERO_PAGE) != 0;
}
