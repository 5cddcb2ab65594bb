#include "process/HTUserProcess.h"

#include "base/HTAssert.h"
#include "base/HTMix.h"
#include "base/HTNoticeLog.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "model/HTMemoryRegion.h"
#include "model/HTSubrangeBuilder.h"
#include "process/HTImage.h"
#include "process/HTImageEnumerator.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <iterator>
#include <mutex>
#include <string_view>

namespace {

constexpr const char* kModule = "HTUserProcess";
constexpr const char* kOwnedVmObjectsSetting = "vm.get_owned_vmobjects";
constexpr const char* kBailOutNotice = "bailing out for process %s; data may be incomplete!";

// What standard error says of processes that went away while heft read
// them. On a busy machine that is nothing unusual, and the report already
// marks each one: one line names them all.
constexpr const char* kExitedNotice =
    "%s: exited while being read; the report shows what was read, marked \"(process exited)\"";
constexpr const char* kZombieNotice =
    "%s: had exited and was not yet reaped (a zombie) when read; marked \"(zombie)\" in the report";
constexpr const char* kGoneBeforeOpenNotice = "%s: exited before it could be opened; not measured";
// Room for 16 more owned-object records each time the list is asked for,
// for objects created between two asks.
constexpr size_t kOwnedVmObjectsHeadroom = 16 * sizeof(HTOwnedVmObject);
// The bisection for the end of the private address space stops once its
// interval is this small.
constexpr uint64_t kBisectionResolution = 0x1000000;
constexpr uint32_t kIOKitTag = 87;
constexpr size_t kRegionPathLength = 1024;
// Identities heft derives for regions of its own keep to the namespaces of
// the platform's: the top bit for a file's pages, the top two bits 01 for
// anonymous memory.
constexpr uint64_t kFileIdentityBit = uint64_t{1} << 63;
constexpr uint64_t kAnonymousIdentityBit = uint64_t{1} << 62;
constexpr uint64_t kIdentityNamespaceBits = uint64_t{3} << 62;

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

uint64_t roundDown(uint64_t value, uint64_t unit) { return value / unit * unit; }
uint64_t roundUp(uint64_t value, uint64_t unit) { return (value + unit - 1) / unit * unit; }

// A page of a shared-cache piece counts as dirty when the kernel says so or
// when it is resident anonymous memory.
bool countsAsDirty(int32_t disposition)
{
    return (disposition & VM_PAGE_QUERY_PAGE_DIRTY) ||
        ((disposition & VM_PAGE_QUERY_PAGE_PRESENT) && !(disposition & VM_PAGE_QUERY_PAGE_EXTERNAL));
}

HTPageKind pageKind(int32_t disposition, int32_t purgeState)
{
    if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT) return HTPageKind::Swapped;
    if (disposition & VM_PAGE_QUERY_PAGE_DIRTY) return HTPageKind::Dirty;
    // A volatile object may lose any present page; elsewhere only pages
    // marked reusable can be taken back.
    int32_t reclaimableBit =
        purgeState == VM_PURGABLE_VOLATILE ? VM_PAGE_QUERY_PAGE_PRESENT : VM_PAGE_QUERY_PAGE_REUSABLE;
    if (disposition & reclaimableBit) return HTPageKind::Reclaimable;
    if (disposition & VM_PAGE_QUERY_PAGE_PRESENT) return HTPageKind::Clean;
    return HTPageKind::None;
}

// A 64-bit mix of two values, for identities derived from another.
uint64_t mixIdentity(uint64_t id, uint64_t salt) { return htMix(id ^ (salt * 0x9e3779b97f4a7c15ULL)); }

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

// The ledger template, read once per run by whichever process asks first.
struct LedgerTemplate {
    bool read = false;
    bool known = false;
    int entryCount = 0;
    std::optional<size_t> pageTableIndex;
};
std::mutex ledgerTemplateLock;
LedgerTemplate ledgerTemplateState;

