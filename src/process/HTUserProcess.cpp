#include "process/HTUserProcess.h"

#include "base/HTAssert.h"
#include "base/HTNoticeLog.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "model/HTMemoryRegion.h"
#include "platform/HTSnapshotGraphWriter.h"
#include "process/HTImage.h"
#include "process/HTImageEnumerator.h"
#include "process/HTSnapshotRecorder.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <iterator>

namespace {

constexpr const char* kModule = "HTUserProcess";
constexpr const char* kBailOutNotice = "bailing out for process %s; data may be incomplete!";

// What standard error says of processes that went away while heft read
// them. On a busy machine that is nothing unusual, and the report already
// marks each one: one line names them all.
constexpr const char* kExitedNotice =
    "%s: exited while being read; the report shows what was read, marked \"(process exited)\"";
constexpr const char* kZombieNotice =
    "%s: had exited and was not yet reaped (a zombie) when read; marked \"(zombie)\" in the report";
constexpr const char* kGoneBeforeOpenNotice = "%s: exited before it could be opened; not measured";
// The bisection for the end of the private address space stops once its
// interval is this small.
constexpr uint64_t kBisectionResolution = 0x1000000;
constexpr size_t kRegionPathLength = 1024;
// The shared region that each platform code implies.
struct SharedRegionLayout {
    uint64_t base;
    uint64_t size;
};
constexpr SharedRegionLayout kSharedRegions[] = {
    {0x90000000, 0x20000000},      // 0: 32-bit x86
    {0x7FFF00000000, 0xFFE00000},  // 1: 64-bit x86
    {0x40000000, 0x40000000},      // 2: 32-bit ARM
    {0x180000000, 0x100000000},    // 3: 64-bit ARM
    {0x1A000000, 0x40000000},      // 4: 64-bit ARM with 32-bit pointers
    {0, 0},                        // 5: Linux, which has no shared library cache
};

// strerror_r comes in two flavours; both give the text here.
[[maybe_unused]] const char* errnoText(int result, const char* buffer)
{
    return result == 0 ? buffer : "Unknown error";
}
[[maybe_unused]] const char* errnoText(const char* result, const char*) { return result; }

// Running out of file descriptors stops every process alike: it is said once
// a run, with its cure, rather than once per process.
constexpr const char* kOutOfDescriptors = "Too many open files: raise the open-file limit (ulimit -n)";
std::atomic<bool> outOfDescriptorsSaid{false};

// The errno a platform call's failure carries; 0 for a kernel code.
int errnoOf(kern_return_t code) { return (code & ~0xffff) == HT_KERN_ERRNO_BASE ? code & 0xffff : 0; }

}  // namespace

// --- creation ---------------------------------------------------------------------

HTUserProcess::HTUserProcess(std::shared_ptr<HTPlatform> platform) : HTProcess(std::move(platform)) {}

HTUserProcess::~HTUserProcess() = default;

bool HTUserProcess::initWithBsdInfo(const proc_bsdinfo& info)
{
    if (!HTProcess::initWithBsdInfo(info)) return false;
    _setSharedRegionFromPlatform(_platformCode());
    images_.clear();
    _gatherPhysHeft();
    _gatherLedgers();
    _gatherIdleExitStatus();
    return true;
}

bool HTUserProcess::_populateTask()
{
    kern_return_t result = platform().task_for_pid(pid(), &task_);
    if (result == KERN_SUCCESS) return true;
    task_.reset();
    if (_saidOutOfDescriptors(errnoOf(result))) return false;
    if (result == (HT_KERN_ERRNO_BASE | ESRCH))
        HTNoticeLog::standardError().add(kGoneBeforeOpenNotice, pid(), displayString());
    else
        HTNoticeLog::standardError().add("%s: could not be opened: " + platform().mach_error_string(result), pid(),
                                         displayString());
    char message[512];
    std::snprintf(message, sizeof(message), "task_for_pid [%d] %s", pid(),
                  platform().mach_error_string(result).c_str());
    _addGlobalError(message);
    return false;
}

