#include "analysis/HTHeftReport.h"

#include "analysis/HTHeftSharingData.h"
#include "base/HTPointerIndex.h"
#include "model/HTAuxDataMap.h"
#include "model/HTMemoryCategory.h"
#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"
#include "output/HTOutputFormatter.h"
#include "process/HTProcess.h"
#include "process/HTProcessGroup.h"

#include <algorithm>
#include <optional>
#include <string>
#include <string_view>

namespace {

// The key under which an object is filed in a category map. An object whose
// representative region carries no name still holds memory that the table
// and its total must show, so it is filed under one fixed key rather than
// left out; an empty key would look like a real, blank name. A full name is
// built in `storage`; a short name is the region's own.
std::string_view categoryKey(const HTMemoryObject& object, bool summarize, std::optional<std::string>& storage)
{
    if (summarize) {
        const std::optional<std::string>& name = object.name();
        return name ? std::string_view(*name) : "unknown";
    }
    storage = object.fullName();
    return storage ? std::string_view(*storage) : "unknown";
}

// The category of the key, created with `segment` when absent.
HTMemoryCategory& categoryFor(HTCategoryMap& categories, std::string_view key, uint8_t segment, bool summarize)
{
    if (HTMemoryCategory* found = categories.find(key)) return *found;
    auto made = std::make_shared<HTMemoryCategory>(segment, summarize);
    HTMemoryCategory& category = *made;
    categories.add(std::string(key), std::move(made));
    return category;
}

}  // namespace

HTHeftReport::HTHeftReport(const FormatterList& formatters, const HTPidMap<uint64_t>& pidToHeft, bool breakDownPhysHeft,
                           bool summarize)
    : formatters_(formatters), pidToHeft_(pidToHeft), breakDownPhysHeft_(breakDownPhysHeft), summarize_(summarize)
{
}

HTCategoryMap HTHeftReport::_categoriesForObjects(const ObjectSet& objects, HTProcess& process,
                                                  bool* hasProcessView) const
{
    const bool summarize = summarize_;
    const bool breakDown = breakDownPhysHeft_;
    HTCategoryMap categories;
    bool ownView = false;
    std::optional<std::string> keyStorage;
    for (const auto& object : objects) {
        const uint8_t segment =
            object->memoryRegions().empty() ? HTSegmentNotSet : object->memoryRegions().front()->segment();
        HTMemoryCategory& category =
            categoryFor(categories, categoryKey(*object, summarize, keyStorage), segment, summarize);
        std::shared_ptr<HTMemoryObject> view =
            object->viewForProcess(process.pid(), process.pageSize(), process.breakDownPhysHeft(), breakDown);
        if (view != object) ownView = true;
        category.addMemoryObject(view);
    }
    if (hasProcessView) *hasProcessView = ownView;
    return categories;
}

HTCategoryMap HTHeftReport::_categoriesForAllProcesses(const ProcessList& processes) const
{
    const bool summarize = summarize_;
    HTCategoryMap categories;
    HTPointerIndex seen;
    std::optional<std::string> keyStorage;
    for (const auto& process : processes) {
        if (process->hiddenFromDisplay()) continue;
        for (const auto& region : process->memoryRegions()) {
            std::shared_ptr<HTMemoryObject> object = region->memoryObject();
            if (!object || !seen.insert(object.get()).second) continue;
            categoryFor(categories, categoryKey(*object, summarize, keyStorage), region->segment(), summarize)
                .addMemoryObject(object);
        }
    }
    return categories;
}

void HTHeftReport::_totalForCategories(const HTCategoryMap& categories, HTMemoryTotals* outTotal)
{
    HTMemoryTotals total;
    for (const auto& [key, category] : categories) {
        total.dirty += category->totalDirtySize();
        total.swapped += category->totalSwappedSize();
        total.clean += category->totalCleanSize();
        total.reclaimable += category->totalReclaimableSize();
        total.wired += category->totalWiredSize();
        total.regions += static_cast<uint32_t>(category->totalRegions());
    }
    *outTotal = total;
}