LedgerTemplate ledgerTemplate(HTPlatform& platform)
{
    std::lock_guard<std::mutex> guard(ledgerTemplateLock);
    if (ledgerTemplateState.read) return ledgerTemplateState;
    ledgerTemplateState = LedgerTemplate{};
    ledgerTemplateState.read = true;

    int room = 80;
    std::vector<ledger_template_info> entries;
    int count = 0;
    while (true) {
        entries.assign(static_cast<size_t>(room), ledger_template_info{});
        count = room;
        if (platform.ledger_template(entries.data(), &count) < 0) {
            std::perror("Unable to retrieve ledger template info");
            return ledgerTemplateState;
        }
        // A full array may have left entries out.
        if (count < room) break;
        room *= 2;
    }
    ledgerTemplateState.known = true;
    ledgerTemplateState.entryCount = count;
    for (int i = 0; i < count; ++i) {
        const char* name = entries[static_cast<size_t>(i)].lti_name;
        if (std::string_view(name, strnlen(name, sizeof(entries[0].lti_name))) == "page_table") {
            ledgerTemplateState.pageTableIndex = static_cast<size_t>(i);
            break;
        }
    }
    return ledgerTemplateState;
}

}  // namespace

// --- owned VM objects ------------------------------------------------------------

uint64_t HTOwnedVmObject::ownedDirtySize() const
{
    if (flags & 0x1) return 0;
    switch ((flags >> 4) & 0x3) {
    case VM_PURGABLE_VOLATILE:
    case VM_PURGABLE_EMPTY:
        return wired_size;
    default:
        return resident_size > reusable_size ? resident_size - reusable_size : 0;
    }
}

uint64_t HTOwnedVmObject::ownedSwappedSize() const
{
    if (flags & 0x1) return 0;
    switch ((flags >> 4) & 0x3) {
    case VM_PURGABLE_VOLATILE:
    case VM_PURGABLE_EMPTY:
        return 0;
    default:
        return compressed_size;
    }
}

void HTOwnedVmObjectMap::set(const HTOwnedVmObject& object)
{
    auto found = index_.find(object.object_id);
    if (found != index_.end()) {
        entries_[found->second] = object;
        return;
    }
    index_.emplace(object.object_id, entries_.size());
    entries_.emplace_back(object);
}

std::optional<HTOwnedVmObject> HTOwnedVmObjectMap::take(uint64_t objectId)
{
    auto found = index_.find(objectId);
    if (found == index_.end()) return std::nullopt;
    std::optional<HTOwnedVmObject> taken;
    taken.swap(entries_[found->second]);
    index_.erase(found);
    return taken;
}

void HTOwnedVmObjectMap::forEach(const std::function<void(const HTOwnedVmObject&)>& visit) const
{
    for (const auto& entry : entries_)
        if (entry) visit(*entry);
}

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
    sharedRegionAlignmentSize_ = 4096;
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

void HTUserProcess::_forgetLedgerTemplate()
{
    std::lock_guard<std::mutex> guard(ledgerTemplateLock);
    ledgerTemplateState = LedgerTemplate{};
}

void HTUserProcess::_forgetOutOfDescriptors() { outOfDescriptorsSaid = false; }

