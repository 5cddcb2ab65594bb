#pragma once

#include "model/HTCategoryMap.h"
#include "output/HTOutputFormatter.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_set>
#include <vector>

class HTAuxDataType;
class HTMemoryRegion;

// Writes the report as one compact JSON document to a file. The document is
// streamed out as the calls arrive; the only thing held back is the list of
// shared tables, which goes at the end of the root object. Every size is a
// count of bytes.
//
// Every string is escaped as JSON requires, and any byte that is not part of
// a well-formed UTF-8 sequence is written as U+FFFD, so that the file always
// parses whatever the names of processes, files and kernel objects hold.
class HTOutputFormatterJSON : public HTOutputFormatter {
public:
    // One table of shared memory, kept until end() writes it.
    struct SharedEntry {
        // The pids of the group's members, in the group's member order.
        std::vector<int32_t> pids;
        // Holds the categories alive until they are written.
        HTCategoryMap categories;
        // Set only for a table that gives one process's own view.
        std::optional<int32_t> specificPid;
    };

    // Opens (creates or truncates) the file and writes the head of the
    // document. `breakDownPhysHeft` is the run's counting mode; the kernel
    // page size stands in when no process brought a page size of its own.
    // Null, with `errorText` filled, when the file cannot be opened.
    static std::shared_ptr<HTOutputFormatterJSON> initWithPath(const std::string& path, bool breakDownPhysHeft,
                                                               uint64_t kernelPageSize, std::string* errorText);
    ~HTOutputFormatterJSON() override;
    HTOutputFormatterJSON(const HTOutputFormatterJSON&) = delete;
    HTOutputFormatterJSON& operator=(const HTOutputFormatterJSON&) = delete;

    // --- fields ----------------------------------------------------------
    // The page size the document ends with: that of the first process whose
    // header was written, 0 before.
    uint64_t pageSize() const { return pageSize_; }
    void setPageSize(uint64_t value) { pageSize_ = value; }
    // Set by end() when the file could not be written whole; the file is
    // then left as it was before the run.
    const std::optional<std::string>& writeError() const { return writeError_; }

    // --- HTOutputFormatter -------------------------------------------------
    // The region listing only switches the per-process "regions" arrays on.
    bool respondsToSpanlistLikeOutput() const override { return true; }
    void printSpanlistLikeOutputForProcess(const HTProcess& process, const RegionList& regions) override;
    void printProcessHeader(const HTProcess& process) override;
    void printProcessTotal(uint64_t processHeft, const HTProcess& process) override;
    void endProcessHeader(const HTProcess& process) override {}
    void printProcessCategories(const HTCategoryMap& categories, const HTMemoryTotals& total) override;
    void printSharedCategories(const HTCategoryMap& categories, const HTProcessGroup& sharedWith,
                               const HTProcess& forProcess, bool hasProcessView, const HTMemoryTotals& total) override;
    void printProcessAuxData(const std::shared_ptr<HTAuxDataMap>& auxData) override;
    void printProcessesWithWarnings(const ProcessList& processesWithWarnings, const ProcessList& processesWithErrors,
                                    const std::vector<std::string>& globalErrors) override;
    void printSummaryCategories(const HTCategoryMap& categories, const HTMemoryTotals& total, bool hadErrors) override;
    void printGlobalAuxData(const std::shared_ptr<HTAuxDataMap>& auxData) override;
    void end() override;

    // The entries of a categories object, without its braces: one per
    // category, under the category's full name.
    void JSONForCategories(const HTCategoryMap& categories);
    // One auxiliary value: a number for a datum, an object for a map, 0 for
    // nothing (null).
    void JSONForAuxData(const HTAuxDataType* value);

private:
    struct Writer;

    HTOutputFormatterJSON(std::unique_ptr<Writer> writer, uint64_t kernelPageSize);

    // The writer's steps; each does nothing once the file is closed.
    void startObject();
    void endObject();
    void startArray();
    void endArray();
    void key(std::string_view name);
    void string(std::string_view value);
    void number(uint64_t value);
    void signedNumber(int64_t value);
    void boolean(bool value);

    void writeStringArray(const std::vector<std::string>& strings);
    void writeRegion(const HTMemoryRegion& region);
    void writeCategoriesObject(const HTCategoryMap& categories);

    bool verbose_ = false;
    std::vector<SharedEntry> shared_;
    // Groups are frozen and live until the report ends, so their address
    // identifies them for the whole report.
    std::unordered_set<const HTProcessGroup*> addedProcessGroups_;
    uint64_t pageSize_ = 0;
    uint64_t kernelPageSize_;
    std::unique_ptr<Writer> json_;
    std::optional<std::string> writeError_;
};