bool HTUserProcess::_isAlive() { return true; }

// A live process on Linux maps no shared library cache, whatever its
// architecture: the Linux code's empty shared region keeps every mapping on
// the ordinary path. The Mach codes stay for snapshots taken on a system
// that has such a cache.
int HTUserProcess::_platformCode() { return HTPlatformLinux; }

bool HTUserProcess::_setSharedRegionFromPlatform(int platformCode)
{
    if (platformCode < 0 || platformCode >= static_cast<int>(std::size(kSharedRegions))) {
        std::fprintf(stderr, "Unable to determine platform architecture of target\n");
        return false;
    }
    sharedRegionBase_ = kSharedRegions[platformCode].base;
    sharedRegionSize_ = kSharedRegions[platformCode].size;
    return true;
}

// --- figures read at creation and before gathering --------------------------------

void HTUserProcess::_gatherPhysHeft()
{
    if (!_isAlive()) return;
    rusage_info_v4 usage{};
    if (platform().proc_pid_rusage(pid(), RUSAGE_INFO_V4, &usage) != 0) return;
    phys_heft_ = usage.ri_phys_heft;
    phys_heft_peak_ = usage.ri_lifetime_max_phys_heft;
}

void HTUserProcess::_forgetLedgerTemplate() { HTOwnedMemory::forgetLedgerTemplate(); }

void HTUserProcess::_forgetOutOfDescriptors() { outOfDescriptorsSaid = false; }

void HTUserProcess::_gatherLedgers()
{
    if (!breakDownPhysHeft() || !_isAlive()) return;
    std::optional<uint64_t> balance;
    int error = 0;
    if (!HTOwnedMemory::readPageTableLedger(platform(), pid(), balance, error)) {
        errno = error;
        _addErrnoWarningWithDescription("Unable to retrieve ledger entry info");
        return;
    }
    if (balance) ledgers_[0] = *balance;
}

void HTUserProcess::_gatherIdleExitStatus()
{
    // A process whose flags cannot be read is not under idle-exit control.
    uint32_t flags = 0;
    if (platform().proc_get_dirty(pid(), &flags) != 0) flags = 0;
    _setIdleExitStatusFromDirtyFlags(flags);
}

void HTUserProcess::_setIdleExitStatusFromDirtyFlags(uint32_t flags)
{
    constexpr uint32_t controlled = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    if ((flags & controlled) != controlled)
        setIdleExitStatus(HTIdleExitStatusNotControlled);
    else if (flags & PROC_DIRTY_IS_DIRTY)
        setIdleExitStatus(HTIdleExitStatusDirty);
    else
        setIdleExitStatus(HTIdleExitStatusClean);
}

void HTUserProcess::_gatherImageData()
{
    if (!task_) return;
    images_ = HTImage::gatherImages(platform(), *task_, sharedRegionBase_, sharedRegionSize_);
}

std::optional<HTOwnedVmObjectMap> HTUserProcess::_gatherOwnedVmObjects()
{
    if (!breakDownPhysHeft()) return std::nullopt;
    bool failed = false;
    int error = 0;
    std::optional<HTOwnedVmObjectMap> objects =
        HTOwnedMemory::readOwnedVmObjects(platform(), task_ ? task_->pid() : pid(), failed, error);
    if (failed) {
        errno = error;
        _addErrnoWarningWithDescription("vm.get_owned_vmobjects");
    }
    return objects;
}

// --- diagnostics -------------------------------------------------------------------

HTUserProcess::HTCallFailure HTUserProcess::_failureIfGone()
{
    if (!_isAlive()) return HTCallFailure::Failed;
    proc_bsdshortinfo info{};
    errno = 0;
    int filled = platform().proc_pidinfo(pid(), PROC_PIDT_SHORTBSDINFO, 1, &info, sizeof(info));
    if (filled == static_cast<int>(sizeof(info))) {
        if (info.pbsi_status == SZOMB) return HTCallFailure::Zombie;
        // A process whose exit is under way has lost its memory already.
        if (info.pbsi_flags & PROC_FLAG_INEXIT) return HTCallFailure::Exited;
        return HTCallFailure::Failed;
    }
    return filled <= 0 && errno == ESRCH ? HTCallFailure::Exited : HTCallFailure::Failed;
}