void HTUserProcess::_gatherLedgers()
{
    if (!breakDownPhysHeft() || !_isAlive()) return;
    LedgerTemplate layout = ledgerTemplate(platform());
    if (!layout.known || !layout.pageTableIndex) return;

    std::vector<ledger_entry_info> entries(static_cast<size_t>(layout.entryCount));
    int count = layout.entryCount;
    if (platform().ledger_entries(pid(), entries.data(), &count) < 0) {
        _addErrnoWarningWithDescription("Unable to retrieve ledger entry info");
        return;
    }
    HT_ASSERT(kModule, count >= 0 && *layout.pageTableIndex < static_cast<size_t>(count),
              "page_table ledger index < entry count");
    int64_t balance = entries[*layout.pageTableIndex].lei_balance;
    ledgers_[0] = balance < 0 ? 0 : static_cast<uint64_t>(balance);
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
    const int32_t target = task_ ? task_->pid() : pid();

    size_t length = 0;
    if (platform().sysctlbyname(kOwnedVmObjectsSetting, nullptr, &length, &target, sizeof(target)) != 0) {
        // A kernel without the facility: the process owns nothing to report.
        if (errno != ENOENT) _addErrnoWarningWithDescription(kOwnedVmObjectsSetting);
        return std::nullopt;
    }
    HTOwnedVmObjectMap objects;
    if (length == 0) return objects;

    // Objects may appear between two asks: ask again while the answer
    // fills the buffer to the last byte.
    std::vector<unsigned char> buffer;
    size_t answered = 0;
    do {
        length += kOwnedVmObjectsHeadroom;
        buffer.resize(length);
        answered = length;
        if (platform().sysctlbyname(kOwnedVmObjectsSetting, buffer.data(), &answered, &target, sizeof(target)) != 0) {
            _addErrnoWarningWithDescription(kOwnedVmObjectsSetting);
            return std::nullopt;
        }
    } while (answered == length);

    if (answered == 0) return objects;
    HT_ASSERT(kModule, answered >= sizeof(uint64_t), "owned object list holds its count");
    uint64_t count = 0;
    std::memcpy(&count, buffer.data(), sizeof(count));
    HT_ASSERT(kModule, count <= (answered - sizeof(uint64_t)) / sizeof(HTOwnedVmObject),
              "owned object list holds count records");
    for (uint64_t i = 0; i < count; ++i) {
        HTOwnedVmObject object;
        std::memcpy(&object, buffer.data() + sizeof(uint64_t) + i * sizeof(HTOwnedVmObject), sizeof(object));
        objects.set(object);
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

// --- shared-cache pieces -----------------------------------------------------------

bool HTUserProcess::_addRegionsToArray(std::vector<std::shared_ptr<HTMemoryRegion>>& regions, uint64_t start,
                                       uint64_t size, const vm_region_submap_info_64& info,
                                       HTImageEnumerator& enumerator)
{
    pendingUnusedSharedRegion_.reset();
    const uint64_t alignment = sharedRegionAlignmentSize_;
    const uint64_t page = pageSize();
    const bool writable = (info.max_protection & VM_PROT_WRITE) != 0;
    const uint64_t end = start + size;

    auto makePiece = [&](uint64_t from, uint64_t to) {
        auto piece = std::make_shared<HTMemoryRegion>();
        piece->setStart(from);
        piece->setSize(to - from);
        piece->setUser_tag(info.user_tag);
        piece->setObject_id(info.object_id_full);
        piece->setShare_mode(info.share_mode);
        piece->setOffset(info.offset + (from - start));
        piece->setInSharedCache(true);
        piece->setWired(info.user_wired_count != 0);
        return piece;
    };

    std::shared_ptr<HTImage> image = enumerator.nextImageForStart(start, end);
    uint64_t cursor = start;
    while (cursor < end) {
        if (!image || cursor < image->start()) {
            const uint64_t to = image ? std::min(image->start(), end) : end;
            auto piece = makePiece(cursor, to);
            piece->setName("unused rtld shared cache area");
            piece->setUnusedSharedCacheRegion(true);
            // Only a piece that shares a page with its neighbour needs
            // measuring; the rest of an unused area holds nothing.
            if (writable && (cursor % page != 0 || to % page != 0) &&
                !_populateMemoryRegionWithPageQueries(piece, info))
                return false;
            regions.push_back(piece);
            cursor = to;
            if (cursor >= end || !image) return true;
        }

        const uint64_t pieceStart = std::max(cursor, image->start());
        uint64_t pieceEnd = std::min(image->end(), end);
        std::shared_ptr<HTImage> next = enumerator.nextImageForStart(pieceEnd, end);
        if (pieceEnd <= pieceStart) {
            // An empty segment holds nothing; one the enumerator keeps
            // answering would hold the walk here for good.
            if (next == image) return true;
            image = next;
            continue;
        }
        const uint64_t nextStart = next ? next->start() : 0;
        // Segments laid out on alignment boundaries own the padding up to
        // the next boundary.
        if (next != image && pieceStart % alignment == 0 && nextStart % alignment == 0)
            pieceEnd = roundUp(pieceEnd, alignment);

        auto piece = makePiece(pieceStart, pieceEnd);
        piece->setName(image->name());
        piece->setDetailedName(image->segment() == HTSegmentLinkEdit ? std::string("rtld shared cache")
                                                                     : image->ownerPath());
        piece->setSegment(image->segment());
        if (writable && !_populateMemoryRegionWithPageQueries(piece, info)) return false;
        regions.push_back(piece);
        cursor = pieceEnd;
        image = next;
    }
    return true;
}

// --- page dispositions -------------------------------------------------------------

bool HTUserProcess::_enumerateDispositionChunksWithStartAddr(uint64_t start, uint64_t pages, bool populatedOnly,
                                                             const DispositionChunkCallback& block)
{
    if (pages == 0) return true;
    HT_ASSERT(kModule, task_ != nullptr, "task");
    const uint64_t page = pageSize();
    const uint64_t end = start + pages * page;
    thread_local std::vector<HTPageRun> runs;
    if (populatedOnly)
        platform().populatedRuns(*task_, start, end, runs);
    else
        runs.assign(1, HTPageRun{start, end, 0});

    int32_t dispositions[kDispositionChunkPages];
    for (const HTPageRun& run : runs) {
        const uint64_t from = std::max(start, roundDown(run.start, page));
        const uint64_t to = std::min(end, roundUp(run.end, page));
        if (run.disposition != 0 && from < to) {
            block(nullptr, run.disposition, (to - from) / page, (from - start) / page);
            continue;
        }
        for (uint64_t address = from; address < to; address += kDispositionChunkPages * page) {
            const uint64_t wanted = std::min((to - address) / page, kDispositionChunkPages);
            uint64_t count = wanted;
            kern_return_t result =
                platform().mach_vm_page_range_query(*task_, address, wanted * page, dispositions, &count);
            if (result != KERN_SUCCESS) {
                const HTCallFailure failure = _processMachVMError(result, KERN_INVALID_ARGUMENT);
                if (!_saidOutOfDescriptors(errnoOf(result)))
                    _addFailureNotice(failure,
                                      "%s: its pages could not be read (" + platform().mach_error_string(result) +
                                          "); data may be incomplete");
                return false;
            }
            block(dispositions, 0, std::min(count, wanted), (address - start) / page);
        }
    }
    return true;
}

bool HTUserProcess::_populateMemoryRegionWithPageQueries(const std::shared_ptr<HTMemoryRegion>& region,
                                                         const vm_region_submap_info_64& info)
{
    HTMemoryRegion& piece = *region;
    HT_ASSERT(kModule, piece.dirtySize() == 0, "memoryRegion.dirtySize == 0");
    HT_ASSERT(kModule, piece.swappedSize() == 0, "memoryRegion.swappedSize == 0");
    const uint64_t page = pageSize();
    const uint64_t start = piece.start();
    const uint64_t end = piece.end();
    const uint64_t size = piece.size();
    const uint64_t alignedStart = roundDown(start, page);
    const uint64_t alignedEnd = roundUp(end, page);
    // The piece's bytes in its first page.
    const uint64_t firstPageBytes = std::min(page - (start - alignedStart), size);

    uint64_t dirty = 0;
    uint64_t swapped = 0;
    auto count = [&](int32_t disposition, uint64_t amount) {
        if (countsAsDirty(disposition))
            dirty += amount;
        else if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT)
            swapped += amount;
    };

    uint64_t pages = (alignedEnd - alignedStart) / page;
    uint64_t queryStart = alignedStart;
    // The first page is the last page of the piece before, already queried.
    const bool firstPageCached = alignedStart == cachedDispositionAddress_;
    if (firstPageCached) {
        count(cachedDisposition_, firstPageBytes);
        --pages;
        queryStart += page;
    }

    if (piece.unusedSharedCacheRegion()) {
        // Unused areas are not queried: only their partial pages, shared
        // with a neighbour, hold anything, and the neighbour's query
        // measures them.
        if (firstPageCached) {
            piece.setDirtySize(dirty);
            piece.setSwappedSize(swapped);
        } else if (start % page != 0) {
            HT_FATAL(kModule, "Unused shared cache region has no cache entry for non-page-aligned start address");
        }
        if (end % page != 0 && pages != 0) pendingUnusedSharedRegion_ = region;
        return true;
    }

    const bool ok = _enumerateDispositionChunksWithStartAddr(
        queryStart, pages, false, [&](const int32_t* dispositions, int32_t, uint64_t filled, uint64_t firstPage) {
            for (uint64_t i = 0; i < filled; ++i) {
                const uint64_t index = firstPage + i;
                const int32_t disposition = dispositions[i];
                const bool partialFirst = index == 0 && !firstPageCached && start % page != 0;
                const bool partialLast = index == pages - 1 && end % page != 0;
                uint64_t amount = page;
                if (partialFirst) {
                    amount = firstPageBytes;
                } else if (partialLast) {
                    amount = end - (alignedEnd - page);
                    HT_ASSERT(kModule, amount <= size, "lastPageBytes <= memoryRegion.size");
                }
                count(disposition, amount);

                if (partialFirst && pendingUnusedSharedRegion_) {
                    // The unused piece before this one ends in this page.
                    HTMemoryRegion& pending = *pendingUnusedSharedRegion_;
                    HT_ASSERT(kModule, pending.end() == start, "pendingUnusedSharedRegion.end == memoryRegion.start");
                    const uint64_t pendingBytes = pending.end() - roundUp(pending.end(), page) + page;
                    HT_ASSERT(kModule, pendingBytes <= pending.size(),
                              "pendingBytes <= pendingUnusedSharedRegion.size");
                    if (countsAsDirty(disposition))
                        pending.setDirtySize(pending.dirtySize() + pendingBytes);
                    else if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT)
                        pending.setSwappedSize(pending.swappedSize() + pendingBytes);
                    pendingUnusedSharedRegion_.reset();
                }
                if (partialLast) {
                    // The next piece starts in this page.
                    cachedDispositionAddress_ = alignedEnd - page;
                    cachedDisposition_ = disposition;
                }
            }
        });
    piece.setSwappedSize(swapped);
    piece.setDirtySize(dirty);
    return ok;
}

