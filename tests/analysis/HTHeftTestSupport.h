#pragma once

#include "analysis/HTHeft.h"
#include "analysis/HTHeftReport.h"
#include "analysis/HTScriptedProcess.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTUserProcess.h"

#include <gtest/gtest.h>

#include <memory>
#include <vector>

constexpr uint64_t kPage = 4096;

// The driver with its internal steps opened up for tests.
class HTHeftProbe : public HTHeft {
public:
    using HTHeft::HTHeft;

    // The totals of the summary.
    HTMemoryTotals _total()
    {
        HTMemoryTotals total;
        HTHeftReport report(outputFormatters(), pidToHeft(), settings().breakDownPhysHeft, true);
        HTHeftReport::_totalForCategories(report._categoriesForAllProcesses(processes()), &total);
        return total;
    }
};

// Scripted processes on a fake platform. The global error list is
// program-wide, so every test ends with it empty.
class HTAnalysisTest : public ::testing::Test {
protected:
    HTAnalysisTest() : platform_(std::make_shared<HTFakePlatform>()) { settings_.breakDownPhysHeft = false; }
    ~HTAnalysisTest() override { HTProcess::_clearGlobalErrors(); }

    std::shared_ptr<HTScriptedProcess> process(int32_t pid, std::vector<HTScriptedRegion> script, bool is64bit = true)
    {
        auto made = std::make_shared<HTScriptedProcess>(platform_, pid, std::move(script), is64bit);
        made->setSettings(settings_);
        return made;
    }

    // The driver over the processes, gathered.
    std::unique_ptr<HTHeftProbe> gathered(const HTHeft::ProcessList& processes)
    {
        auto heft = std::make_unique<HTHeftProbe>(processes, settings_);
        heft->gatherData();
        return heft;
    }

    std::shared_ptr<HTFakePlatform> platform_;
    HTSettings settings_;
};

// A child of pid 100 with private anonymous mappings of `identities.size()`
// written pages from 0x10000, `regionPages` pages a mapping (all in one when
// 0), with a page of gap between them; a page's identity is 0 when only its
// process maps it. Returns the process, read in with `settings`.
inline std::shared_ptr<HTUserProcess> forkedProcess(const std::shared_ptr<HTFakePlatform>& platform, int32_t pid,
                                                    const std::vector<uint64_t>& identities, size_t regionPages,
                                                    const HTSettings& settings)
{
    HTFakePlatform::Process& process = platform->addProcess(pid, 100, "worker");
    if (regionPages == 0) regionPages = identities.size();
    for (size_t first = 0; first < identities.size(); first += regionPages) {
        const size_t pages = std::min(regionPages, identities.size() - first);
        HTFakePlatform::Region region;
        region.start = 0x10000 + first / regionPages * (regionPages + 1) * kPage;
        region.size = pages * kPage;
        region.info.protection = VM_PROT_READ | VM_PROT_WRITE;
        region.info.share_mode = SM_COW;
        region.info.ref_count = 2;
        region.info.pages_resident = region.info.pages_dirtied = static_cast<uint32_t>(pages);
        region.info.object_id_full = 0x4000000000000000 | static_cast<uint64_t>(pid) << 8 | first;
        process.regions.push_back(region);
        for (size_t i = 0; i < pages; ++i) {
            process.dispositions[region.start + i * kPage] = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;
            if (identities[first + i]) process.pageIdentities[region.start + i * kPage] = identities[first + i];
        }
    }
    auto made = std::make_shared<HTUserProcess>(platform);
    made->setSettings(settings);
    EXPECT_TRUE(made->initWithBsdInfo(process.info));
    return made;
}
