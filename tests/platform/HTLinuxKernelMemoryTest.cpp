#include "platform/linux/HTLinuxKernelMemory.h"
#include "output/HTExpectedReport.h"
#include "platform/linux/HTKernelSymbolTable.h"
#include "platform/linux/HTLinuxPlatform.h"
#include "platform/linux/HTMeminfoParser.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTSlabinfoParser.h"

#include <gtest/gtest.h>

#include <array>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <grp.h>
#include <set>
#include <sys/wait.h>
#include <unistd.h>

namespace {

const std::string kCaptures = HEFT_TEST_DATA_DIR "/kernel/";

// One line a zone, then one a site: flags, site, name, figures, and for code the resolver's symbol and source.
std::string describe(const std::vector<mach_zone_name_t>& names, const std::vector<mach_zone_info_t>& zones,
                     const std::vector<mach_memory_info_t>& sites, HTKernelSymbolResolver& resolver)
{
    std::string text;
    char line[400];
    for (size_t i = 0; i < zones.size(); ++i) {
        const mach_zone_info_t& z = zones[i];
        std::snprintf(line, sizeof(line),
                      "zone %.80s: %" PRIu64 " of %" PRIu64 " B in %" PRIu64 " B by %" PRIu64 " B%s\n",
                      names[i].mzn_name, z.mzi_count, z.mzi_elem_size, z.mzi_cur_size, z.mzi_alloc_size,
                      z.mzi_collectable ? " collectable" : "");
        text += line;
    }
    for (const mach_memory_info_t& s : sites) {
        bool code = (s.flags & VM_KERN_SITE_TYPE) == VM_KERN_SITE_KERNEL;
        std::string symbol = code ? resolver.symbolName(s.site).value_or("-") : "";
        auto source = code ? resolver.sourceInfo(s.site) : std::nullopt;
        std::snprintf(line, sizeof(line),
                      "site %#05" PRIx64 " %#" PRIx64 " %s: size %" PRIu64 " mapped %" PRIu64 " %s %s:%d\n", s.flags,
                      s.site, s.name, s.size, s.mapped, symbol.c_str(), source ? source->path.c_str() : "",
                      source ? source->line : 0);
        text += line;
    }
    return text;
}

// The live figures the answer must match, as the /proc files give them:
// slab bytes, bytes of vmalloc pages, KernelStack, Percpu.
std::array<uint64_t, 4> procFigures(uint64_t page)
{
    std::array<uint64_t, 4> figures{};
    HTProcBuffer file;
    EXPECT_TRUE(file.readFile(AT_FDCWD, "/proc/slabinfo"));
    std::string text(file.view());
    for (char* line = std::strtok(text.data(), "\n"); line; line = std::strtok(nullptr, "\n")) {
        unsigned long long pagesPerSlab = 0, slabs = 0;
        if (std::sscanf(line, "%*s %*u %*u %*u %*u %llu : tunables %*u %*u %*u : slabdata %*u %llu", &pagesPerSlab,
                        &slabs) == 2)
            figures[0] += slabs * pagesPerSlab * page;
    }
    EXPECT_TRUE(file.readFile(AT_FDCWD, "/proc/vmallocinfo"));
    text = file.view();
    for (size_t at = 0; (at = text.find(" pages=", at)) != std::string::npos; ++at)
        figures[1] += std::strtoull(text.c_str() + at + 7, nullptr, 10) * page;
    EXPECT_TRUE(file.readFile(AT_FDCWD, "/proc/meminfo"));
    text = file.view();
    figures[2] = std::strtoull(std::strstr(text.c_str(), "KernelStack:") + 12, nullptr, 10) * 1024;
    figures[3] = std::strtoull(std::strstr(text.c_str(), "Percpu:") + 7, nullptr, 10) * 1024;
    return figures;
}

// The same figures from the answer.
std::array<uint64_t, 4> answerFigures(const std::vector<mach_zone_info_t>& zones,
                                      const std::vector<mach_memory_info_t>& sites)
{
    std::array<uint64_t, 4> figures{};
    for (const mach_zone_info_t& zone : zones) figures[0] += zone.mzi_cur_size;
    for (const mach_memory_info_t& site : sites) {
        if (site.flags == (VM_KERN_SITE_KERNEL | VM_KERN_SITE_WIRED | VM_KERN_SITE_NAMED)) figures[1] += site.size;
        if ((site.flags & VM_KERN_SITE_TYPE) != VM_KERN_SITE_TAG) continue;
        if (std::strcmp(site.name, "KernelStack") == 0) figures[2] = site.size;
        if (std::strcmp(site.name, "Percpu") == 0) figures[3] = site.size;
    }
    return figures;
}

}  // namespace

