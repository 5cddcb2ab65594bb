#include "process/HTImage.h"
#include "process/HTImageEnumerator.h"
#include "process/HTStringTable.h"

#include "model/HTMemoryRegion.h"
#include "platform/HTPlatform.h"

#include <gtest/gtest.h>

#include <map>
#include <set>
#include <thread>

namespace {

std::shared_ptr<HTImage> makeImage(uint64_t start, uint64_t size, const std::string& name = "__TEXT")
{
    auto image = std::make_shared<HTImage>();
    image->setStart(start);
    image->setSize(size);
    image->setName(name);
    return image;
}

// Answers the image listing from a script; everything else is unused.
class HTImageListPlatform : public HTPlatform {
public:
    std::vector<HTPlatformImage> images;
    std::map<std::string, std::string> resolved;
    uint32_t flagsSeen = 0;

    bool forEachTaskImage(HTTaskPort&, uint32_t flags,
                          const std::function<void(const HTPlatformImage&)>& callback) override
    {
        flagsSeen = flags;
        for (const auto& image : images) callback(image);
        return true;
    }
    std::optional<std::string> realpath(const std::string& path) override
    {
        auto found = resolved.find(path);
        if (found == resolved.end()) return std::nullopt;
        return found->second;
    }

    int proc_listallpids(int32_t*, int) override { return 0; }
    int proc_pidinfo(int32_t, int, uint64_t, void*, int) override { return 0; }
    int proc_get_dirty(int32_t, uint32_t*) override { return ENOTSUP; }
    int sysctl(const int*, unsigned, void*, size_t*, const void*, size_t) override { return unsupported(); }
    int sysctlbyname(const char*, void*, size_t*, const void*, size_t) override { return unsupported(); }
    uint64_t vm_kernel_page_size() override { return 4096; }
    kern_return_t task_for_pid(int32_t, std::shared_ptr<HTTaskPort>*) override { return KERN_FAILURE; }
    std::string mach_error_string(kern_return_t) override { return {}; }
    void mach_error(const char*, kern_return_t) override {}
    int32_t getpid() override { return 1; }
    uint32_t geteuid() override { return 0; }
    bool isatty(int) override { return false; }
    bool stat(const char*) override { return false; }
};

class HTImageTestTask : public HTTaskPort {
public:
    int32_t pid() const override { return 42; }
};

HTPlatformImage platformImage(const std::string& path, uint64_t base,
                              std::vector<HTPlatformImageSegment> segments)
{
    HTPlatformImage image;
    image.path = path;
    image.baseAddress = base;
    image.segments = std::move(segments);
    return image;
}

}  // namespace

TEST(HTImage, SettingTheNameSetsTheSegmentCode)
{
    HTImage image;
    image.setName("__TEXT_EXEC");
    EXPECT_EQ(image.segment(), HTSegmentText);
    image.setName("__LINKEDIT");
    EXPECT_EQ(image.segment(), HTSegmentLinkEdit);
    image.setName("__DATA_CONST");
    EXPECT_EQ(image.segment(), HTSegmentOther);
    // A name outside the families leaves the code as it was.
    image.setName("MACH_HEADER");
    EXPECT_EQ(image.segment(), HTSegmentOther);
    EXPECT_EQ(image.name(), "MACH_HEADER");

    HTImage plain;
    plain.setName("data");
    EXPECT_EQ(plain.segment(), HTSegmentNotSet);
}

