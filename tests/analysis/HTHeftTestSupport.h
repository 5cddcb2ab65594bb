#pragma once

#include "analysis/HTHeft.h"
#include "analysis/HTHeftReport.h"
#include "analysis/HTHeftSharingData.h"
#include "analysis/HTMemoryObjectMap.h"
#include "analysis/HTScriptedProcess.h"
#include "analysis/HTSharingAnalysis.h"
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
    using HTHeft::_notHiddenProcesses;
    using HTHeft::_processesBySortingHeft;
    using HTHeft::_processesBySortingPidDesc;
    using HTHeft::HTHeft;

    std::unique_ptr<HTHeftSharingData> _sharingData()
    {
        return HTSharingAnalysis::sharingDataForProcesses(processes());
    }
    HTCategoryMap _categoriesForAllProcessesShouldSummarize(bool summarize)
    {
        return HTHeftReport(outputFormatters(), pidToHeft(), settings().breakDownPhysHeft, summarize)
            ._categoriesForAllProcesses(processes());
    }
    HTCategoryMap _categoriesForObjects(const ObjectSet& objects, HTProcess& process, bool* hasProcessView,
                                        bool summarize)
    {
        return HTHeftReport(outputFormatters(), pidToHeft(), settings().breakDownPhysHeft, summarize)
            ._categoriesForObjects(objects, process, hasProcessView);
    }
    static void _totalForCategories(const HTCategoryMap& categories, HTMemoryTotals* total)
    {
        HTHeftReport::_totalForCategories(categories, total);
    }
};

// Scripted processes on a fake platform. The global error list is
// program-wide, so every test starts and ends with it empty.
class HTAnalysisTest : public ::testing::Test {
protected:
    HTAnalysisTest() : platform_(std::make_shared<HTFakePlatform>()) { setBreakdown(false); }
    ~HTAnalysisTest() override { HTProcess::_clearGlobalErrors(); }

    // The settings of the processes and drivers made from here on.
    void setBreakdown(bool on) { settings_.breakDownPhysHeft = on; }

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

// The pids of the processes, as "{10,20}".
inline std::string pidsOf(const std::vector<std::shared_ptr<HTProcess>>& processes)
{
    std::string text = "{";
    for (const auto& process : processes) text += (text.size() > 1 ? "," : "") + std::to_string(process->pid());
    return text + "}";
}

// `n` pages of object `id`, all dirty, mapped shared.
inline HTScriptedRegion dirtyPages(uint64_t id, uint64_t n, const char* name = "region")
{
    return HTScriptedRegion{.objectId = id, .size = n * kPage, .dirty = n * kPage, .name = std::string(name)};
}