void HTUserProcess::_addSubrangesForRegion(HTMemoryRegion& region, int32_t purgeState)
{
    HT_ASSERT(kModule, !region.ownedExclusivelyByParentProcess(), "!memoryRegion.ownedExclusivelyByParentProcess");
    _walkPagesOfRegion(region, PageTargets{&region, nullptr, false}, purgeState);
}

void HTUserProcess::_walkPagesOfRegion(const HTMemoryRegion& region, const PageTargets& targets, int32_t purgeState)
{
    const uint64_t page = pageSize();
    const uint64_t from = roundDown(region.start(), page);
    const uint64_t pages = (roundUp(region.end(), page) - from) / page;
    HTSharedPageList* list = targets.identify && targets.pages ? &targets.pages->makeSharedPageList() : nullptr;
    HTSubrangeBuilder runs(list ? nullptr : targets.pages, page);
    HTSubrangeBuilder fileRuns(targets.filePages, page);
    const bool separateCopies = targets.filePages != nullptr || targets.copiesOnly;
    uint64_t identities[kDispositionChunkPages];
    // A run of pages of one disposition, which the kernel knows to hold no
    // page another process maps privately.
    auto addUniformRun = [&](uint64_t first, uint64_t count, int32_t disposition) {
        const HTPageKind kind = pageKind(disposition, purgeState);
        if (kind == HTPageKind::None) return;
        if (separateCopies && (disposition & VM_PAGE_QUERY_PAGE_COPIED) == 0) {
            fileRuns.addRun(targets.filePages ? targets.filePages->offset() + first * page : 0, count * page, kind);
        } else if (list) {
            for (uint64_t index = first; index < first + count; ++index)
                list->addPage(static_cast<uint32_t>(index), kind, 0);
        } else {
            runs.addRun(targets.pages->offset() + first * page, count * page, kind);
        }
    };

    // A failed query is recorded on the process; the runs found so far stay.
    _enumerateDispositionChunksWithStartAddr(
        from, pages, true, [&](const int32_t* dispositions, int32_t uniform, uint64_t filled, uint64_t first) {
            if (dispositions == nullptr) {
                addUniformRun(first, filled, uniform);
                return;
            }
            const bool named = list &&
                platform().sharedPageIdentities(*task_, from + first * page, filled, identities) == KERN_SUCCESS;
            for (uint64_t i = 0; i < filled; ++i) {
                const HTPageKind kind = pageKind(dispositions[i], purgeState);
                if (kind == HTPageKind::None) continue;
                // In a private file mapping the file's own pages and the
                // mapping's copies belong to different objects.
                const uint64_t index = first + i;
                if (separateCopies && (dispositions[i] & VM_PAGE_QUERY_PAGE_COPIED) == 0) {
                    fileRuns.add(targets.filePages ? targets.filePages->offset() + index * page : 0, kind);
                } else if (list) {
                    list->addPage(static_cast<uint32_t>(index), kind, named ? identities[i] : 0);
                } else {
                    runs.add(targets.pages->offset() + index * page, kind);
                }
            }
        });
}

