#include "process/HTImage.h"

#include "model/HTMemoryRegion.h"
#include "platform/HTPlatform.h"
#include "process/HTStringTable.h"

#include <algorithm>
#include <string_view>

namespace {

// The image service's option bits: image and segment layout, no symbols.
constexpr uint32_t kImageServiceFlagsWithoutSymbols = 0;
constexpr uint32_t kImageListFlags = kImageServiceFlagsWithoutSymbols | 0x20101002;

const std::string kEmptyString;

bool hasPrefix(const std::string& name, std::string_view prefix)
{
    return std::string_view(name).substr(0, prefix.size()) == prefix;
}

// The segment name an image's segment is recorded under, interned.
std::shared_ptr<const std::string> segmentName(const std::string& serviceName)
{
    std::string_view name = serviceName;
    if (name == "MACH_HEADER") {
        name = "__TEXT";
    } else {
        size_t blank = name.find_first_of(" \t");
        if (blank != std::string_view::npos) name = name.substr(0, blank);
    }
    if (name.empty()) name = "unknown";
    const std::string* interned = HTStringTable::segmentNameTable().internSegmentName(name);
    if (interned != nullptr) return HTImage::sharedString(interned);
    return std::make_shared<const std::string>(name);
}

}  // namespace

HTImage::HTImage()
    : segment_(HTSegmentNotSet), name_(sharedString(&kEmptyString)), ownerPath_(sharedString(&kEmptyString))
{
}

std::shared_ptr<const std::string> HTImage::sharedString(const std::string* interned)
{
    // Aliasing an empty owner: a pointer that owns nothing and allocates
    // no control block. The string outlives every image.
    return std::shared_ptr<const std::string>(std::shared_ptr<void>(), interned);
}

uint8_t HTImage::segmentForName(const std::string& name)
{
    if (hasPrefix(name, "__TEXT")) return HTSegmentText;
    if (hasPrefix(name, "__LINKEDIT")) return HTSegmentLinkEdit;
    if (hasPrefix(name, "__")) return HTSegmentOther;
    return HTSegmentNotSet;
}

void HTImage::setName(const std::string& value) { setName(std::make_shared<const std::string>(value)); }

void HTImage::setName(std::shared_ptr<const std::string> value)
{
    name_ = value ? std::move(value) : sharedString(&kEmptyString);
    uint8_t segment = segmentForName(*name_);
    if (segment != HTSegmentNotSet) segment_ = segment;
}

void HTImage::setOwnerPath(const std::string& value) { ownerPath_ = std::make_shared<const std::string>(value); }

void HTImage::setOwnerPath(std::shared_ptr<const std::string> value)
{
    ownerPath_ = value ? std::move(value) : sharedString(&kEmptyString);
}

std::vector<std::shared_ptr<HTImage>> HTImage::gatherImages(HTPlatform& platform, HTTaskPort& task,
                                                            uint64_t sharedRegionBase, uint64_t sharedRegionSize)
{
    std::vector<std::shared_ptr<HTImage>> images;
    platform.forEachTaskImage(task, kImageListFlags, [&](const HTPlatformImage& image) {
        std::shared_ptr<const std::string> ownerPath;
        bool inSharedRegion =
            image.baseAddress >= sharedRegionBase && image.baseAddress - sharedRegionBase < sharedRegionSize;
        if (inSharedRegion) {
            const std::string* interned = HTStringTable::pathTable().internPath(image.path, image.baseAddress);
            ownerPath = interned != nullptr ? sharedString(interned) : std::make_shared<const std::string>(image.path);
        } else {
            std::optional<std::string> resolved = platform.realpath(image.path);
            ownerPath = std::make_shared<const std::string>(resolved ? *std::move(resolved) : image.path);
        }
        // The image's segments share one owner-path string. An empty
        // segment holds no memory; kept, it would lie inside every region
        // that reaches its address, and the look-up would answer it for
        // each of them instead of the segment after it.
        for (const HTPlatformImageSegment& segment : image.segments) {
            if (segment.size == 0) continue;
            auto record = std::make_shared<HTImage>();
            record->setStart(segment.start);
            record->setSize(segment.size);
            record->setName(segmentName(segment.name));
            record->setOwnerPath(ownerPath);
            images.push_back(std::move(record));
        }
    });
    std::sort(images.begin(), images.end(), [](const std::shared_ptr<HTImage>& a, const std::shared_ptr<HTImage>& b) {
        return a->start() < b->start();
    });
    return images;
}
