#include "platform/linux/HTElfImageReader.h"
#include "platform/linux/HTLinuxPlatform.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTSmapsParser.h"
#include "support/HTLayoutChild.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <elf.h>
#include <fcntl.h>
#include <filesystem>
#include <gnu/libc-version.h>
#include <string>
#include <sys/mman.h>
#include <unistd.h>
#include <vector>

// A writable global and a table the loader makes read-only after
// relocation (pointers in a position-independent binary).
int gHTElfWritable = 7;
const char* const gHTElfRelocatedTable[] = {"relocated", "read-only"};

namespace {

constexpr uint64_t kPage = 4096;

using Layout = HTElfImageReader::Layout;

template<class Phdr>
Phdr programHeader(uint32_t type, uint32_t flags, uint64_t offset, uint64_t vaddr, uint64_t filesz, uint64_t memsz)
{
    Phdr header{};
    header.p_type = type;
    header.p_flags = flags;
    header.p_offset = offset;
    header.p_vaddr = vaddr;
    header.p_paddr = vaddr;
    header.p_filesz = filesz;
    header.p_memsz = memsz;
    header.p_align = kPage;
    return header;
}

// The bytes of an ELF file of the given class holding only its headers,
// padded to `fileSize`.
template<class Ehdr, class Phdr>
std::string elfFile(uint16_t type, const std::vector<Phdr>& headers, size_t fileSize)
{
    Ehdr header{};
    std::memcpy(header.e_ident, ELFMAG, SELFMAG);
    header.e_ident[EI_CLASS] = sizeof(Ehdr) == sizeof(Elf64_Ehdr) ? ELFCLASS64 : ELFCLASS32;
    header.e_ident[EI_DATA] = ELFDATA2LSB;
    header.e_ident[EI_VERSION] = EV_CURRENT;
    header.e_type = type;
    header.e_phoff = sizeof(Ehdr);
    header.e_ehsize = sizeof(Ehdr);
    header.e_phentsize = sizeof(Phdr);
    header.e_phnum = static_cast<uint16_t>(headers.size());
    std::string bytes(fileSize, '\0');
    std::memcpy(bytes.data(), &header, sizeof(header));
    std::memcpy(bytes.data() + sizeof(header), headers.data(), headers.size() * sizeof(Phdr));
    return bytes;
}

// A shared object laid out the usual way: headers and dynamic symbols,
// code, read-only data, then data whose first page is RELRO and whose
// address runs one page ahead of its file offset.
template<class Ehdr, class Phdr>
std::string sharedObject(uint64_t relroSize)
{
    std::vector<Phdr> headers = {
        programHeader<Phdr>(PT_LOAD, PF_R, 0, 0, 0x800, 0x800),
        programHeader<Phdr>(PT_LOAD, PF_R | PF_X, 0x1000, 0x1000, 0x800, 0x800),
        programHeader<Phdr>(PT_LOAD, PF_R, 0x2000, 0x2000, 0x100, 0x100),
        programHeader<Phdr>(PT_LOAD, PF_R | PF_W, 0x3000, 0x4000, 0x1800, 0x3000),
        programHeader<Phdr>(PT_GNU_RELRO, PF_R, 0x3000, 0x4000, relroSize, relroSize),
    };
    return elfFile<Ehdr, Phdr>(ET_DYN, headers, 0x4800);
}

HTElfImageReader::ReadResult readBytes(const std::string& bytes, std::shared_ptr<const Layout>* layout)
{
    int fd = ::memfd_create("heft-elf-test", MFD_CLOEXEC);
    EXPECT_EQ(::write(fd, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    auto result = HTElfImageReader::readLayout(fd, kPage, layout);
    ::close(fd);
    return result;
}

std::string segmentsText(const Layout& layout)
{
    std::string text;
    char line[96];
    for (const auto& segment : layout.segments) {
        std::snprintf(line, sizeof(line), "%s %llx-%llx\n", segment.name,
                      static_cast<unsigned long long>(segment.start), static_cast<unsigned long long>(segment.end));
        text += line;
    }
    return text;
}

// A new file under /tmp holding `bytes`, open at `fd`; empty on failure.
std::string temporaryFile(const std::string& bytes, int& fd)
{
    char pattern[] = "/tmp/heft-elf-XXXXXX";
    fd = ::mkstemp(pattern);
    if (fd < 0) return "";
    EXPECT_EQ(::write(fd, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    return pattern;
}

// The images of process `pid`, through `task` (opened here when empty).
std::vector<HTPlatformImage> listImages(HTLinuxPlatform& platform, pid_t pid, std::shared_ptr<HTTaskPort>& task)
{
    std::vector<HTPlatformImage> images;
    EXPECT_TRUE(task || platform.task_for_pid(pid, &task) == KERN_SUCCESS);
    EXPECT_TRUE(task &&
                platform.forEachTaskImage(*task, 0, [&](const HTPlatformImage& image) { images.push_back(image); }));
    return images;
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
    for (const auto& segment : image.segments) {
        if (segment.start <= address && address < segment.start + segment.size) return segment.name;
    }
    return "";
}

// Every file mapping of a listed image lies in segments of the role its
// protection shows: code in __TEXT, writable data in __DATA, the
// read-only first page in __LINKEDIT.
void expectMappingsMatchSegments(pid_t pid, const std::vector<HTPlatformImage>& images)
{
    HTProcBuffer smaps;
    ASSERT_TRUE(smaps.readFile(AT_FDCWD, ("/proc/" + std::to_string(pid) + "/smaps").c_str()));
    std::vector<HTSmapsEntry> mappings;
    htParseSmaps(smaps.view(), mappings);
    int checked = 0;
    for (const HTSmapsEntry& mapping : mappings) {
        for (const auto& image : images) {
            if (image.path != mapping.path) continue;
            std::string first = segmentAt(image, mapping.start);
            std::string last = segmentAt(image, mapping.end - 1);
            if (first.empty()) continue;  // another load of the same file
            EXPECT_EQ(first, last) << mapping.path << " at " << mapping.start;
            if (mapping.protection == (VM_PROT_READ | VM_PROT_EXECUTE)) {
                EXPECT_EQ(first, "__TEXT") << mapping.start;
            } else if (mapping.protection == (VM_PROT_READ | VM_PROT_WRITE)) {
                EXPECT_EQ(first, "__DATA") << mapping.start;
            } else if (mapping.offset == 0) {
                EXPECT_EQ(first, "__LINKEDIT") << mapping.start;
            }
            checked++;
        }
    }
    EXPECT_GT(checked, 4);
}

}  // namespace

TEST(HTElfImageReader, NamesSegmentsByRoleForBothClasses)
{
    std::shared_ptr<const Layout> layout;
    ASSERT_EQ(readBytes(sharedObject<Elf64_Ehdr, Elf64_Phdr>(0x1000), &layout), HTElfImageReader::ReadResult::Image);
    const char* expected =
        "__LINKEDIT 0-1000\n__TEXT 1000-2000\n__TEXT 2000-3000\n__DATA_CONST 4000-5000\n__DATA 5000-7000\n";
    EXPECT_EQ(segmentsText(*layout), expected);
    EXPECT_EQ(layout->lowestAddress, 0u);

    // The loader leaves a RELRO range's partial last page writable.
    ASSERT_EQ(readBytes(sharedObject<Elf32_Ehdr, Elf32_Phdr>(0x1010), &layout), HTElfImageReader::ReadResult::Image);
    EXPECT_EQ(segmentsText(*layout), expected);

    // Code at file offset 0 is still code; no RELRO, all data.
    std::vector<Elf64_Phdr> old = {
        programHeader<Elf64_Phdr>(PT_LOAD, PF_R | PF_X, 0, 0x400000, 0x1800, 0x1800),
        programHeader<Elf64_Phdr>(PT_LOAD, PF_R | PF_W, 0x1800, 0x601800, 0x100, 0x2000),
    };
    ASSERT_EQ(readBytes(elfFile<Elf64_Ehdr, Elf64_Phdr>(ET_EXEC, old, 0x2000), &layout),
              HTElfImageReader::ReadResult::Image);
    EXPECT_EQ(segmentsText(*layout), "__TEXT 400000-402000\n__DATA 601000-604000\n");
    EXPECT_EQ(layout->lowestAddress, 0x400000u);
}

TEST(HTElfImageReader, FilesThatAreNoImage)
{
    std::shared_ptr<const Layout> layout;
    EXPECT_EQ(readBytes("", &layout), HTElfImageReader::ReadResult::NotImage);
    // Program headers cut off by the end of the file.
    std::string cut = sharedObject<Elf64_Ehdr, Elf64_Phdr>(0x1000).substr(0, sizeof(Elf64_Ehdr) + 40);
    EXPECT_EQ(readBytes(cut, &layout), HTElfImageReader::ReadResult::NotImage);
    std::vector<Elf64_Phdr> load = {programHeader<Elf64_Phdr>(PT_LOAD, PF_R, 0, 0, 0x100, 0x100)};
    EXPECT_EQ(readBytes(elfFile<Elf64_Ehdr, Elf64_Phdr>(ET_REL, load, 0x200), &layout),
              HTElfImageReader::ReadResult::NotImage);
    EXPECT_EQ(layout, nullptr);
}

TEST(HTElfImageReader, BiasFromAnyFileMapping)
{
    std::shared_ptr<const Layout> layout;
    ASSERT_EQ(readBytes(sharedObject<Elf64_Ehdr, Elf64_Phdr>(0x1000), &layout), HTElfImageReader::ReadResult::Image);
    const uint64_t base = 0x7f1234560000;
    // Data lies one page ahead of its file offset: the RELRO page split off
    // by mprotect, and the page after it. The last row is beyond every
    // PT_LOAD's file contents.
    struct Row {
        uint64_t address, offset;
        bool executable, found;
    };
    const Row rows[] = {{0, 0, false, true},
                        {0x1000, 0x1000, true, true},
                        {0x4000, 0x3000, false, true},
                        {0x5000, 0x4000, false, true},
                        {0x9000, 0x8000, false, false}};
    for (const Row& row : rows) {
        uint64_t bias = 0;
        EXPECT_EQ(
            HTElfImageReader::biasForMapping(*layout, base + row.address, row.offset, row.executable, kPage, &bias),
            row.found)
            << std::hex << row.address;
        EXPECT_EQ(bias, row.found ? base : 0) << std::hex << row.address;
    }
    uint64_t bias = 0;

    std::vector<Elf64_Phdr> fixed = {programHeader<Elf64_Phdr>(PT_LOAD, PF_R | PF_X, 0, 0x400000, 0x1800, 0x1800)};
    ASSERT_EQ(readBytes(elfFile<Elf64_Ehdr, Elf64_Phdr>(ET_EXEC, fixed, 0x2000), &layout),
              HTElfImageReader::ReadResult::Image);
    ASSERT_TRUE(HTElfImageReader::biasForMapping(*layout, 0x400000, 0, true, kPage, &bias));
    EXPECT_EQ(bias, 0u);
}

TEST(HTElfImageReader, ListsThisProcessesExecutableAndLibc)
{
    HTLinuxPlatform platform;
    std::shared_ptr<HTTaskPort> task;
    auto images = listImages(platform, ::getpid(), task);
    const HTPlatformImage* self = imageWithPath(images, "/proc/self/exe");
    ASSERT_NE(self, nullptr);
    EXPECT_EQ(segmentAt(*self, reinterpret_cast<uintptr_t>(&listImages)), "__TEXT");
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

    expectMappingsMatchSegments(::getpid(), images);
}

TEST(HTElfImageReader, ListsAChildProcess)
{
    // Ready, the child has loaded everything and protected its relocated
    // data: its mappings stay as they are.
    HTLayoutChild child({});
    ASSERT_TRUE(child.ready());
    HTLinuxPlatform platform;
    std::shared_ptr<HTTaskPort> task;
    std::vector<HTPlatformImage> images = listImages(platform, child.pid(), task);
    const HTPlatformImage* program = imageWithPath(images, HEFT_LAYOUT_PROGRAM);
    ASSERT_NE(program, nullptr);
    EXPECT_EQ(segmentAt(*program, program->baseAddress), "__LINKEDIT");
    expectMappingsMatchSegments(child.pid(), images);

    child.reap();
    errno = 0;
    EXPECT_FALSE(platform.forEachTaskImage(*task, 0, [](const HTPlatformImage&) {}));
    EXPECT_NE(errno, 0);
}

TEST(HTElfImageReader, MappedFilesGiveImagesOnlyWhenTheyAreElf)
{
    int textFd;
    int elfFd;
    std::string textPath = temporaryFile("not an executable\n", textFd);
    std::string elfPath = temporaryFile(sharedObject<Elf64_Ehdr, Elf64_Phdr>(0x1000), elfFd);
    ASSERT_FALSE(textPath.empty() || elfPath.empty());
    void* textMap = ::mmap(nullptr, kPage, PROT_READ, MAP_PRIVATE, textFd, 0);
    // Only the data pages of the object, placed as a loader would: the
    // object's bias must come from them alone.
    auto* area = static_cast<char*>(::mmap(nullptr, 0x7000, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
    void* dataMap = ::mmap(area + 0x4000, 0x2000, PROT_READ, MAP_PRIVATE | MAP_FIXED, elfFd, 0x3000);
    ::close(textFd);
    ::close(elfFd);
    ASSERT_NE(textMap, MAP_FAILED);
    ASSERT_NE(area, MAP_FAILED);
    ASSERT_NE(dataMap, MAP_FAILED);

    HTLinuxPlatform platform;
    std::shared_ptr<HTTaskPort> task;
    auto images = listImages(platform, ::getpid(), task);
    const HTPlatformImage* object = imageWithPath(images, elfPath);
    EXPECT_EQ(imageWithPath(images, textPath), nullptr);
    ::unlink(textPath.c_str());
    ::unlink(elfPath.c_str());
    ASSERT_NE(object, nullptr);
    EXPECT_EQ(object->baseAddress, reinterpret_cast<uintptr_t>(area));
    ASSERT_EQ(object->segments.size(), 5u);
    EXPECT_EQ(object->segments[3].name, "__DATA_CONST");
    EXPECT_EQ(object->segments[3].start, reinterpret_cast<uintptr_t>(area) + 0x4000);
    EXPECT_EQ(object->segments[3].size, 0x1000u);

    ::munmap(textMap, kPage);
    ::munmap(area, 0x7000);
}
