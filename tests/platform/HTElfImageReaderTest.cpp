#include "platform/linux/HTElfImageReader.h"
#include "platform/linux/HTLinuxPlatform.h"

#include <gtest/gtest.h>

#include <dlfcn.h>
#include <filesystem>
#include <fstream>
#include <gnu/libc-version.h>
#include <sstream>
#include <string>
#include <sys/mman.h>
#include <tuple>
#include <unistd.h>
#include <vector>

// A writable global and a table the loader makes read-only after
// relocation (pointers in a position-independent binary).
int gHTElfWritable = 7;
const char* const gHTElfRelocatedTable[] = {"relocated", "read-only"};

namespace {

constexpr uint64_t kPage = 4096;

using Layout = HTElfImageReader::Layout;

// The layout of a crafted file under data/elf; `poke` changes one byte first.
HTElfImageReader::ReadResult readLayout(const std::string& name, std::shared_ptr<const Layout>* layout, int poke = -1,
                                        int value = 0)
{
    std::ifstream file(HEFT_TEST_DATA_DIR "/elf/" + name, std::ios::binary);
    EXPECT_TRUE(file.is_open()) << name;
    std::string bytes((std::istreambuf_iterator<char>(file)), {});
    if (poke >= 0) bytes.at(static_cast<size_t>(poke)) = static_cast<char>(value);
    int fd = ::memfd_create("heft-elf-test", MFD_CLOEXEC);
    EXPECT_EQ(::write(fd, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    auto result = HTElfImageReader::readLayout(fd, kPage, layout);
    ::close(fd);
    return result;
}

const HTPlatformImage* imageWithPath(const std::vector<HTPlatformImage>& images, const std::string& path)
{
    std::error_code error;
    for (const auto& image : images)
        if (std::filesystem::equivalent(image.path, path, error)) return &image;
    return nullptr;
}

// The name of the image segment holding the address; empty when none.
std::string segmentAt(const HTPlatformImage& image, uint64_t address)
{
    for (const auto& segment : image.segments)
        if (segment.start <= address && address < segment.start + segment.size) return segment.name;
    return "";
}

}  // namespace

TEST(HTElfImageReader, CraftedFilesAreImagesWithSegmentsNamedByRoleOrAreNot)
{
    std::ifstream list(HEFT_TEST_DATA_DIR "/elf/layouts.txt");
    int rows = 0;
    for (std::string line; std::getline(list, line);) {
        if (line.empty() || line[0] == '#') continue;
        SCOPED_TRACE(line);
        ++rows;
        std::istringstream words(line);
        std::string name, word, expected;
        int poke = -1, value = 0;
        words >> name >> word;
        if (word == "poke") words >> std::hex >> poke >> value >> word;
        std::getline(words >> std::ws, expected);
        std::shared_ptr<const Layout> layout;
        const auto result = readLayout(name, &layout, poke, value);
        std::ostringstream actual;
        if (result == HTElfImageReader::ReadResult::NotImage && layout == nullptr) actual << "not an image";
        if (result == HTElfImageReader::ReadResult::Image) {
            actual << std::hex << layout->lowestAddress << ":";
            for (const auto& segment : layout->segments)
                actual << " " << segment.name << " " << segment.start << "-" << segment.end;
        }
        EXPECT_EQ(actual.str(), expected);
    }
    EXPECT_EQ(rows, 13);
}

TEST(HTElfImageReader, BiasFromAnyFileMapping)
{
    std::shared_ptr<const Layout> layout;
    ASSERT_EQ(readLayout("shared-object-64", &layout), HTElfImageReader::ReadResult::Image);
    const uint64_t base = 0x7f1234560000;
    // Mappings at an address from a file offset, executable or not. Data lies
    // one page ahead of its file offset: the RELRO page split off by mprotect,
    // and the page after it. The last is beyond every PT_LOAD's file contents.
    const std::tuple<uint64_t, uint64_t, bool, bool> rows[] = {{0, 0, false, true},
                                                               {0x1000, 0x1000, true, true},
                                                               {0x4000, 0x3000, false, true},
                                                               {0x5000, 0x4000, false, true},
                                                               {0x9000, 0x8000, false, false}};
    for (auto [address, offset, executable, found] : rows) {
        uint64_t bias = 0;
        EXPECT_EQ(HTElfImageReader::biasForMapping(*layout, base + address, offset, executable, kPage, &bias), found)
            << std::hex << address;
        EXPECT_EQ(bias, found ? base : 0) << std::hex << address;
    }
    // An executable's addresses are its own.
    uint64_t bias = 1;
    ASSERT_EQ(readLayout("executable", &layout), HTElfImageReader::ReadResult::Image);
    ASSERT_TRUE(HTElfImageReader::biasForMapping(*layout, 0x400000, 0, true, kPage, &bias));
    EXPECT_EQ(bias, 0u);
}

TEST(HTElfImageReader, ListsThisProcessesExecutableAndLibc)
{
    HTLinuxPlatform platform;
    std::shared_ptr<HTTaskPort> task;
    ASSERT_EQ(platform.task_for_pid(::getpid(), &task), KERN_SUCCESS);
    std::vector<HTPlatformImage> images;
    ASSERT_TRUE(platform.forEachTaskImage(*task, 0, [&](const HTPlatformImage& image) { images.push_back(image); }));
    const HTPlatformImage* self = imageWithPath(images, "/proc/self/exe");
    ASSERT_NE(self, nullptr);
    EXPECT_EQ(segmentAt(*self, reinterpret_cast<uintptr_t>(&segmentAt)), "__TEXT");
    EXPECT_EQ(segmentAt(*self, reinterpret_cast<uintptr_t>(&gHTElfWritable)), "__DATA");
    EXPECT_EQ(segmentAt(*self, reinterpret_cast<uintptr_t>(&gHTElfRelocatedTable)), "__DATA_CONST");
    EXPECT_EQ(segmentAt(*self, self->baseAddress), "__LINKEDIT");

    // A function only the C library has (the sanitizers replace many).
    auto libcFunction = reinterpret_cast<uintptr_t>(&gnu_get_libc_version);
    Dl_info info{};
    ASSERT_NE(::dladdr(reinterpret_cast<void*>(libcFunction), &info), 0);
    const HTPlatformImage* libc = imageWithPath(images, info.dli_fname);
    ASSERT_NE(libc, nullptr) << info.dli_fname;
    EXPECT_NE(libc->path.find("libc"), std::string::npos);
    EXPECT_EQ(segmentAt(*libc, libcFunction), "__TEXT");
    EXPECT_EQ(libc->baseAddress, reinterpret_cast<uintptr_t>(info.dli_fbase));
}