HTUserProcess::HTCallFailure HTUserProcess::_processMachVMError(kern_return_t code, kern_return_t expectedOnExit)
{
    const HTCallFailure failure = code == expectedOnExit ? _failureIfGone() : HTCallFailure::Failed;
    const char* suffix = failure == HTCallFailure::Zombie ? " (zombie)"
        : failure == HTCallFailure::Exited                ? " (process exited)"
                                                          : "";
    char message[1024];
    std::snprintf(message, sizeof(message), "%s: %s%s", displayString().c_str(),
                  platform().mach_error_string(code).c_str(), suffix);
    // Once a process has gone, every later call fails alike.
    if (failure != HTCallFailure::Failed) {
        if (std::find(warnings().begin(), warnings().end(), message) == warnings().end()) warnings().push_back(message);
    } else {
        const std::vector<std::string> recorded = errors();
        if (std::find(recorded.begin(), recorded.end(), message) == recorded.end()) addError(message);
    }
    return failure;
}

void HTUserProcess::_addFailureNotice(HTCallFailure failure, const std::string& failedText)
{
    HTNoticeLog& notices = HTNoticeLog::standardError();
    if (failure == HTCallFailure::Exited)
        notices.add(kExitedNotice, pid(), displayString());
    else if (failure == HTCallFailure::Zombie)
        notices.add(kZombieNotice, pid(), displayString());
    else
        notices.add(failedText, pid(), displayString());
}

void HTUserProcess::_addErrnoWarningWithDescription(const std::string& description)
{
    const int error = errno;
    char text[256];
    const char* errorText = errnoText(strerror_r(error, text, sizeof(text)), text);
    // A process that is gone is the common case on a busy machine: said in
    // words, and on standard error in the one line of such processes.
    const HTCallFailure failure = error == ESRCH ? _failureIfGone() : HTCallFailure::Failed;
    const char* reason = failure == HTCallFailure::Exited ? "process exited"
        : failure == HTCallFailure::Zombie                ? "zombie"
                                                          : errorText;
    char message[1024];
    std::snprintf(message, sizeof(message), "%s: %s - %s", displayString().c_str(), description.c_str(), reason);
    warnings().push_back(message);
    if (!_saidOutOfDescriptors(error)) _addFailureNotice(failure, "%s: " + description + " - " + errorText);
}

bool HTUserProcess::_saidOutOfDescriptors(int error)
{
    if (error != EMFILE && error != ENFILE) return false;
    if (!outOfDescriptorsSaid.exchange(true)) {
        std::fprintf(stderr, "%s\n", kOutOfDescriptors);
        _addGlobalError(kOutOfDescriptors);
    }
    return true;
}

// --- the address-space walk --------------------------------------------------------

uint64_t HTUserProcess::_lastNonSharedCacheRegion()
{
    // With no shared region there is nothing to skip to.
    if (sharedRegionSize_ == 0 || !task_) return 0;
    const uint64_t page = pageSize();
    uint64_t lo = 0;
    uint64_t hi = sharedRegionBase_;
    while (true) {
        uint64_t address = lo / 2 + hi / 2;
        const uint64_t mid = address;
        uint64_t size = 0;
        vm_region_basic_info_64 info{};
        uint32_t count = VM_REGION_BASIC_INFO_COUNT_64;
        if (platform().mach_vm_region(*task_, &address, &size, &info, &count) != KERN_SUCCESS) return lo;
        if (address == lo) return lo;
        if (address >= sharedRegionBase_)
            hi = mid > page ? mid - page : 0;
        else
            lo = address;
        if (hi <= lo || hi - lo <= kBisectionResolution) return lo;
    }
}

