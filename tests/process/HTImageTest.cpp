#include "process/HTImage.h"
#include "process/HTImageEnumerator.h"
#include "process/HTStringTable.h"

#include "model/HTMemoryRegion.h"
#include "platform/fake/HTFakePlatform.h"

#include <gtest/gtest.h>

#include <map>
#include <set>
#include <thread>
#include <tuple>

namespace {

std::shared_ptr<HTImage> makeImage(uint64_t start, uint64_t size, const std::string& name = "__TEXT")
{
    auto image = std::make_shared<HTImage>();
    image->setStart(start);
    image->setSize(size);
    image->setName(name);
    return image;
}

// The fake platform, recording the listing's flags and resolving only the
// paths it was given.
class HTImageListPlatform : public HTFakePlatform {
public:
    uint32_t flagsSeen = 0;

    bool forEachTaskImage(HTTaskPort& task, uint32_t flags,
                          const std::function<void(const HTPlatformImage&)>& callback) override
    {
        flagsSeen = flags;
        return HTFakePlatform::forEachTaskImage(task, flags, callback);
    }
    std::optional<std::string> realpath(const std::string& path) override
    {
        auto found = realpaths.find(path);
        if (found == realpaths.end()) return std::nullopt;
        return found->second;
    }

    // The task of a process listing `images`.
    std::shared_ptr<HTTaskPort> task(std::vector<HTPlatformImage> images)
    {
        addProcess(42, 1, "imaged").images = std::move(images);
        std::shared_ptr<HTTaskPort> port;
        EXPECT_EQ(task_for_pid(42, &port), KERN_SUCCESS);
        return port;
    }
};

}  // namespace

TEST(HTImage, SettingTheNameSetsTheSegmentCode)
{
    // Renamed in turn; a name outside the families leaves the code as it was.
    HTImage image;
    for (auto [name, segment] : {std::pair{"__TEXT_EXEC", HTSegmentText},
                                 {"__LINKEDIT", HTSegmentLinkEdit},
                                 {"__DATA_CONST", HTSegmentOther},
                                 {"MACH_HEADER", HTSegmentOther}}) {
        image.setName(name);
        EXPECT_EQ(image.segment(), segment) << name;
    }

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
    platform.realpaths["/lib/link.so"] = "/lib/real.so";
    auto task = platform.task({
        {"/lib/link.so",
         0x7f0000000000,
         {{"__DATA", 0x7f0000004000, 0x1000},
          {"MACH_HEADER", 0x7f0000000000, 0x1000},
          {"__TEXT", 0x7f0000001000, 0x3000}}},
        {"/gone/lib.so", 0x10000, {{"", 0x10000, 0x1000}, {"text segment", 0x11000, 0x1000}}},
        {"/usr/lib/shared/libshared.so",
         sharedBase + 0x4000,
         {{"__DATA_CONST", sharedBase + 0x8000, 0x1000}, {"__LINKEDIT", sharedBase + 0x4000, 0x2000}}},
    });
    auto images = HTImage::gatherImages(platform, *task, sharedBase, sharedSize);
    EXPECT_EQ(platform.flagsSeen & 0x20101002u, 0x20101002u);

    // In address order. An unresolvable path is kept as given; names run up
    // to the first blank, "unknown" for none; the header counts as text.
    using Row = std::tuple<uint64_t, uint64_t, std::string, int, std::string>;
    std::vector<Row> rows;
    for (const auto& image : images)
        rows.emplace_back(image->start(), image->size(), image->name(), image->segment(), image->ownerPath());
    EXPECT_EQ(rows,
              (std::vector<Row>{
                  {0x10000, 0x1000, "unknown", HTSegmentNotSet, "/gone/lib.so"},
                  {0x11000, 0x1000, "text", HTSegmentNotSet, "/gone/lib.so"},
                  {sharedBase + 0x4000, 0x2000, "__LINKEDIT", HTSegmentLinkEdit, "/usr/lib/shared/libshared.so"},
                  {sharedBase + 0x8000, 0x1000, "__DATA_CONST", HTSegmentOther, "/usr/lib/shared/libshared.so"},
                  {0x7f0000000000, 0x1000, "__TEXT", HTSegmentText, "/lib/real.so"},
                  {0x7f0000001000, 0x3000, "__TEXT", HTSegmentText, "/lib/real.so"},
                  {0x7f0000004000, 0x1000, "__DATA", HTSegmentOther, "/lib/real.so"},
              }));
    ASSERT_EQ(images.size(), 7u);

    // Segment names, and paths in the shared region, are one string for
    // the whole run.
    EXPECT_EQ(&images[4]->name(), &images[5]->name());
    auto again = HTImage::gatherImages(platform, *task, sharedBase, sharedSize);
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
    auto task = platform.task({{"/crowded/mine.so", base, {{"MACH_HEADER", base, 0x1000}}}});
    auto images = HTImage::gatherImages(platform, *task, sharedBase, 0x10000000);
    ASSERT_EQ(images.size(), 1u);
    EXPECT_EQ(images[0]->ownerPath(), "/crowded/mine.so");
    EXPECT_EQ(images[0]->name(), "__TEXT");
    EXPECT_EQ(images[0]->segment(), HTSegmentText);
}
