#pragma once

#include "analysis/HTHeft.h"
#include "analysis/HTMemoryObjectMap.h"
#include "analysis/HTRecordingFormatter.h"
#include "analysis/HTScriptedProcess.h"
#include "platform/fake/HTFakePlatform.h"

#include <gtest/gtest.h>

#include <memory>
#include <vector>

constexpr uint64_t kPage = 4096;

// The driver with its internal steps opened up for tests.
class HTHeftProbe : public HTHeft {
public:
    using HTHeft::_addProcess;
    using HTHeft::_buildProcessToHeftMap;
    using HTHeft::_calculateHeftForProcess;
    using HTHeft::_categoriesForAllProcessesShouldSummarize;
    using HTHeft::_categoriesForObjects;
    using HTHeft::_notHiddenProcesses;
    using HTHeft::_processesBySortingHeft;
    using HTHeft::_processesBySortingPidDesc;
    using HTHeft::_sharingData;
    using HTHeft::_totalForCategories;
    using HTHeft::HTHeft;
};

// Scripted processes on a fake platform. The analysis switches and the
// global error list are program-wide, so every test starts and ends with
// them in their default state.
class HTAnalysisTest : public ::testing::Test {
protected:
    HTAnalysisTest() : platform_(std::make_shared<HTFakePlatform>()) { setBreakdown(false); }
    ~HTAnalysisTest() override
    {
        HTHeft::setSharingAnalysisDisabled(false);
        HTProcess::_clearGlobalErrors();
        HTFakePlatform unset;
        HTHeft::setBreakDownPhysHeft(unset, false);
    }

    void setBreakdown(bool on)
    {
        platform_->sysctlValues["vm.self_region_heft"] = on ? 1 : 0;
        HTHeft::setBreakDownPhysHeft(*platform_, on);
    }

    std::shared_ptr<HTScriptedProcess> process(int32_t pid, std::vector<HTScriptedRegion> script, bool is64bit = true)
    {
        return std::make_shared<HTScriptedProcess>(platform_, pid, std::move(script), is64bit);
    }

    // The driver over the processes, gathered.
    std::unique_ptr<HTHeftProbe> gathered(const HTHeft::ProcessList& processes)
    {
        auto heft = std::make_unique<HTHeftProbe>(processes, platform_);
        heft->gatherData();
        return heft;
    }

    // The driver, gathered and reported to one recording formatter.
    std::vector<std::string> report(const HTHeft::ProcessList& processes, bool verbose = false, bool summarize = false)
    {
        auto log = std::make_shared<HTRecordingFormatter::Log>();
        auto heft = gathered(processes);
        heft->addOutputFormatter(std::make_shared<HTRecordingFormatter>("X", log, true));
        heft->printOutputVerbose(verbose, summarize);
        return *log;
    }

    std::shared_ptr<HTFakePlatform> platform_;
};

// `n` pages of object `id`, all dirty, mapped shared.
inline HTScriptedRegion dirtyPages(uint64_t id, uint64_t n, const char* name = "region")
{
    return HTScriptedRegion{.objectId = id, .size = n * kPage, .dirty = n * kPage, .name = std::string(name)};
}