void HTUserProcess::_bailOutOfWalk(kern_return_t code)
{
    const HTCallFailure failure = _processMachVMError(code, MACH_SEND_INVALID_DEST);
    if (!_saidOutOfDescriptors(errnoOf(code)))
        _addFailureNotice(failure,
                          std::string(kBailOutNotice) +
                              " (its memory map could not be read: " + platform().mach_error_string(code) + ")");
}

void HTUserProcess::enumerateRegions(const RegionCallback& callback)
{
    if (!task_) return;
    HTTaskPort& task = *task_;
    const uint64_t lastPrivate = _lastNonSharedCacheRegion();
    const uint64_t sharedEnd = sharedRegionBase_ + sharedRegionSize_;
    uint64_t address = 0;
    bool fakeSeen = false;

    while (true) {
        uint64_t start = address;
        uint64_t size = 0;
        vm_region_submap_info_64 info{};

        // Past the private address space, every shared-region mapping is
        // taken whole with one top-level look-up instead of entry by entry.
        if (lastPrivate != 0 && lastPrivate <= address && address < sharedEnd) {
            vm_region_basic_info_64 basic{};
            uint32_t count = VM_REGION_BASIC_INFO_COUNT_64;
            uint64_t found = address;
            kern_return_t result = platform().mach_vm_region(task, &found, &size, &basic, &count);
            if (result == KERN_INVALID_ADDRESS) return;
            if (result != KERN_SUCCESS) {
                _bailOutOfWalk(result);
                return;
            }
            start = std::max(found, address);
            if (start >= lastPrivate && start >= sharedRegionBase_ && start < sharedEnd) {
                info.protection = basic.protection;
                info.max_protection = basic.max_protection;
                info.inheritance = basic.inheritance;
                info.offset = basic.offset;
                info.behavior = basic.behavior;
                info.user_wired_count = basic.user_wired_count;
                info.external_pager = 1;
                info.share_mode = SM_COW;
                info.object_id = 1;
                info.object_id_full = 1;
                if (callback(start, size, info, VM_PURGABLE_DENY, std::nullopt)) return;
                if (start + size <= address) return;
                address = start + size;
                continue;
            }
        }

        uint64_t found = start;
        uint32_t depth = 0xFFFFFFFF;
        uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
        kern_return_t result = platform().mach_vm_region_recurse(task, &found, &size, &depth, &info, &count);
        if (result == KERN_INVALID_ADDRESS) return;
        if (result != KERN_SUCCESS) {
            _bailOutOfWalk(result);
            return;
        }
        // An older kernel's shorter record has no full object id.
        if (count < VM_REGION_SUBMAP_INFO_COUNT_64) info.object_id_full = info.object_id;
        // The kernel's fake regions for owned memory come last.
        if (fakeSeen && info.user_tag != HTFakeRegionTag) return;
        start = found;

        int32_t purgeState = VM_PURGABLE_DENY;
        if (platform().mach_vm_purgable_control(task, start, VM_PURGABLE_GET_STATE, &purgeState) != KERN_SUCCESS)
            purgeState = VM_PURGABLE_DENY;
        HT_ASSERT(kModule, !info.is_submap, "!info.is_submap");
        if (info.user_tag == HTFakeRegionTag) fakeSeen = true;

        std::optional<std::string> path;
        if (info.external_pager != 0 && _isAlive()) {
            char buffer[kRegionPathLength];
            int length = platform().proc_regionfilename(task, start, buffer, sizeof(buffer));
            if (length > 0) path.emplace(buffer, std::min<size_t>(static_cast<size_t>(length), sizeof(buffer)));
        }

        if (callback(start, size, info, purgeState, path)) return;
        // A region of no length would be found again forever.
        if (start + size <= address) return;
        address = start + size;
    }
}

// --- pages ---------------------------------------------------------------------------

