#pragma once

#include "model/HTMemoryTotals.h"

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

class HTAuxDataMap;
class HTCategoryMap;
class HTMemoryRegion;
class HTProcess;
class HTProcessGroup;

// A report writer. The analysis sends every attached writer the same calls
// in a fixed order: optionally every process's region listing first; then
// per process its header, heft, end of header, one table per process group
// and its auxiliary data; then the run's diagnostics; then, writer by
// writer, the summary, the merged auxiliary data and end.
class HTOutputFormatter {
public:
    using ProcessList = std::vector<std::shared_ptr<HTProcess>>;
    using RegionList = std::vector<std::shared_ptr<HTMemoryRegion>>;

    virtual ~HTOutputFormatter() = default;

    // The region listing is optional: only writers that answer true here
    // receive printSpanlistLikeOutputForProcess.
    virtual bool respondsToSpanlistLikeOutput() const { return false; }
    virtual void printSpanlistLikeOutputForProcess(const HTProcess& process, const RegionList& regions) {}

    virtual void printProcessHeader(const HTProcess& process) = 0;
    virtual void printProcessTotal(uint64_t processHeft, const HTProcess& process) = 0;
    virtual void endProcessHeader(const HTProcess& process) = 0;
    virtual void printProcessCategories(const HTCategoryMap& categories, const HTMemoryTotals& total) = 0;
    virtual void printSharedCategories(const HTCategoryMap& categories, const HTProcessGroup& sharedWith,
                                       const HTProcess& forProcess, bool hasProcessView,
                                       const HTMemoryTotals& total) = 0;
    // Null: the process has no auxiliary data.
    virtual void printProcessAuxData(const std::shared_ptr<HTAuxDataMap>& auxData) = 0;
    virtual void printProcessesWithWarnings(const ProcessList& processesWithWarnings,
                                            const ProcessList& processesWithErrors,
                                            const std::vector<std::string>& globalErrors) = 0;
    virtual void printSummaryCategories(const HTCategoryMap& categories, const HTMemoryTotals& total,
                                        bool hadErrors) = 0;
    virtual void printGlobalAuxData(const std::shared_ptr<HTAuxDataMap>& auxData) = 0;
    virtual void end() = 0;
};
