#include "output/HTOutputFormatterText.h"

#include "base/HTAssert.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "model/HTCategoryMap.h"
#include "model/HTMemoryCategory.h"
#include "model/HTMemoryRegion.h"
#include "output/HTSizeText.h"
#include "output/HTTerminalText.h"
#include "process/HTProcess.h"
#include "process/HTProcessGroup.h"

#include <algorithm>
#include <charconv>
#include <cstring>
#include <functional>

namespace {

constexpr const char* kModule = "HTOutputFormatterText";
constexpr const char* kEquals = "==========";
constexpr const char* kDashes = "---";

// The widest a size column gets: its width or its longest text.
constexpr size_t kColumnCapacity = 32;
static_assert(kColumnCapacity >= kHTSizeTextCapacity);

// Writes `text` right-aligned in `width` columns, as printf's "%*s": a
// longer text is never cut. Returns the end of what was written.
char* putRightAligned(char* out, std::string_view text, int width)
{
    if (static_cast<size_t>(width) > text.size()) {
        const size_t pad = static_cast<size_t>(width) - text.size();
        std::memset(out, ' ', pad);
        out += pad;
    }
    std::memcpy(out, text.data(), text.size());
    return out + text.size();
}

// Whole pages holding `bytes`, rounded up; no pages without a page size.
uint64_t pagesForSize(uint64_t bytes, uint64_t pageSize)
{
    if (pageSize == 0) return 0;
    return bytes / pageSize + (bytes % pageSize != 0 ? 1 : 0);
}

// The sort columns and the rows they order; every comparison is "a comes
// before b".
using CategoryOrder = std::function<bool(const HTCategoryMap::Entry&, const HTCategoryMap::Entry&)>;

template<typename Field>
CategoryOrder descendingBy(Field field)
{
    return [field](const HTCategoryMap::Entry& a, const HTCategoryMap::Entry& b) {
        return field(*a.second) > field(*b.second);
    };
}

uint64_t dirtyPlusSwapped(const HTMemoryCategory& category)
{
    return category.totalDirtySize() + category.totalSwappedSize();
}

CategoryOrder orderForSortColumn(const std::string& sort)
{
    if (sort == "Dirty") {
        return [](const HTCategoryMap::Entry& a, const HTCategoryMap::Entry& b) {
            const HTMemoryCategory& x = *a.second;
            const HTMemoryCategory& y = *b.second;
            if (dirtyPlusSwapped(x) != dirtyPlusSwapped(y)) return dirtyPlusSwapped(x) > dirtyPlusSwapped(y);
            if (x.totalReclaimableSize() != y.totalReclaimableSize())
                return x.totalReclaimableSize() > y.totalReclaimableSize();
            return x.totalCleanSize() > y.totalCleanSize();
        };
    }
    if (sort == "Swapped") return descendingBy([](const HTMemoryCategory& c) { return c.totalSwappedSize(); });
    if (sort == "Clean") return descendingBy([](const HTMemoryCategory& c) { return c.totalCleanSize(); });
    if (sort == "Reclaimable") return descendingBy([](const HTMemoryCategory& c) { return c.totalReclaimableSize(); });
    if (sort == "Wired") return descendingBy([](const HTMemoryCategory& c) { return c.totalWiredSize(); });
    if (sort == "Regions") return descendingBy([](const HTMemoryCategory& c) { return c.totalRegions(); });
    if (sort == "Category") {
        // std::string compares characters as unsigned codes.
        return [](const HTCategoryMap::Entry& a, const HTCategoryMap::Entry& b) { return a.first < b.first; };
    }
    HT_FATAL(kModule, "Unhandled text sort column");
}

}  // namespace

HTOutputFormatterText::HTOutputFormatterText(const HTSettings& settings, FILE* output)
    : summaryFormat_(settings.summaryFormat),
      sort_(settings.textSort),
      output_(output),
      breakDownPhysHeft_(settings.breakDownPhysHeft)
{
    options_ = settings.textOptions;
    if (options_ & HTTextOptionSwapped) swappedColumnName_ = "(Swapped)";
    if (options_ & HTTextOptionWired) wiredColumnName_ = "(Wired)";
}