const HTHeftReport::GroupTable& HTHeftReport::tableForGroup(const HTProcessGroup& group, const ObjectSet& objects,
                                                            HTProcess& process, CommonTables& common,
                                                            GroupTable& scratch) const
{
    GroupTable* table = &scratch;
    if (group.count() > 1) {
        // Every member of a shared group prints its table: where they all
        // see the same, it is made once.
        auto found = common.find(&group);
        if (found != common.end()) return found->second;
        if (std::all_of(objects.begin(), objects.end(),
                        [](const auto& object) { return object->looksTheSameToEveryProcess(); }))
            table = &common[&group];
    }
    table->categories = _categoriesForObjects(objects, process, &table->hasProcessView);
    _totalForCategories(table->categories, &table->total);
    return *table;
}

void HTHeftReport::printSpanlistLikeOutputForProcesses(const ProcessList& processes)
{
    FormatterList listing;
    for (const auto& formatter : formatters_)
        if (formatter->respondsToSpanlistLikeOutput()) listing.push_back(formatter);
    if (listing.empty()) return;
    for (const auto& process : processes)
        for (const auto& formatter : listing)
            formatter->printSpanlistLikeOutputForProcess(*process, process->memoryRegions());
}

void HTHeftReport::printReport(const ProcessList& reported, const HTHeftSharingData& sharing, const ProcessList& all)
{
    ProcessList processesWithWarnings;
    ProcessList processesWithErrors;
    std::shared_ptr<HTAuxDataMap> mergedAuxData;
    CommonTables commonTables;
    GroupTable scratchTable;

    for (const auto& process : reported) {
        const bool hasErrors = !process->errors().empty();
        const std::shared_ptr<HTAuxDataMap> auxData = process->auxData();
        if (!process->warnings().empty()) processesWithWarnings.push_back(process);
        if (hasErrors)
            processesWithErrors.push_back(process);
        else if (auxData)
            mergedAuxData = auxData->mergeWithData(mergedAuxData);

        const uint64_t* heft = pidToHeft_.find(process->pid());
        for (const auto& formatter : formatters_) {
            formatter->printProcessHeader(*process);
            if (!hasErrors) formatter->printProcessTotal(heft ? *heft : 0, *process);
            formatter->endProcessHeader(*process);
        }

        const HTProcessGroupOrderedSet* groups =
            hasErrors ? nullptr : sharing.processToProcessGroups().find(process->pid());
        if (groups) {
            for (const auto& group : *groups) {
                static const ObjectSet kNoObjects;
                const ObjectSet* objects = sharing.processGroupToObjects().find(*group);
                const GroupTable& table =
                    tableForGroup(*group, objects ? *objects : kNoObjects, *process, commonTables, scratchTable);
                for (const auto& formatter : formatters_) {
                    if (group->count() == 1)
                        formatter->printProcessCategories(table.categories, table.total);
                    else
                        formatter->printSharedCategories(table.categories, *group, *process, table.hasProcessView,
                                                         table.total);
                }
            }
        } else {
            const HTCategoryMap noCategories;
            const HTMemoryTotals zero;
            for (const auto& formatter : formatters_) formatter->printProcessCategories(noCategories, zero);
        }

        for (const auto& formatter : formatters_) formatter->printProcessAuxData(auxData);
    }

    const std::vector<std::string> globalErrors = HTProcess::globalErrors();
    for (const auto& formatter : formatters_)
        formatter->printProcessesWithWarnings(processesWithWarnings, processesWithErrors, globalErrors);

    const HTCategoryMap summary = _categoriesForAllProcesses(all);
    HTMemoryTotals summaryTotal;
    _totalForCategories(summary, &summaryTotal);
    const bool hadErrors = !globalErrors.empty() || !processesWithErrors.empty();
    for (const auto& formatter : formatters_) {
        formatter->printSummaryCategories(summary, summaryTotal, hadErrors);
        formatter->printGlobalAuxData(mergedAuxData);
        formatter->end();
    }
}