std::shared_ptr<HTMemoryRegion> HTUserProcess::_splitCopiedPages(HTMemoryRegion& region,
                                                                 const vm_region_submap_info_64& info)
{
    const uint64_t copied = pageSize() * info.pages_shared_now_private;
    const uint64_t swapped = region.swappedSize();
    if (copied == 0 && swapped == 0) return nullptr;

    auto copies = std::make_shared<HTMemoryRegion>();
    copies->setStart(region.start());
    copies->setSize(region.size());
    copies->setUser_tag(region.user_tag());
    copies->setShare_mode(region.share_mode());
    copies->setWired(region.wired());
    copies->setSegment(region.segment());
    copies->setName(region.name());
    copies->setDetailedName(region.detailedName());
    // Copies are anonymous memory of this mapping in this process; pages
    // still shared after a fork are told apart by their identities.
    const uint64_t id = mixIdentity(mixIdentity(region.object_id(), region.start()), static_cast<uint32_t>(pid()));
    copies->setObject_id((id & ~kIdentityNamespaceBits) | kAnonymousIdentityBit);

    // Every page swapped out is a copy (file pages go back to their file);
    // copies are dirty first, and at most what the mapping holds.
    const uint64_t dirty = std::min(copied, region.dirtySize());
    const uint64_t reclaimable = std::min(region.reclaimableSize(), copied - dirty);
    const uint64_t clean = std::min(region.cleanNonSpecSize(), copied - dirty - reclaimable);
    copies->setDirtySize(dirty);
    copies->setReclaimableSize(reclaimable);
    copies->setCleanNonSpecSize(clean);
    copies->setSwappedSize(swapped);
    region.setDirtySize(region.dirtySize() - dirty);
    region.setReclaimableSize(region.reclaimableSize() - reclaimable);
    region.setCleanNonSpecSize(region.cleanNonSpecSize() - clean);
    region.setSwappedSize(0);
    return copies;
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
    const bool identify = mayShare && platform().canIdentifySharedPages();
    if (mayShare && !identify) sharedPagesUnidentified_ = true;

    if (copies == nullptr && !identify) {
        if (subranges && region.eligibleForSubrangesUsingPageSize(page)) _addSubrangesForRegion(region, purgeState);
        return;
    }
    HTMemoryRegion& pages = copies ? *copies : region;
    PageTargets targets;
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
    }
    _gatherMemoryData();
    images_.clear();
    images_.shrink_to_fit();
}