std::string HTOutputFormatterText::formattedStringForSize(uint64_t size) const
{
    char text[kHTSizeTextCapacity];
    return std::string(text, formatSize(size, text));
}

size_t HTOutputFormatterText::formatSize(uint64_t size, char* out) const
{
    switch (summaryFormat_) {
    case HTTextFormatBytes:
        return htBytesText(size, out);
    case HTTextFormatFormatted:
        return htHumanizedText(size, out);
    case HTTextFormatPages:
        return htPagesText(pagesForSize(size, pageSize_), out);
    default:
        HT_FATAL(kModule, "Unhandled summary format");
    }
}

std::optional<std::string_view> HTOutputFormatterText::shortenedComponent(std::string_view name) const
{
    if (options_ & HTTextOptionWide) return std::nullopt;
    size_t end = name.find_last_not_of('/');
    // Nothing but slashes (or nothing at all): there is no shorter form.
    if (end == std::string_view::npos) return std::nullopt;
    size_t slash = name.rfind('/', end);
    size_t begin = slash == std::string_view::npos ? 0 : slash + 1;
    std::string_view last = name.substr(begin, end + 1 - begin);
    if (last.size() == name.size()) return std::nullopt;
    return last;
}

std::optional<std::string> HTOutputFormatterText::_truncatedNameForString(const std::optional<std::string>& name) const
{
    if (!name) return name;
    std::optional<std::string_view> last = shortenedComponent(*name);
    if (!last) return name;
    return ".../" + std::string(*last);
}

std::vector<const HTCategoryMap::Entry*> HTOutputFormatterText::sortedEntries(const HTCategoryMap& categories) const
{
    CategoryOrder order = orderForSortColumn(sort_);
    std::vector<const HTCategoryMap::Entry*> entries;
    entries.reserve(categories.size());
    for (const auto& entry : categories) entries.push_back(&entry);
    // Stable, so that equal rows keep the map's order and the report does
    // not change from run to run.
    std::stable_sort(entries.begin(), entries.end(),
                     [&order](const HTCategoryMap::Entry* a, const HTCategoryMap::Entry* b) { return order(*a, *b); });
    return entries;
}

std::vector<std::string> HTOutputFormatterText::_sortedKeysForCategories(const HTCategoryMap& categories) const
{
    std::vector<std::string> keys;
    for (const HTCategoryMap::Entry* entry : sortedEntries(categories)) keys.push_back(entry->first);
    return keys;
}

HTOutputFormatterText::ColumnWidths HTOutputFormatterText::columnWidths() const
{
    const bool narrow = summaryFormat_ == HTTextFormatFormatted;
    const int extra = narrow ? 11 : 14;
    return ColumnWidths{
        narrow ? 7 : 11,  swappedColumnName_ ? extra : 0, narrow ? 11 : 14,
        narrow ? 13 : 14, wiredColumnName_ ? extra : 0,
    };
}

char* HTOutputFormatterText::putSize(char* out, uint64_t size, int width) const
{
    char text[kHTSizeTextCapacity];
    return putRightAligned(out, std::string_view(text, formatSize(size, text)), width);
}

void HTOutputFormatterText::writeLine()
{
    std::fwrite(line_.data(), 1, line_.size(), output_);
    line_.clear();
}

void HTOutputFormatterText::printColumnsRow(const std::string_view (&columns)[5], std::string_view regions,
                                            std::string_view category)
{
    const ColumnWidths w = columnWidths();
    const int widths[5] = {w.dirty, w.swapped, w.clean, w.reclaimable, w.wired};
    char row[8 * kColumnCapacity];
    char* end = row;
    for (size_t i = 0; i < 5; ++i) end = putRightAligned(end, columns[i], widths[i]);
    *end++ = ' ';
    end = putRightAligned(end, regions, 10);
    line_.append(row, end);
    line_.append("    ");
    line_.append(category);
    line_.append("\n");
    writeLine();
}

