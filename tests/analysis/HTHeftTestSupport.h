#pragma once

#include "analysis/HTHeft.h"
#include "analysis/HTScriptedProcess.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTUserProcess.h"

#include <gtest/gtest.h>

#include <memory>
#include <vector>

constexpr uint64_t kPage = 4096;

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
    std::unique_ptr<HTHeft> gathered(const HTHeft::ProcessList& processes)
    {
        auto heft = std::make_unique<HTHeft>(processes, settings_);
        heft->gatherData();
        return heft;
    }

    std::shared_ptr<HTFakePlatform> platform_;
    HTSettings settings_;
};

// A child of pid 100 with private mappings from 0x10000, one page an entry
// of `pages`, `regionPages` pages a mapping (all in one when 0), a page of
// gap between them. An entry is the identity of a written page (0 when only
// its process maps it), `c` a page copied from the file, `f` a page of the
// file, `-` a page never touched. With `file`, the mappings map that file.
// Returns the process, read in with `settings`.
inline std::shared_ptr<HTUserProcess> forkedProcess(const std::shared_ptr<HTFakePlatform>& platform, int32_t pid,
                                                    const std::vector<std::string>& pages, size_t regionPages,
                                                    const HTSettings& settings,
                                                    const std::optional<std::string>& file = std::nullopt)
{
    HTFakePlatform::Process& process = platform->addProcess(pid, 100, "worker");
    if (regionPages == 0) regionPages = pages.size();
    for (size_t first = 0; first < pages.size(); first += regionPages) {
        HTFakePlatform::Region region;
        region.start = 0x10000 + first / regionPages * (regionPages + 1) * kPage;
        region.size = std::min(regionPages, pages.size() - first) * kPage;
        region.info.protection = VM_PROT_READ | VM_PROT_WRITE;
        region.info.share_mode = SM_COW;
        region.info.ref_count = 2;
        region.info.object_id_full =
            file ? 0x8000000000000077 : 0x4000000000000000 | static_cast<uint64_t>(pid) << 8 | first;
        region.info.external_pager = file.has_value();
        region.info.inheritance = file ? VM_INHERIT_COPY : region.info.inheritance;
        region.path = file;
        for (uint64_t address = region.start; address < region.start + region.size; address += kPage) {
            const std::string& kind = pages[first + (address - region.start) / kPage];
            if (kind == "-") continue;
            region.info.pages_resident++;
            region.info.pages_dirtied += kind != "f";
            region.info.pages_shared_now_private += kind == "c";
            process.dispositions[address] = VM_PAGE_QUERY_PAGE_PRESENT |
                (kind == "f" ? VM_PAGE_QUERY_PAGE_EXTERNAL
                             : VM_PAGE_QUERY_PAGE_DIRTY | (kind == "c" ? VM_PAGE_QUERY_PAGE_COPIED : 0));
            if (kind != "f" && kind != "c" && kind != "0") process.pageIdentities[address] = std::stoull(kind);
        }
        process.regions.push_back(region);
    }
    auto made = std::make_shared<HTUserProcess>(platform);
    made->setSettings(settings);
    EXPECT_TRUE(made->initWithBsdInfo(process.info));
    return made;
}