void HTUserProcess::_gatherMemoryData()
{
    const uint64_t page = pageSize();
    HTImageEnumerator enumerator(images_);
    std::vector<std::shared_ptr<HTMemoryRegion>> regions;
    const bool hidden = hiddenFromDisplay();
    const bool breakDown = breakDownPhysHeft();
    const bool linux = _platformCode() == HTPlatformLinux;
    std::shared_ptr<HTMemoryRegion> fakeRegion;
    uint64_t ownedTotal = 0;

    enumerateRegions([&](uint64_t start, uint64_t size, const vm_region_submap_info_64& info, int32_t purgeState,
                         const std::optional<std::string>& path) -> bool {
        if (start >= sharedRegionBase_ && start - sharedRegionBase_ < sharedRegionSize_) {
            if (hidden) return false;
            if (!_addRegionsToArray(regions, start, size, info, enumerator)) {
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
                if (ownedVmObjects_) return false;
                fakeRegion = region;
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
            if (breakDown) {
                bool owned = false;
                uint64_t ownedDirty = 0;
                uint64_t ownedSwapped = 0;
                std::optional<HTOwnedVmObject> object;
                if (ownedVmObjects_ && (object = ownedVmObjects_->take(info.object_id_full))) {
                    owned = true;
                    ownedDirty = object->ownedDirtySize();
                    ownedSwapped = object->ownedSwappedSize();
                    region->setReclaimableSize(object->reusable_size);
                } else if (!ownedVmObjects_ && purgeState != VM_PURGABLE_DENY && info.user_tag != kIOKitTag &&
                           info.pages_resident != 0) {
                    // Without the owned-object list, purgeable memory is
                    // taken to belong to the process that maps it.
                    owned = true;
                    ownedDirty = region->dirtySize() + region->cleanNonSpecSize();
                }
                if (owned) {
                    region->setOwnedExclusivelyByParentProcess(true);
                    ownedTotal += ownedDirty + ownedSwapped;
                    region->setDirtySize(ownedDirty);
                    region->setCleanNonSpecSize(0);
                    region->setSwappedSize(ownedSwapped);
                }
            }
        }

        std::shared_ptr<HTMemoryRegion> copies;
        if (linux && info.external_pager != 0 && info.inheritance != VM_INHERIT_SHARE &&
            !region->ownedExclusivelyByParentProcess()) {
            // The file's pages of one image segment are an object of their
            // own, the same in every process that maps the image, so that
            // two segments of one file never pass for one.
            if (region->segment() == HTSegmentOther)
                region->setObject_id(mixIdentity(region->object_id(), region->offset()) | kFileIdentityBit);
            copies = _splitCopiedPages(*region, info);
            // The file's pages belong to the file, shared with every process
            // that maps it, dirty or not: only the copies are this
            // process's own.
            if (region->share_mode() == SM_COW) region->setShare_mode(SM_SHARED);
        }
        _measurePages(*region, copies.get(), info, purgeState);

        if (region != fakeRegion) regions.push_back(region);
        if (copies) regions.push_back(copies);
        return false;
    });

    // Owned objects that no region maps.
    if (ownedVmObjects_) {
        ownedVmObjects_->forEach([&](const HTOwnedVmObject& object) {
            auto region = std::make_shared<HTMemoryRegion>();
            region->setObject_id(object.object_id);
            region->setOwnedExclusivelyByParentProcess(true);
            region->setUser_tag(HTFakeRegionTag);
            region->setName(HTMemoryRegion::categoryNameForTag(HTFakeRegionTag));
            region->setSize(object.virtual_size);
            region->setReclaimableSize(object.reusable_size);
            region->setStart(HTNoAddress);
            region->setShare_mode(SM_SHARED);
            region->setDirtySize(object.ownedDirtySize());
            region->setSwappedSize(object.ownedSwappedSize());
            region->setWired(object.wired_size != 0);
            regions.push_back(region);
        });
        ownedVmObjects_.reset();
    }

    // The kernel's fake region counts all owned memory that is not mapped,
    // including what the regions above already charged; take that out.
    if (fakeRegion) {
        uint64_t remaining = ownedTotal;
        if (fakeRegion->dirtySize() < remaining) {
            remaining -= fakeRegion->dirtySize();
            fakeRegion->setDirtySize(0);
            if (fakeRegion->swappedSize() >= remaining) {
                fakeRegion->setSwappedSize(fakeRegion->swappedSize() - remaining);
            } else {
                remaining -= fakeRegion->swappedSize();
                char message[1024];
                std::snprintf(message, sizeof(message),
                              "%s: Heft changed while analyzing \u2013 unmapped owned physical heft may be "
                              "over-counted by %llu bytes",
                              displayString().c_str(), static_cast<unsigned long long>(remaining));
                warnings().push_back(message);
                fakeRegion->setSwappedSize(0);
            }
        } else {
            fakeRegion->setDirtySize(fakeRegion->dirtySize() - remaining);
        }
        if (fakeRegion->dirtySize() + fakeRegion->swappedSize() != 0) {
            fakeRegion->setStart(HTNoAddress);
            regions.push_back(fakeRegion);
        }
    }

    if (breakDown && ledgers_[0] != 0) {
        auto pageTables = std::make_shared<HTMemoryRegion>();
        pageTables->setName("page table");
        pageTables->setSize(ledgers_[0]);
        pageTables->setDirtySize(ledgers_[0]);
        pageTables->setStart(HTNoAddress);
        pageTables->setObject_id(0xFFFFFFFFFFFFFFFF);
        pageTables->setShare_mode(SM_PRIVATE);
        regions.push_back(pageTables);
    }

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