void HTOutputFormatterText::printHeadingRow()
{
    printColumnsRow({"Dirty", swappedColumnName_ ? *swappedColumnName_ : "", "Clean", "Reclaimable",
                     wiredColumnName_ ? *wiredColumnName_ : ""},
                    "Regions", "Category");
}

void HTOutputFormatterText::printDashRow()
{
    printColumnsRow({kDashes, swappedColumnName_ ? kDashes : "", kDashes, kDashes, wiredColumnName_ ? kDashes : ""},
                    kDashes, kDashes);
}

void HTOutputFormatterText::printSizeRow(uint64_t dirty, uint64_t swapped, uint64_t clean, uint64_t reclaimable,
                                         uint64_t wired, long long regions, std::string_view name,
                                         const std::optional<std::string>& detail)
{
    // The figures, of bounded width, go through a buffer on the stack.
    const ColumnWidths w = columnWidths();
    char figures[6 * kColumnCapacity];
    char* end = putSize(figures, dirty, w.dirty);
    if (swappedColumnName_) end = putSize(end, swapped, w.swapped);
    end = putSize(end, clean, w.clean);
    end = putSize(end, reclaimable, w.reclaimable);
    if (wiredColumnName_) end = putSize(end, wired, w.wired);
    *end++ = ' ';
    char count[24];
    end = putRightAligned(
        end, std::string_view(count, std::to_chars(count, count + sizeof(count), regions).ptr - count), 10);
    line_.append(figures, end);
    line_.append("    ");
    htAppendTerminalSafe(line_, name);
    if (detail) {
        line_.append(" ");
        if (std::optional<std::string_view> last = shortenedComponent(*detail)) {
            line_.append(".../");
            htAppendTerminalSafe(line_, *last);
        } else {
            htAppendTerminalSafe(line_, *detail);
        }
    }
    line_.append("\n");
    writeLine();
}

void HTOutputFormatterText::_printCategories(const HTCategoryMap& categories)
{
    for (const HTCategoryMap::Entry* entry : sortedEntries(categories)) {
        const HTMemoryCategory& category = *entry->second;
        const std::optional<std::string>& name = category.name();
        printSizeRow(category.totalDirtySize() + category.totalSwappedSize(), category.totalSwappedSize(),
                     category.totalCleanSize(), category.totalReclaimableSize(), category.totalWiredSize(),
                     category.totalRegions(), name ? *name : entry->first, category.detailedName());
    }
}

void HTOutputFormatterText::_printTotalFooter(const HTMemoryTotals& total)
{
    printDashRow();
    printSizeRow(total.dirty + total.swapped, total.swapped, total.clean, total.reclaimable, total.wired, total.regions,
                 "TOTAL", std::nullopt);
}

void HTOutputFormatterText::_printPhysHeftBreakdownEnabled()
{
    if (!breakDownPhysHeft_) std::fprintf(output_, "VM Object Dirty Analysis: Enabled\n");
}

void HTOutputFormatterText::appendEqualsRule()
{
    // Ten signs for every column shown.
    const int tens = 7 + (swappedColumnName_ ? 1 : 0) + (wiredColumnName_ ? 1 : 0);
    for (int i = 0; i < tens; ++i) line_.append(kEquals);
}

void HTOutputFormatterText::printEqualsRule()
{
    appendEqualsRule();
    writeLine();
}

void HTOutputFormatterText::printTable(const HTCategoryMap& categories, const HTMemoryTotals& total)
{
    printHeadingRow();
    printDashRow();
    _printCategories(categories);
    _printTotalFooter(total);
}

void HTOutputFormatterText::printProcessCategories(const HTCategoryMap& categories, const HTMemoryTotals& total)
{
    printTable(categories, total);
    std::fputc('\n', output_);
}

