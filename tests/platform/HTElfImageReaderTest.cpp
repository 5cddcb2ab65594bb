#include "platform/linux/HTElfImageReader.h"
#include "platform/linux/HTLinuxPlatform.h"

#include <gtest/gtest.h>

#include <cstddef>

#include <cstring>
#include <dlfcn.h>
#include <elf.h>
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

}  // namespace

TEST(HTElfImageReader, CraftedFilesAreImagesWithSegmentsNamedByRoleOrAreNot)
{
    const std::string so64 = sharedObject<Elf64_Ehdr, Elf64_Phdr>(0x1000);
    auto poked = [](std::string bytes, size_t at, char value) {
        bytes[at] = value;
        return bytes;
    };
    const char* usual =
        "__LINKEDIT 0-1000\n__TEXT 1000-2000\n__TEXT 2000-3000\n__DATA_CONST 4000-5000\n__DATA 5000-7000\n";
    // Code at file offset 0 is still code; no RELRO, all data.
    const std::vector<Elf64_Phdr> old = {
        programHeader<Elf64_Phdr>(PT_LOAD, PF_R | PF_X, 0, 0x400000, 0x1800, 0x1800),
        programHeader<Elf64_Phdr>(PT_LOAD, PF_R | PF_W, 0x1800, 0x601800, 0x100, 0x2000),
    };
    const std::vector<Elf64_Phdr> load = {programHeader<Elf64_Phdr>(PT_LOAD, PF_R, 0, 0, 0x100, 0x100)};
    const std::vector<Elf64_Phdr> noLoad = {programHeader<Elf64_Phdr>(PT_GNU_RELRO, PF_R, 0, 0, 0x100, 0x100)};
    const std::vector<Elf64_Phdr> wraps = {programHeader<Elf64_Phdr>(PT_LOAD, PF_R, 0, ~0ull - 0x10, 0x100, 0x100)};
    const std::vector<Elf64_Phdr> lastPage = {programHeader<Elf64_Phdr>(PT_LOAD, PF_R, 0, ~0ull - 0x200, 0, 0x100)};
    struct Row {
        const char* what;
        std::string bytes;
        const char* segments;  // null: not an image
        uint64_t lowest;
    };
    const Row rows[] = {
        {"64-bit shared object", so64, usual, 0},
        // The loader leaves a RELRO range's partial last page writable.
        {"32-bit, RELRO ending mid-page", sharedObject<Elf32_Ehdr, Elf32_Phdr>(0x1010), usual, 0},
        {"executable", elfFile<Elf64_Ehdr, Elf64_Phdr>(ET_EXEC, old, 0x2000),
         "__TEXT 400000-402000\n__DATA 601000-604000\n", 0x400000},
        {"empty", "", nullptr, 0},
        {"program headers cut off", so64.substr(0, sizeof(Elf64_Ehdr) + 40), nullptr, 0},
        {"relocatable object", elfFile<Elf64_Ehdr, Elf64_Phdr>(ET_REL, load, 0x200), nullptr, 0},
        {"no PT_LOAD", elfFile<Elf64_Ehdr, Elf64_Phdr>(ET_DYN, noLoad, 0x200), nullptr, 0},
        {"segment past the end of memory", elfFile<Elf64_Ehdr, Elf64_Phdr>(ET_DYN, wraps, 0x200), nullptr, 0},
        {"segment in the last page of memory", elfFile<Elf64_Ehdr, Elf64_Phdr>(ET_DYN, lastPage, 0x200), nullptr, 0},
        {"other byte order", poked(so64, EI_DATA, ELFDATA2MSB), nullptr, 0},
        {"no class", poked(so64, EI_CLASS, ELFCLASSNONE), nullptr, 0},
        {"no magic", poked(so64, 1, 'e'), nullptr, 0},
        {"program header entries too small", poked(so64, offsetof(Elf64_Ehdr, e_phentsize), 8), nullptr, 0},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        std::shared_ptr<const Layout> layout;
        const auto result = readBytes(row.bytes, &layout);
        if (row.segments == nullptr) {
            EXPECT_EQ(result, HTElfImageReader::ReadResult::NotImage);
            EXPECT_EQ(layout, nullptr);
            continue;
        }
        ASSERT_EQ(result, HTElfImageReader::ReadResult::Image);
        EXPECT_EQ(segmentsText(*layout), row.segments);
        EXPECT_EQ(layout->lowestAddress, row.lowest);
    }
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