TEST(HTLinuxKernelMemory, CapturedFilesGiveZonesSitesCountersAndNames)
{
    // Captured on Linux 6.18 as root, trimmed; modules and allocinfo written in the kernel's formats, as are the
    // last four vmallocinfo lines (module code, an address without symbol, an area without caller, one without
    // pages) and the kallsyms lines of module code.
    HTLinuxKernelMemory kernel(kCaptures, 4096);
    std::vector<mach_zone_name_t> names;
    std::vector<mach_zone_info_t> zones;
    std::vector<mach_memory_info_t> sites;
    ASSERT_EQ(kernel.memoryInfo(names, zones, sites), KERN_SUCCESS);
    ASSERT_EQ(names.size(), zones.size());
    auto resolver = kernel.openSymbolResolver();
    expectReport("kernel-memory-info.txt", describe(names, zones, sites, *resolver));

    // Slab pages once, in the zones; vmalloc pages once, in the unhidden code sites; no meminfo figure of
    // either (nor one that holds them) as a tag site; stacks are vmalloc memory here, so their tag is hidden.
    EXPECT_EQ(answerFigures(zones, sites), (std::array<uint64_t, 4>{72531968, 1887 * 4096, 1584 * 1024, 784 * 1024}));
    for (const mach_memory_info_t& site : sites) {
        if ((site.flags & VM_KERN_SITE_TYPE) != VM_KERN_SITE_TAG) continue;
        for (const char* doubled : {"Slab", "SReclaimable", "SUnreclaim", "KReclaimable", "VmallocUsed"})
            EXPECT_STRNE(site.name, doubled);
        EXPECT_TRUE(std::strcmp(site.name, "KernelStack") != 0 || (site.flags & VM_KERN_SITE_HIDE));
    }

    // Only the version 2 columns are known; counts without a unit stay counts (the capture's are all 0).
    std::vector<HTSlabCache> caches;
    EXPECT_FALSE(htParseSlabinfo("slabinfo - version: 1.1\nkmalloc-64 1 1 64 1 1\n", caches));
    std::vector<HTMeminfoField> fields =
        htParseMeminfo("HugePages_Total:      12\nHugepagesize:    2048 kB\nBad: 1 MB\n");
    ASSERT_EQ(fields.size(), 2u);
    EXPECT_EQ(fields[0].value + fields[1].value, 12u + 2048 * 1024);

    std::string modules;
    for (const HTLoadedModule& module : kernel.loadedModules())
        modules += module.bundleIdentifier + "=" + std::to_string(module.loadTag) + " ";
    EXPECT_EQ(modules, "nft_chain_nat=0 nf_tables=1 snd_hda_codec_realtek=2 vboxdrv=3 ");
    // Without the optional files: no allocation or module sites and no error. Without symbols, each code site
    // keeps a number of its own, below any code address, so that no two become one memory object.
    HTLinuxKernelMemory bare(kCaptures + "bare/", 4096);
    ASSERT_EQ(bare.memoryInfo(names, zones, sites), KERN_SUCCESS);
    EXPECT_TRUE(bare.loadedModules().empty());
    std::set<uint64_t> codeSites;
    for (const mach_memory_info_t& site : sites) {
        EXPECT_NE(site.flags & (VM_KERN_SITE_TYPE | VM_KERN_SITE_HIDE), VM_KERN_SITE_KERNEL | VM_KERN_SITE_HIDE);
        EXPECT_NE(site.flags & VM_KERN_SITE_TYPE, VM_KERN_SITE_KMOD);
        if ((site.flags & VM_KERN_SITE_TYPE) != VM_KERN_SITE_KERNEL) continue;
        EXPECT_TRUE(site.site < 64 || site.site == 0xffffffffc0a0f123) << site.name;
        codeSites.insert(site.site);
    }
    EXPECT_EQ(codeSites.size(), 12u);
    EXPECT_EQ(HTLinuxKernelMemory(kCaptures + "none/", 4096).memoryInfo(names, zones, sites),
              HT_KERN_ERRNO_BASE | ENOENT);
}