void HTOutputFormatterText::printSharedCategories(const HTCategoryMap& categories, const HTProcessGroup& sharedWith,
                                                  const HTProcess& forProcess, bool hasProcessView,
                                                  const HTMemoryTotals& total)
{
    const auto& members = sharedWith.processes();
    line_.append("Shared with");
    if (members.size() < 21) {
        // The others, separated by commas.
        bool first = true;
        for (const auto& member : members) {
            if (member->isEqual(forProcess)) continue;
            line_.append(first ? " " : ", ");
            htAppendTerminalSafe(line_, member->displayString());
            first = false;
        }
        line_.append(":\n");
    } else {
        line_.append(" ");
        line_.append(std::to_string(members.size()));
        line_.append(" processes:\n");
    }
    writeLine();
    printProcessCategories(categories, total);
}

void HTOutputFormatterText::printSummaryCategories(const HTCategoryMap& categories, const HTMemoryTotals& total,
                                                   bool hadErrors)
{
    _printPhysHeftBreakdownEnabled();
    // A one-process report has said everything in the process's own table.
    if (processCount_ == 1) return;
    printEqualsRule();
    std::fprintf(output_, "\n");
    std::fprintf(output_, "Summary Heft: %s%s\n", formattedStringForSize(total.dirty + total.swapped).c_str(),
                 hadErrors ? " (may be invalid due to errors)" : "");
    printEqualsRule();
    std::fprintf(output_, "\n\n");
    printTable(categories, total);
}

void HTOutputFormatterText::end() { std::fflush(output_); }

void HTOutputFormatterText::printSpanlistLikeOutputForProcess(const HTProcess& process, const RegionList& regions)
{
    const bool swapped = swappedColumnName_.has_value();
    const bool wired = wiredColumnName_.has_value();
    std::fprintf(output_, "%s\n\n", htTerminalSafe(process.displayString()).c_str());
    std::fprintf(output_,
                 "           start                end  [objectid]      VRT     DRT%*s     CLN     RCL%*s   tag "
                 "(detail)\n",
                 swapped ? 8 : 0, swapped ? "     SWP" : "", wired ? 8 : 0, wired ? "    WIRE" : "");
    std::fprintf(output_,
                 "      ----------         ----------  ----------    -----   -----%*s   -----   -----%*s   "
                 "------------\n",
                 swapped ? 8 : 0, swapped ? "   -----" : "", wired ? 8 : 0, wired ? "   -----" : "");

    const uint64_t pageSize = process.pageSize();
    auto pages = [pageSize](uint64_t bytes) { return static_cast<unsigned long long>(pagesForSize(bytes, pageSize)); };
    for (const auto& region : regions) {
        const unsigned long long objectId = region->object_id() & 0xffffffffffULL;
        if (region->start() != HTNoAddress) {
            std::fprintf(output_, "%16llx - %16llx [%10llx]", static_cast<unsigned long long>(region->start()),
                         static_cast<unsigned long long>(region->start() + region->size()), objectId);
        } else {
            std::fprintf(output_, "        unmapped -         unmapped [%10llx]", objectId);
        }
        std::fprintf(output_, " %7llu %7llu", pages(region->size()),
                     pages(region->dirtySize() + region->swappedSize()));
        if (swapped) std::fprintf(output_, " %7llu", pages(region->swappedSize()));
        std::fprintf(output_, " %7llu %7llu", pages(region->cleanNonSpecSize()), pages(region->reclaimableSize()));
        if (wired) std::fprintf(output_, " %7llu", pages(region->wiredSize()));

        const std::optional<std::string>& name = region->name();
        std::optional<std::string> detail = _truncatedNameForString(region->detailedName());
        std::fprintf(output_, "   %s%s%s\n", name ? htTerminalSafe(*name).c_str() : "", detail ? " " : "",
                     detail ? htTerminalSafe(*detail).c_str() : "");
    }
    std::fprintf(output_, "\n");
}