bool HTUserProcess::_checkPageQuery(kern_return_t result)
{
    if (result == KERN_SUCCESS) return true;
    const HTCallFailure failure = _processMachVMError(result, KERN_INVALID_ARGUMENT);
    if (!_saidOutOfDescriptors(errnoOf(result)))
        _addFailureNotice(failure,
                          "%s: its pages could not be read (" + platform().mach_error_string(result) +
                              "); data may be incomplete");
    return false;
}

bool HTUserProcess::_populateMemoryRegionWithPageQueries(const std::shared_ptr<HTMemoryRegion>& region,
                                                         const vm_region_submap_info_64&)
{
    HT_ASSERT(kModule, task_ != nullptr, "task_ != nullptr");
    if (!sharedCache_) sharedCache_.emplace(pageSize());
    return _checkPageQuery(sharedCache_->measurePiece(region, HTPageRunWalker(platform(), *task_, pageSize())));
}

kern_return_t HTUserProcess::_readPages(uint64_t start, uint64_t pages, bool identify,
                                        const HTPageRunWalker::PageChunkCallback& chunk)
{
    HT_ASSERT(kModule, task_ != nullptr, "task_ != nullptr");
    const HTPageRunWalker walker(platform(), *task_, pageSize());
    if (!recorder_) return walker.readPages(start, pages, identify, chunk);
    return walker.readPages(start, pages, identify, [&](const HTPageRunWalker::PageChunk& pageChunk) {
        recorder_->addPages(pageChunk);
        chunk(pageChunk);
    });
}

bool HTUserProcess::_canIdentifySharedPages() { return platform().canIdentifySharedPages(); }

void HTUserProcess::_walkPagesOfRegion(const HTMemoryRegion& region, const HTPageRunWalker::PageTargets& targets,
                                       int32_t purgeState)
{
    _checkPageQuery(HTPageRunWalker::walkPages(
        region, targets, purgeState, pageSize(),
        [this](uint64_t start, uint64_t pages, bool identify, const HTPageRunWalker::PageChunkCallback& chunk) {
            return _readPages(start, pages, identify, chunk);
        }));
}

void HTUserProcess::_addSubrangesForRegion(HTMemoryRegion& region, int32_t purgeState)
{
    HT_ASSERT(kModule, !region.ownedExclusivelyByParentProcess(), "!region.ownedExclusivelyByParentProcess()");
    _walkPagesOfRegion(region, HTPageRunWalker::PageTargets{&region, nullptr, false}, purgeState);
}

void HTUserProcess::_measurePages(HTMemoryRegion& region, HTMemoryRegion* copies, const vm_region_submap_info_64& info,
                                  int32_t purgeState)
{
    const uint64_t page = pageSize();
    const bool hidden = hiddenFromDisplay();
    const bool sharingDisabled = sharingAnalysisDisabled();
    const bool subranges = breakDownPhysHeft() && !sharingDisabled && !hidden;
    // Private memory that other processes map as well, after a fork, is
    // named page by page so that the analysis counts each page once.
    const bool mayShare = !sharingDisabled && !hidden && info.ref_count > 1 && info.share_mode == SM_COW &&
        (copies != nullptr || info.external_pager == 0) && region.size() / page < HTSharedPageList::kNoIdentity;
    const bool walkable = _canWalkPages();
    const bool identify = mayShare && walkable && _canIdentifySharedPages();
    if (mayShare && !identify) sharedPagesUnidentified_ = true;
    if (!walkable) return;

    if (copies == nullptr && !identify) {
        if (subranges && region.eligibleForSubrangesUsingPageSize(page)) _addSubrangesForRegion(region, purgeState);
        return;
    }
    HTMemoryRegion& pages = copies ? *copies : region;
    HTPageRunWalker::PageTargets targets;
    if (identify || (subranges && pages.eligibleForSubrangesUsingPageSize(page))) targets.pages = &pages;
    targets.identify = identify;
    targets.copiesOnly = copies != nullptr;
    if (copies && subranges && region.eligibleForSubrangesUsingPageSize(page)) targets.filePages = &region;
    if (targets.pages || targets.filePages) _walkPagesOfRegion(region, targets, purgeState);
}

