// The kernel's own memory in heft's report, against /proc/slabinfo and /proc/meminfo read by the test.

#include "e2e/HTE2ESupport.h"

#include <algorithm>
#include <iterator>
#include <map>
#include <numeric>
#include <sstream>
#include <sys/stat.h>

using namespace heft_e2e;

namespace {

const uint64_t kPage = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));

// The bytes each slab cache holds: its slabs times the pages of a slab.
std::map<std::string, uint64_t> slabCaches()
{
    std::map<std::string, uint64_t> caches;
    std::istringstream lines(readFile("/proc/slabinfo"));
    for (std::string line; std::getline(lines, line);) {
        // name active total size perslab pagesperslab : tunables l b s : slabdata active_slabs num_slabs shared
        std::istringstream in(line);
        const std::vector<std::string> f{std::istream_iterator<std::string>(in), {}};
        if (f.size() >= 15 && f[0][0] != '#') caches[f[0]] = std::stoull(f[14]) * std::stoull(f[5]) * kPage;
    }
    return caches;
}

uint64_t total(const std::map<std::string, uint64_t>& caches)
{
    return std::accumulate(caches.begin(), caches.end(), uint64_t{0},
                           [](uint64_t sum, auto& c) { return sum + c.second; });
}

// The report of `heft -j FILE 0`; the zones: what each holds, dirty and reclaimable.
struct KernelReport {
    rapidjson::Document document;
    std::map<std::string, uint64_t> zones, sites;

    explicit KernelReport(const std::map<std::string, uint64_t>& caches)
    {
        TempDir directory;
        const Outcome outcome = runHeft({"-j", directory.file("kernel.json"), "0"});
        EXPECT_EQ(outcome.status, 0) << outcome.standardError;
        EXPECT_TRUE(loadReport(directory.file("kernel.json"), document));
        const rapidjson::Value* categories = member(processIn(document, 0), "categories");
        if (!categories) return;
        for (const auto& category : categories->GetObject()) {
            const uint64_t held = number(&category.value, "dirty") + number(&category.value, "reclaimable");
            (caches.count(category.name.GetString()) ? zones : sites)[category.name.GetString()] = held;
        }
    }
};

TEST(HTKernelE2ETest, ZonesAreTheSlabCachesAndSitesCountNothingTwice)
{
    if (geteuid() != 0) GTEST_SKIP() << "the kernel's memory needs root";
    // Caches change all the time: each figure lies between the files read before and after heft (the zones within
    // 1%) in one of ten runs, as a busy machine may move a figure and bring it back meanwhile.
    bool zonesHeld = false, percpuHeld = false;
    for (int run = 0; run < 10 && !(zonesHeld && percpuHeld); ++run) {
        const auto before = slabCaches();
        const std::string meminfoBefore = readFile("/proc/meminfo");
        const KernelReport report(before);
        const std::string meminfoAfter = readFile("/proc/meminfo");
        const auto after = slabCaches();
        const uint64_t zones = total(report.zones), percpu = report.sites.at("Percpu");
        zonesHeld = zonesHeld ||
            between(zones, std::min(total(before), total(after)) * 99 / 100,
                    std::max(total(before), total(after)) * 101 / 100);
        percpuHeld = percpuHeld ||
            between(percpu, std::min(kernelField(meminfoBefore, "Percpu"), kernelField(meminfoAfter, "Percpu")),
                    std::max(kernelField(meminfoBefore, "Percpu"), kernelField(meminfoAfter, "Percpu")));
        // meminfo's Slab counts slab pages as the page allocator charged them: a few percent more (6% here).
        const uint64_t slab = kernelField(meminfoAfter, "Slab");
        EXPECT_NEAR(static_cast<double>(zones), static_cast<double>(slab), static_cast<double>(slab) / 10);
        EXPECT_GT(report.zones.size(), 50u);
        for (const char* counted : {"Slab", "SReclaimable", "SUnreclaim", "VmallocUsed"})
            EXPECT_EQ(report.sites.count(counted), 0u) << counted;
    }
    EXPECT_TRUE(zonesHeld) << "the zones never lay between the slab caches read before and after";
    EXPECT_TRUE(percpuHeld) << "per-CPU memory never lay between meminfo's readings";
}

TEST(HTKernelE2ETest, DentriesMadeByTheTestGrowTheDentryZoneAsSlabinfoSays)
{
    if (geteuid() != 0) GTEST_SKIP() << "the kernel's memory needs root";
    TempDir scratch;
    const uint64_t slabBefore = slabCaches().at("dentry");
    const uint64_t heftBefore = KernelReport(slabCaches()).zones.at("dentry");
    // Looking up a missing name leaves a negative dentry behind: 200,000 of them are some 40 MB of dentries.
    struct stat status;
    for (int i = 0; i < 200000; ++i) stat(scratch.file(("missing-" + n(i)).c_str()).c_str(), &status);
    const uint64_t heftAfter = KernelReport(slabCaches()).zones.at("dentry");
    const uint64_t slabAfter = slabCaches().at("dentry");
    ASSERT_GT(slabAfter, slabBefore + 20 * kMiB) << "the kernel kept too few of the dentries for the test";
    // The rest of the system makes and frees dentries meanwhile: 10% of the growth, and 1 MiB.
    const double grown = static_cast<double>(slabAfter - slabBefore);
    EXPECT_NEAR(static_cast<double>(heftAfter) - static_cast<double>(heftBefore), grown, grown / 10 + kMiB);
}

}  // namespace