void HTOutputFormatterText::printProcessHeader(const HTProcess& process)
{
    if (processCount_ < 2) ++processCount_;
    pageSize_ = process.pageSize();

    printEqualsRule();
    std::fprintf(output_, "\n");
    // The line stays open: without warnings or errors the heft follows on it.
    std::fprintf(output_, "%s: %s-bit", htTerminalSafe(process.displayString()).c_str(),
                 process.is64bit() ? "64" : "32");

    const auto& warnings = process.warnings();
    if (!warnings.empty()) {
        std::fprintf(output_, "\nWarnings were encountered while examining the process.\n");
        for (const auto& warning : warnings) std::fprintf(output_, "\t%s\n", htTerminalSafe(warning).c_str());
    }
    const auto errors = process.errors();
    if (!errors.empty()) {
        std::fprintf(output_, "\nErrors were encountered while examining the process. No results gathered.\n");
        for (const auto& error : errors) std::fprintf(output_, "\t%s\n", htTerminalSafe(error).c_str());
    }
}

void HTOutputFormatterText::printProcessTotal(uint64_t processHeft, const HTProcess& process)
{
    std::fprintf(output_, "\tHeft: %s (%lu bytes per page)\n", formattedStringForSize(processHeft).c_str(),
                 static_cast<unsigned long>(process.pageSize()));
}

void HTOutputFormatterText::endProcessHeader(const HTProcess& process)
{
    printEqualsRule();
    std::fprintf(output_, "\n\n");
}

void HTOutputFormatterText::printProcessesWithWarnings(const ProcessList& processesWithWarnings,
                                                       const ProcessList& processesWithErrors,
                                                       const std::vector<std::string>& globalErrors)
{
    if (!processesWithWarnings.empty()) {
        std::fprintf(output_, "\nWarnings were encountered while examining the following processes:\n");
        for (const auto& process : processesWithWarnings)
            std::fprintf(output_, "\t%s\n", htTerminalSafe(process->name()).c_str());
    }
    if (!processesWithErrors.empty()) {
        std::fprintf(output_, "\nErrors were encountered while examining the following processes:\n");
        for (const auto& process : processesWithErrors)
            std::fprintf(output_, "\t%s\n", htTerminalSafe(process->name()).c_str());
    }
    if (!globalErrors.empty()) {
        std::fprintf(output_, "\nErrors were encountered:\n");
        for (const auto& error : globalErrors) std::fprintf(output_, "\t%s\n", htTerminalSafe(error).c_str());
    }
    if (!processesWithErrors.empty() || !globalErrors.empty())
        std::fprintf(output_, "\nDue to errors, summary results may be invalid\n");
}

void HTOutputFormatterText::printProcessAuxData(const std::shared_ptr<HTAuxDataMap>& auxData)
{
    if (!auxData) return;
    printAuxData(*auxData);
    std::fprintf(output_, "\n");
}

void HTOutputFormatterText::printGlobalAuxData(const std::shared_ptr<HTAuxDataMap>& auxData)
{
    // A one-process report has printed the same data already.
    if (processCount_ == 1) return;
    std::fprintf(output_, "\n");
    if (auxData && !auxData->empty()) {
        printAuxData(*auxData);
        std::fprintf(output_, "\n");
    }
}

void HTOutputFormatterText::printAuxData(const HTAuxDataMap& auxData)
{
    std::fprintf(output_, "Auxiliary data:\n");
    _printAuxData(auxData, 1);
}

void HTOutputFormatterText::_printAuxData(const HTAuxDataMap& auxData, uint32_t indent)
{
    for (const auto& [key, value] : auxData) {
        for (uint32_t i = 0; i < indent; ++i) std::fputc('\t', output_);
        if (value->isContainer()) {
            std::fprintf(output_, "%s:\n", key.c_str());
            _printAuxData(static_cast<const HTAuxDataMap&>(*value), indent + 1);
        } else {
            const auto& datum = static_cast<const HTAuxData&>(*value);
            std::fprintf(output_, "%s: %s\n", key.c_str(),
                         formattedStringForSize(static_cast<uint64_t>(datum.value())).c_str());
        }
    }
}