TEST(HTImageEnumerator, MovesForwardThroughOverlappingImages)
{
    std::vector<std::shared_ptr<HTImage>> images = {makeImage(0x1000, 0x1000), makeImage(0x2000, 0x1000),
                                                    makeImage(0x5000, 0x4000)};
    HTImageEnumerator enumerator(images);
    EXPECT_EQ(enumerator.nextImageForStart(0x1800, 0x1900), images[0]);
    EXPECT_EQ(enumerator.nextImageForStart(0x2000, 0x2800), images[1]);
    // The first image has been passed for good.
    EXPECT_EQ(enumerator.nextImageForStart(0x1800, 0x1900), nullptr);
    // Ends exactly where the next image starts: none, cursor kept.
    EXPECT_EQ(enumerator.nextImageForStart(0x4000, 0x5000), nullptr);
    EXPECT_EQ(enumerator.index(), 2u);
    // Holding the image's start, inside it, holding its end: answered for each.
    EXPECT_EQ(enumerator.nextImageForStart(0x4000, 0x6000), images[2]);
    EXPECT_EQ(enumerator.nextImageForStart(0x6000, 0x7000), images[2]);
    EXPECT_EQ(enumerator.nextImageForStart(0x8000, 0xA000), images[2]);
    // An image inside a larger region; images appended later are seen.
    images.push_back(makeImage(0xB000, 0x1000));
    EXPECT_EQ(enumerator.nextImageForStart(0xA000, 0xD000), images[3]);
    EXPECT_EQ(enumerator.nextImageForStart(0xD000, 0xE000), nullptr);
    EXPECT_EQ(enumerator.index(), 4u);
}

TEST(HTStringTable, ProbesClaimsAndFallsBackWhenFull)
{
    HTStringTable table(HTStringTable::PathSlotCount);
    uint64_t base = 0x7fff12345000;
    size_t first = HTStringTable::pathSlotForAddress(base);
    uint64_t b = base;
    EXPECT_EQ(first, (b ^ (b >> 8) ^ (b >> 16) ^ (b >> 24)) % 2047);

    const std::string* path = table.internPath("/usr/lib/libA.so", base);
    ASSERT_NE(path, nullptr);
    EXPECT_EQ(*path, "/usr/lib/libA.so");
    EXPECT_EQ(table.internPath("/usr/lib/libA.so", base), path);
    // Same slot, another path: the next slot.
    const std::string* other = table.internPath("/usr/lib/libB.so", base);
    ASSERT_NE(other, nullptr);
    EXPECT_NE(other, path);

    // Probing wraps at the end of the table; once all probed slots hold
    // other strings there is no shared string.
    size_t last = HTStringTable::PathSlotCount - 1;
    for (size_t i = 0; i < HTStringTable::PathProbeCount; i++) {
        ASSERT_NE(table.intern("filler" + std::to_string(i), last + i, 1), nullptr);
    }
    EXPECT_EQ(table.intern("filler17", last, HTStringTable::PathProbeCount),
              table.intern("filler17", (last + 17) % HTStringTable::PathSlotCount, 1));
    EXPECT_EQ(table.intern("/usr/lib/libC.so", last, HTStringTable::PathProbeCount), nullptr);

    HTStringTable names(HTStringTable::SegmentNameSlotCount);
    for (int i = 0; i < 16; i++) ASSERT_NE(names.internSegmentName("__SEG" + std::to_string(i)), nullptr);
    EXPECT_EQ(names.internSegmentName("__SEG16"), nullptr);
    EXPECT_EQ(*names.internSegmentName("__SEG3"), "__SEG3");
}

TEST(HTStringTable, ThreadsRacingForSlotsShareOneStringEach)
{
    HTStringTable table(HTStringTable::SegmentNameSlotCount);
    const std::vector<std::string> values = {"__TEXT", "__DATA", "__DATA_CONST", "__LINKEDIT", "__OBJC"};
    std::vector<std::vector<const std::string*>> seen(4);
    std::vector<std::thread> threads;
    for (size_t t = 0; t < seen.size(); t++) {
        threads.emplace_back([&, t] {
            for (int round = 0; round < 50; round++) {
                for (size_t i = 0; i < values.size(); i++) {
                    seen[t].push_back(table.internSegmentName(values[(i + t) % values.size()]));
                }
            }
        });
    }
    for (auto& thread : threads) thread.join();
    std::map<std::string, std::set<const std::string*>> byValue;
    for (const auto& pointers : seen) {
        for (const std::string* pointer : pointers) {
            ASSERT_NE(pointer, nullptr);
            byValue[*pointer].insert(pointer);
        }
    }
    ASSERT_EQ(byValue.size(), values.size());
    for (const auto& [value, pointers] : byValue) EXPECT_EQ(pointers.size(), 1u) << value;
}