// --- gathering ---------------------------------------------------------------------

void HTUserProcess::gatherData()
{
    if (!hiddenFromDisplay()) {
        _gatherImageData();
        _gatherPhysHeft();
        ownedVmObjects_ = _gatherOwnedVmObjects();
        if (!settings().snapshotDirectory.empty() && _isAlive())
            recorder_ = std::make_unique<HTSnapshotRecorder>(pageSize());
    }
    _gatherMemoryData();
    images_.clear();
    images_.shrink_to_fit();
    if (recorder_) _saveSnapshot();
}

void HTUserProcess::_saveSnapshot()
{
    const std::unique_ptr<HTSnapshotRecorder> recorder = std::move(recorder_);
    const std::string path = settings().snapshotDirectory + "/" + HTSnapshotRecorder::fileName(name(), pid());
    // A process that went away or could not be read whole is not saved: a
    // snapfile holds a whole address space or nothing.
    if (!errors().empty() || !warnings().empty()) {
        HTNoticeLog::standardError().add("%s: not saved as a snapfile, as it was not read whole", pid(),
                                         displayString());
        return;
    }
    HTSnapshotGraph& graph = recorder->graph();
    graph.snapshotIs64Bit = is64bit();
    graph.snapshotPid = pid();
    graph.snapshotProcessName = name();
    graph.snapshotProcessDescription = platform().systemDescription();
    graph.snapshotPageSize = static_cast<uint32_t>(pageSize());
    graph.snapshotPhysHeft = phys_heft_;
    graph.snapshotPhysHeftPeak = phys_heft_peak_;
    graph.snapshotShowsPhysHeft = breakDownPhysHeft();
    graph.snapshotIdentifiesSharedPages = _canIdentifySharedPages();
    graph.snapshotPageTableSize = ledgers_[0];
    graph.snapshotCapture = settings().snapshotCapture;
    std::string errorText;
    if (!HTSnapshotGraphWriter::writeToPath(graph, path, &errorText))
        HTNoticeLog::standardError().add("%s: not saved as a snapfile: " + path + ": " + errorText, pid(),
                                         displayString());
}

