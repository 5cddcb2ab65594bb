#include "model/HTMemoryRegion.h"

#include <array>
#include <cstdio>
#include <string_view>

namespace {

// Display names of VM tags below 256; null where the table has none.
using TagNameTable = std::array<const char*, 256>;

constexpr TagNameTable makeTagNameTable()
{
    TagNameTable table{};
    table[0] = "untagged (\"VM_ALLOCATE\")";
    table[1] = "malloc metadata";
    table[2] = "MALLOC_SMALL";
    table[3] = "MALLOC_LARGE";
    table[4] = "MALLOC_HUGE";
    table[5] = "sbrk";
    table[6] = "realloc";
    table[7] = "MALLOC_TINY";
    table[8] = "MALLOC_LARGE_REUSABLE";
    table[9] = "MALLOC_LARGE_REUSED";
    table[10] = "performance tool data";
    table[11] = "MALLOC_NANO";
    table[18] = "system/kernel diagnostics";
    table[20] = "Mach message";
    table[21] = "image decoding";
    table[30] = "stack";
    table[31] = "guard";
    table[32] = "shared pmap";
    table[33] = "dylib";
    table[34] = "graphics";
    table[35] = "unshared pmap";
    table[40] = "text layout";
    table[41] = "font rendering";
    table[42] = "font data";
    table[43] = "animation";
    table[44] = "Java";
    table[45] = "web engine";
    table[46] = "media";
    table[50] = "base library";
    table[51] = "system services";
    table[52] = "compositor";
    table[53] = "display server";
    table[54] = "GPU driver";
    table[55] = "color management";
    table[56] = "document rendering";
    table[57] = "accessibility";
    table[58] = "input methods";
    table[60] = "rtld private memory";
    table[61] = "rtld malloc memory";
    table[62] = "SQLite page cache";
    table[63] = "WebAssembly";
    table[64] = "JS JIT generated code";
    table[65] = "JS VM register file";
    table[66] = "OpenGL Shading Language";
    table[67] = "OpenCL";
    table[68] = "image processing";
    table[69] = "video processing";
    table[70] = "audio processing";
    table[71] = "speech";
    table[72] = "machine learning";
    table[73] = "networking";
    table[74] = "database";
    table[75] = "localization";
    table[76] = "scripting engine";
    table[77] = "layout engine";
    table[78] = "rendering pipeline";
    table[79] = "sensor data";
    table[80] = "corpse info";
    table[81] = "shader cache";
    table[82] = "texture memory";
    table[83] = "vector graphics";
    table[84] = "scene graph";
    table[86] = "search index";
    table[87] = "sandbox";
    table[88] = "security";
    table[89] = "telemetry";
    table[90] = "audio";
    table[91] = "video bitstream";
    table[92] = "camera";
    table[93] = "media decoding";
    table[94] = "media encoding";
    table[95] = "streaming";
    table[96] = "device sync";
    table[97] = "physics";
    table[98] = "runtime services";
    return table;
}

constexpr TagNameTable kTagNames = makeTagNameTable();

constexpr uint32_t kFirstAppSpecificTag = 240;
constexpr uint32_t kLastAppSpecificTag = 255;

// "app-specific tag 1" to "app-specific tag 16", built on first use. Several
// gathering threads may get here at once; a function-local static is
// initialised exactly once.
const std::string& appSpecificTagName(uint32_t tag)
{
    static const std::array<std::string, 16> names = [] {
        std::array<std::string, 16> built;
        for (uint32_t i = 0; i < built.size(); ++i) built[i] = "app-specific tag " + std::to_string(i + 1);
        return built;
    }();
    return names[tag - kFirstAppSpecificTag];
}

}  // namespace

HTMemoryRegion::HTMemoryRegion() = default;
HTMemoryRegion::~HTMemoryRegion() = default;

std::optional<std::string> HTMemoryRegion::fullName() const
{
    if (!detailedName_ || detailedName_->empty()) return name_;
    return name_.value_or("") + " " + *detailedName_;
}

int HTMemoryRegion::compare(const HTMemoryRegion& other) const
{
    if (start_ != other.start_) return start_ < other.start_ ? -1 : 1;
    if (size_ != other.size_) return size_ > other.size_ ? -1 : 1;
    return 0;
}

void HTMemoryRegion::addSubrange(uint64_t location, uint64_t length, const HTMemoryTotals& memoryTotal,
                                 uint64_t pageSize)
{
    if (!subrangeList_) subrangeList_ = std::make_unique<HTRangeList>();
    subrangeList_->addRange(location, length, pageSize, memoryTotal);
}

HTSharedPageList& HTMemoryRegion::makeSharedPageList()
{
    if (!sharedPageList_) sharedPageList_ = std::make_unique<HTSharedPageList>();
    return *sharedPageList_;
}

bool HTMemoryRegion::eligibleForProcessView() const
{
    if (isFake() || inSharedCache()) return false;
    if (share_mode_ == SM_PRIVATE || share_mode_ == SM_EMPTY || share_mode_ == SM_PRIVATE_ALIASED) return false;
    return segment_ != HTSegmentText && segment_ != HTSegmentOther && segment_ != HTSegmentLinkEdit;
}

bool HTMemoryRegion::eligibleForSubrangesUsingPageSize(uint64_t pageSize) const
{
    if (!eligibleForProcessView() || size_ <= pageSize || ownedExclusivelyByParentProcess()) return false;
    const uint64_t sizes[] = {dirtySize_, swappedSize_, cleanNonSpecSize_, reclaimableSize_};
    bool anyNonZero = false;
    for (uint64_t value : sizes) {
        if (value == size_) return false;
        anyNonZero = anyNonZero || value != 0;
    }
    return anyNonZero;
}

std::optional<std::string> HTMemoryRegion::describeRegionType(uint32_t tag)
{
    switch (tag) {
    case HT_VM_TAG_SHARED_MEMORY:
        return "shared memory";
    case HT_VM_TAG_KERNEL_PROVIDED:
        return "kernel-provided (vdso/vvar)";
    case HT_VM_TAG_NAMED_ANONYMOUS:
        return "named anonymous";
    default:
        return std::nullopt;
    }
}

std::string HTMemoryRegion::categoryNameForTag(uint32_t tag)
{
    if (tag >= kFirstAppSpecificTag && tag <= kLastAppSpecificTag) return appSpecificTagName(tag);
    if (tag < kTagNames.size()) {
        if (kTagNames[tag]) return kTagNames[tag];
        std::optional<std::string> described = describeRegionType(tag);
        if (described && !std::string_view(*described).starts_with("Memory Tag")) return *described;
    }
    if (tag == HTFakeRegionTag) return "Owned physical heft (unmapped)";

    char text[32];
    int length = std::snprintf(text, sizeof(text), "tag %d", static_cast<int32_t>(tag));
    if (length < 0 || static_cast<size_t>(length) >= sizeof(text)) return "unknown";
    return text;
}