TEST(HTImage, GatherImagesNamesSegmentsAndResolvesPaths)
{
    const uint64_t sharedBase = 0x180000000;
    const uint64_t sharedSize = 0x40000000;
    HTImageListPlatform platform;
    platform.resolved["/lib/link.so"] = "/lib/real.so";
    platform.images = {
        platformImage("/lib/link.so", 0x7f0000000000,
                      {{"__DATA", 0x7f0000004000, 0x1000}, {"MACH_HEADER", 0x7f0000000000, 0x1000},
                       {"__TEXT", 0x7f0000001000, 0x3000}}),
        platformImage("/gone/lib.so", 0x10000, {{"", 0x10000, 0x1000}, {"text segment", 0x11000, 0x1000}}),
        platformImage("/usr/lib/shared/libshared.so", sharedBase + 0x4000,
                      {{"__DATA_CONST", sharedBase + 0x8000, 0x1000}, {"__LINKEDIT", sharedBase + 0x4000, 0x2000}}),
    };
    HTImageTestTask task;
    auto images = HTImage::gatherImages(platform, task, sharedBase, sharedSize);
    EXPECT_EQ(platform.flagsSeen & 0x20101002u, 0x20101002u);

    ASSERT_EQ(images.size(), 7u);
    for (size_t i = 1; i < images.size(); i++) EXPECT_LE(images[i - 1]->start(), images[i]->start());

    // Unresolvable path kept as given; names up to the first blank, and
    // "unknown" for none.
    EXPECT_EQ(images[0]->start(), 0x10000u);
    EXPECT_EQ(images[0]->name(), "unknown");
    EXPECT_EQ(images[0]->segment(), HTSegmentNotSet);
    EXPECT_EQ(images[0]->ownerPath(), "/gone/lib.so");
    EXPECT_EQ(images[1]->name(), "text");

    EXPECT_EQ(images[2]->name(), "__LINKEDIT");
    EXPECT_EQ(images[2]->segment(), HTSegmentLinkEdit);
    EXPECT_EQ(images[2]->ownerPath(), "/usr/lib/shared/libshared.so");
    EXPECT_EQ(images[3]->name(), "__DATA_CONST");
    EXPECT_EQ(images[3]->segment(), HTSegmentOther);
    EXPECT_EQ(images[3]->size(), 0x1000u);

    EXPECT_EQ(images[4]->start(), 0x7f0000000000u);
    EXPECT_EQ(images[4]->name(), "__TEXT");
    EXPECT_EQ(images[4]->segment(), HTSegmentText);
    EXPECT_EQ(images[4]->ownerPath(), "/lib/real.so");
    EXPECT_EQ(images[6]->name(), "__DATA");

    // Segment names, and paths in the shared region, are one string for
    // the whole run.
    EXPECT_EQ(&images[4]->name(), &images[5]->name());
    auto again = HTImage::gatherImages(platform, task, sharedBase, sharedSize);
    ASSERT_EQ(again.size(), 7u);
    EXPECT_EQ(&again[2]->ownerPath(), &images[2]->ownerPath());
    EXPECT_EQ(&again[3]->name(), &images[3]->name());
    EXPECT_NE(&again[4]->ownerPath(), &images[4]->ownerPath());
}

TEST(HTImage, GatherImagesKeepsTheRightPathWhenThePathTableIsCrowded)
{
    const uint64_t sharedBase = 0x300000000;
    const uint64_t base = sharedBase + 0x123000;
    size_t first = HTStringTable::pathSlotForAddress(base);
    for (size_t i = 0; i < HTStringTable::PathProbeCount; i++) {
        HTStringTable::pathTable().intern("/crowded/other" + std::to_string(i), first + i, 1);
    }
    HTImageListPlatform platform;
    platform.images = {platformImage("/crowded/mine.so", base, {{"MACH_HEADER", base, 0x1000}})};
    HTImageTestTask task;
    auto images = HTImage::gatherImages(platform, task, sharedBase, 0x10000000);
    ASSERT_EQ(images.size(), 1u);
    EXPECT_EQ(images[0]->ownerPath(), "/crowded/mine.so");
    EXPECT_EQ(images[0]->name(), "__TEXT");
    EXPECT_EQ(images[0]->segment(), HTSegmentText);
}