void HTUserProcess::_gatherMemoryData()
{
    const uint64_t page = pageSize();
    HTImageEnumerator enumerator(images_);
    std::vector<std::shared_ptr<HTMemoryRegion>> regions;
    const bool hidden = hiddenFromDisplay();
    const bool breakDown = breakDownPhysHeft();
    const bool linux = _platformCode() == HTPlatformLinux;
    HTOwnedMemory owned(std::move(ownedVmObjects_));
    ownedVmObjects_.reset();
    if (!sharedCache_) sharedCache_.emplace(page);
    const HTSharedCacheSlicer::MeasureCallback measurePiece = [this](const std::shared_ptr<HTMemoryRegion>& piece,
                                                                     const vm_region_submap_info_64& pieceInfo) {
        return _populateMemoryRegionWithPageQueries(piece, pieceInfo);
    };

    enumerateRegions([&](uint64_t start, uint64_t size, const vm_region_submap_info_64& info, int32_t purgeState,
                         const std::optional<std::string>& path) -> bool {
        if (_isInSharedRegion(start)) {
            if (hidden) return false;
            if (!sharedCache_->addRegions(regions, start, size, info, enumerator, measurePiece)) {
                // The failed page query has told of a process that went
                // away; one still there bails out as the walk does.
                if (!errors().empty()) HTNoticeLog::standardError().add(kBailOutNotice, pid(), displayString());
                return true;
            }
            return false;
        }

        auto region = std::make_shared<HTMemoryRegion>();
        region->setStart(start);
        region->setSize(size);
        region->setUser_tag(info.user_tag);
        region->setObject_id(info.object_id_full);
        region->setShare_mode(info.share_mode);
        region->setOffset(info.offset);
        region->setInSharedCache(false);
        region->setWired(info.user_wired_count != 0);

        // Sizes from the kernel's page counts.
        switch (purgeState) {
        case VM_PURGABLE_EMPTY:
            region->setReclaimableSize(size);
            break;
        case VM_PURGABLE_VOLATILE:
            region->setReclaimableSize(page * info.pages_resident);
            break;
        default: {
            const uint64_t resident = info.pages_resident;
            const uint64_t reusable = info.pages_reusable;
            // Without the breakdown the kernel's dirtied count of anonymous
            // memory is not per region; what is resident and not reusable is
            // dirty there.
            const uint64_t dirtyPages = info.external_pager == 0 && !breakDown
                ? (resident > reusable ? resident - reusable : 0)
                : info.pages_dirtied;
            region->setDirtySize(page * dirtyPages);
            region->setReclaimableSize(page * reusable);
            region->setSwappedSize(page * static_cast<uint64_t>(info.pages_swapped_out));
            region->setCleanNonSpecSize(resident > dirtyPages + reusable ? page * (resident - dirtyPages - reusable)
                                                                         : 0);
            if (info.user_tag == HTFakeRegionTag) {
                // The owned-object list accounts for unmapped owned memory
                // itself when there is one.
                if (owned.hasObjectList()) return false;
                owned.setFakeRegion(region);
                if (info.object_id_full == 0) region->setObject_id(info.object_id);
            }
            break;
        }
        }

        // Naming, and the owned objects behind anonymous memory.
        region->setSegment(HTSegmentNoImage);
        if (std::shared_ptr<HTImage> image = enumerator.nextImageForStart(start, start + size)) {
            region->setName(image->name());
            region->setDetailedName(image->ownerPath());
            region->setSegment(image->segment());
        } else if (path || info.external_pager != 0) {
            region->setName("mapped file");
            region->setDetailedName(path);
        } else {
            region->setName(HTMemoryRegion::categoryNameForTag(info.user_tag));
            if (breakDown) owned.chargeAnonymousRegion(*region, info, purgeState);
        }

        if (recorder_)
            recorder_->addRegion(start, size, info, purgeState, region->detailedName().value_or(""),
                                 region->name().value_or(""));

        std::shared_ptr<HTMemoryRegion> copies;
        if (linux && info.external_pager != 0 && info.inheritance != VM_INHERIT_SHARE &&
            !region->ownedExclusivelyByParentProcess()) {
            // The file's pages of one image segment are an object of their
            // own, the same in every process that maps the image, so that
            // two segments of one file never pass for one.
            if (region->segment() == HTSegmentOther)
                region->setObject_id(HTPageRunWalker::fileSegmentIdentity(region->object_id(), region->offset()));
            copies = HTPageRunWalker::splitCopiedPages(*region, info, page, pid());
            // The file's pages belong to the file, shared with every process
            // that maps it, dirty or not: only the copies are this
            // process's own.
            if (region->share_mode() == SM_COW) region->setShare_mode(SM_SHARED);
        }
        _measurePages(*region, copies.get(), info, purgeState);

        if (!owned.isFakeRegion(region)) regions.push_back(region);
        if (copies) regions.push_back(copies);
        return false;
    });

    owned.addUnmappedMemory(regions, warnings(), displayString());
    if (breakDown && ledgers_[0] != 0) HTOwnedMemory::addPageTables(regions, ledgers_[0]);

    setMemoryRegions(std::move(regions));
}

std::shared_ptr<HTAuxDataMap> HTUserProcess::auxData()
{
    if (phys_heft_ == 0) return nullptr;
    auto data = std::make_shared<HTAuxDataMap>();
    data->set("phys_heft", std::make_shared<HTAuxData>(static_cast<int64_t>(phys_heft_), false));
    data->set("phys_heft_peak", std::make_shared<HTAuxData>(static_cast<int64_t>(phys_heft_peak_), false));
    return data;
}
