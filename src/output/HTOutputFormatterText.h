#pragma once

#include "base/HTSettings.h"
#include "model/HTCategoryMap.h"
#include "output/HTOutputFormatter.h"

#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

class HTAuxDataMap;

// The human-readable report: the region listings, each process's header,
// its category tables and auxiliary data, the run's diagnostics, and the
// summary across processes. Sizes are written in bytes, with a unit prefix
// or in pages after the summary format; the listing always counts pages.
class HTOutputFormatterText : public HTOutputFormatter {
public:
    // The summary format, the option bits and the sort column come from the
    // settings, and so does the counting mode: with the breakdown off the
    // summary says so.
    explicit HTOutputFormatterText(const HTSettings& settings, FILE* output = stdout);

    // The page size sizes in pages are counted in; each process header
    // sets it to that process's.
    void setPageSize(uint64_t value) { pageSize_ = value; }

    // A size as the summary format writes it: "16384 B", "16 KB", "4 pages".
    std::string formattedStringForSize(uint64_t size) const;
    // The same text written into `out`, of at least kHTSizeTextCapacity
    // bytes; returns its length.
    size_t formatSize(uint64_t size, char* out) const;

    // --- HTOutputFormatter ---------------------------------------------------
    bool respondsToSpanlistLikeOutput() const override { return true; }
    void printSpanlistLikeOutputForProcess(const HTProcess& process, const RegionList& regions) override;
    void printProcessHeader(const HTProcess& process) override;
    void printProcessTotal(uint64_t processHeft, const HTProcess& process) override;
    void endProcessHeader(const HTProcess& process) override;
    void printProcessCategories(const HTCategoryMap& categories, const HTMemoryTotals& total) override;
    void printSharedCategories(const HTCategoryMap& categories, const HTProcessGroup& sharedWith,
                               const HTProcess& forProcess, bool hasProcessView, const HTMemoryTotals& total) override;
    void printProcessAuxData(const std::shared_ptr<HTAuxDataMap>& auxData) override;
    void printProcessesWithWarnings(const ProcessList& processesWithWarnings, const ProcessList& processesWithErrors,
                                    const std::vector<std::string>& globalErrors) override;
    void printSummaryCategories(const HTCategoryMap& categories, const HTMemoryTotals& total, bool hadErrors) override;
    void printGlobalAuxData(const std::shared_ptr<HTAuxDataMap>& auxData) override;
    void end() override;

    // "Auxiliary data:" and the map's keys below it, one tab in.
    void printAuxData(const HTAuxDataMap& auxData);

protected:
    // Without the wide option, a path is shortened to ".../" and its last
    // component; a name without "/" stays whole.
    std::optional<std::string> _truncatedNameForString(const std::optional<std::string>& name) const;
    // The keys in row order after the sort column; rows that compare equal
    // keep the map's order.
    std::vector<std::string> _sortedKeysForCategories(const HTCategoryMap& categories) const;
    void _printCategories(const HTCategoryMap& categories);
    void _printTotalFooter(const HTMemoryTotals& total);
    void _printPhysHeftBreakdownEnabled();
    void _printAuxData(const HTAuxDataMap& auxData, uint32_t indent);

private:
    // The widths of the five size columns, 0 for a column that is off.
    struct ColumnWidths {
        int dirty, swapped, clean, reclaimable, wired;
    };
    ColumnWidths columnWidths() const;
    // The rows in the order of the sort column, as _sortedKeysForCategories.
    std::vector<const HTCategoryMap::Entry*> sortedEntries(const HTCategoryMap& categories) const;
    // The last component of a name that is shown shortened; nullopt when
    // the name is shown whole.
    std::optional<std::string_view> shortenedComponent(std::string_view name) const;

    // Rows are built in line_ and written with one call each: the tables
    // make up nearly all of a report of many processes.
    // A size right-aligned in `width` columns at `out`, which has room for
    // the wider of the two; returns the end of what was written.
    char* putSize(char* out, uint64_t size, int width) const;
    void appendEqualsRule();
    void writeLine();

    // A row of five column texts (empty for a column that is off), the
    // region column and the category column, as the heading and dash rows.
    void printColumnsRow(const std::string_view (&columns)[5], std::string_view regions, std::string_view category);
    void printHeadingRow();
    void printDashRow();
    // One row of five sizes, a region count and a name, followed by the
    // detail, when there is one, after a space.
    void printSizeRow(uint64_t dirty, uint64_t swapped, uint64_t clean, uint64_t reclaimable, uint64_t wired,
                      long long regions, std::string_view name, const std::optional<std::string>& detail);
    void printTable(const HTCategoryMap& categories, const HTMemoryTotals& total);
    void printEqualsRule();

    uint8_t processCount_ = 0;
    uint64_t pageSize_ = 0;
    std::optional<std::string> swappedColumnName_;
    std::optional<std::string> wiredColumnName_;
    int64_t summaryFormat_;
    int64_t options_ = 0;
    std::string sort_;
    FILE* output_;
    bool breakDownPhysHeft_;
    std::string line_;
};