TEST(HTKernelSymbolTable, NamesTheCodeAtOrBelowAnAddressUnlessAddressesAreHidden)
{
    auto table = HTKernelSymbolTable::read((kCaptures + "proc/kallsyms").c_str());
    ASSERT_TRUE(table);
    const std::pair<uint64_t, const char*> rows[] = {
        {0xffffffff81356590, "kernel_clone"},
        {0xffffffff81356624, "kernel_clone"},
        {0xffffffff8135658f, "__pfx_kernel_clone"},
        {0xffffffff81000000, "srso_alias_untrain_ret"},
        {0xffffffffc0a0e0ff, "nft_set_alloc [nf_tables]"},
        // Data symbols are no code: an address among them belongs to the code below.
        {0xffffffff82400010, "__pfx_n_tty_kick_worker"},
        {0xffffffff80ffffff, nullptr},
        {0, nullptr},
    };
    for (auto [address, name] : rows)
        EXPECT_EQ(table->symbolName(address), name ? std::optional<std::string>(name) : std::nullopt) << address;

    // One pass finds the functions wanted: the first listed of a name, not its .cold part, module code by module.
    HTSymbolAddresses wanted{{"bpf_prog_pack_alloc", {}},
                             {"cmp_range", {}},
                             {"nft_set_alloc [nf_tables]", {}},
                             {"nft_set_alloc", {}}};
    table->findAddresses(wanted);
    EXPECT_EQ(wanted,
              (HTSymbolAddresses{{"bpf_prog_pack_alloc", 0xffffffff814ce810},
                                 {"cmp_range", 0xffffffff813391d0},
                                 {"nft_set_alloc [nf_tables]", 0xffffffffc0a0e010},
                                 {"nft_set_alloc", std::nullopt}}));
    // With the addresses hidden the names are there, at 0, and name nothing.
    auto hidden = HTKernelSymbolTable::read((kCaptures + "kallsyms-hidden").c_str());
    ASSERT_TRUE(hidden);
    EXPECT_TRUE(hidden->hidesAddresses());
    EXPECT_FALSE(hidden->symbolName(0x10));
    wanted = {{"free_vm_stack_cache", {}}, {"nft_set_alloc [nf_tables]", {}}, {"vfree", {}}};
    hidden->findAddresses(wanted);
    EXPECT_EQ(wanted, (HTSymbolAddresses{{"free_vm_stack_cache", 0}, {"nft_set_alloc [nf_tables]", 0}, {"vfree", {}}}));
    EXPECT_FALSE(HTKernelSymbolTable::read((kCaptures + "no-such-file").c_str()));
}

TEST(HTLinuxKernelMemory, LiveAnswerMatchesTheProcFilesAndNeedsRoot)
{
    const uint64_t page = static_cast<uint64_t>(::sysconf(_SC_PAGESIZE));
    std::vector<mach_zone_name_t> names;
    std::vector<mach_zone_info_t> zones;
    std::vector<mach_memory_info_t> sites;
    const kern_return_t needsRoot = HT_KERN_ERRNO_BASE | EACCES;
    if (::geteuid() != 0) {
        EXPECT_EQ(HTLinuxPlatform().mach_memory_info(names, zones, sites), needsRoot);
        GTEST_SKIP() << "the slab and vmalloc figures need root";
    }
    // As root every code site is named from kallsyms.
    HTLinuxPlatform platform;
    ASSERT_EQ(platform.mach_memory_info(names, zones, sites), KERN_SUCCESS);
    auto resolver = platform.openKernelImageList();
    for (const mach_memory_info_t& site : sites)
        EXPECT_TRUE((site.flags & VM_KERN_SITE_TYPE) != VM_KERN_SITE_KERNEL || site.site <= sites.size() ||
                    resolver->symbolName(site.site))
            << site.name;
    pid_t child = ::fork();
    if (child == 0) {
        bool dropped = ::setgroups(0, nullptr) == 0 && ::setresgid(65534, 65534, 65534) == 0 &&
            ::setresuid(65534, 65534, 65534) == 0;
        _exit(dropped && HTLinuxPlatform().mach_memory_info(names, zones, sites) == needsRoot ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0) << "without root the call fails with EACCES";

    // Slabs come and go as other processes run, stacks with their threads: the files are read before and after
    // the call, and each figure must lie between the two readings (equal them on a quiet machine) in one of 20
    // tries: a busy machine may move a figure and bring it back in between.
    std::array<bool, 4> held{};
    for (int attempt = 0; attempt < 20 && held != std::array<bool, 4>{true, true, true, true}; ++attempt) {
        const auto before = procFigures(page);
        ASSERT_EQ(platform.mach_memory_info(names, zones, sites), KERN_SUCCESS);
        const auto after = procFigures(page), answer = answerFigures(zones, sites);
        for (size_t i = 0; i < answer.size(); ++i)
            held[i] =
                held[i] || (std::min(before[i], after[i]) <= answer[i] && answer[i] <= std::max(before[i], after[i]));
    }
    EXPECT_EQ(held, (std::array<bool, 4>{true, true, true, true})) << "slab, vmalloc, stacks, per-CPU";
}
