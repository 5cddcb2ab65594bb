#pragma once

#include "base/HTPidMap.h"
#include "model/HTCategoryMap.h"
#include "model/HTIdentitySet.h"
#include "model/HTMemoryTotals.h"

#include <cstdint>
#include <memory>
#include <unordered_map>
#include <vector>

class HTHeftSharingData;
class HTMemoryObject;
class HTOutputFormatter;
class HTProcess;
class HTProcessGroup;

// Puts the report together from what the analysis found and sends it to the
// formatters: every reported process's header, heft, one table per process
// group and auxiliary data; the run's diagnostics; and the summary across
// processes. Categories are keyed by short names with `summarize`, by full
// names without.
class HTHeftReport {
public:
    using ProcessList = std::vector<std::shared_ptr<HTProcess>>;
    using ObjectSet = HTIdentitySet<HTMemoryObject>;
    using FormatterList = std::vector<std::shared_ptr<HTOutputFormatter>>;

    HTHeftReport(const FormatterList& formatters, const HTPidMap<uint64_t>& pidToHeft, bool breakDownPhysHeft,
                 bool summarize);

    // Every process's region listing, to the formatters that write one.
    void printSpanlistLikeOutputForProcesses(const ProcessList& processes);
    // The report of the `reported` processes, in that order; the summary
    // counts every object a visible process among `all` maps.
    void printReport(const ProcessList& reported, const HTHeftSharingData& sharing, const ProcessList& all);

    // The objects as `process` sees them, in categories. `hasProcessView`,
    // when given, learns whether any object looked different to this process
    // than it is as a whole.
    HTCategoryMap _categoriesForObjects(const ObjectSet& objects, HTProcess& process, bool* hasProcessView) const;
    // Every object a visible process maps, once, whole.
    HTCategoryMap _categoriesForAllProcesses(const ProcessList& processes) const;
    static void _totalForCategories(const HTCategoryMap& categories, HTMemoryTotals* outTotal);

private:
    // One table of a process's report: a group's objects as the process
    // sees them, in categories, and their total.
    struct GroupTable {
        HTCategoryMap categories;
        HTMemoryTotals total;
        bool hasProcessView = false;
    };
    using CommonTables = std::unordered_map<const HTProcessGroup*, GroupTable>;

    // The table of `group` for `process`. A shared group whose objects look
    // the same to every process has one table for all its members, made on
    // first use and kept in `common`; any other table is made in `scratch`.
    const GroupTable& tableForGroup(const HTProcessGroup& group, const ObjectSet& objects, HTProcess& process,
                                    CommonTables& common, GroupTable& scratch) const;

    const FormatterList& formatters_;
    const HTPidMap<uint64_t>& pidToHeft_;
    bool breakDownPhysHeft_;
    bool summarize_;
};
