#pragma once

// One segment of one loaded image (executable or library) of a process:
// where it lies, its segment name and the path of the image file. The
// names and paths of images that many processes share point into the
// process-wide string tables; others are copies owned by the image.

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

class HTPlatform;
class HTTaskPort;

class HTImage {
public:
    HTImage();

    // The segment code a name gives (HTSegmentText, HTSegmentLinkEdit or
    // HTSegmentOther); HTSegmentNotSet for a name outside those families.
    static uint8_t segmentForName(const std::string& name);

    uint8_t segment() const { return segment_; }
    void setSegment(uint8_t value) { segment_ = value; }
    uint64_t start() const { return start_; }
    void setStart(uint64_t value) { start_ = value; }
    uint64_t size() const { return size_; }
    void setSize(uint64_t value) { size_ = value; }
    uint64_t end() const { return start_ + size_; }

    const std::string& name() const { return *name_; }
    // Copies the name. A name of the "__TEXT", "__LINKEDIT" or other "__"
    // family also sets the segment code; any other name leaves it.
    void setName(const std::string& value);
    // Takes a shared string (an interned one, or one the caller shares
    // between images); the segment code as above.
    void setName(std::shared_ptr<const std::string> value);

    const std::string& ownerPath() const { return *ownerPath_; }
    void setOwnerPath(const std::string& value);
    void setOwnerPath(std::shared_ptr<const std::string> value);

    // Every segment of every image of the task, sorted by start. Paths of
    // images inside [sharedRegionBase, sharedRegionBase + sharedRegionSize)
    // and all segment names come from the process-wide string tables;
    // other paths are resolved through symbolic links. Empty when the
    // platform cannot list the task's images.
    static std::vector<std::shared_ptr<HTImage>> gatherImages(HTPlatform& platform, HTTaskPort& task,
                                                              uint64_t sharedRegionBase, uint64_t sharedRegionSize);

    // A string of the run's string tables, shared without being owned.
    static std::shared_ptr<const std::string> sharedString(const std::string* interned);

private:
    uint8_t segment_;
    uint64_t start_ = 0;
    uint64_t size_ = 0;
    std::shared_ptr<const std::string> name_;
    std::shared_ptr<const std::string> ownerPath_;
};
