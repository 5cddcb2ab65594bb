#pragma once

// A formatter that writes every call it receives as one line of text into a
// shared log, so that tests can compare whole reports, call order included.
// Sizes are shown in 4 KiB pages.

#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "model/HTCategoryMap.h"
#include "model/HTMemoryCategory.h"
#include "output/HTOutputFormatter.h"
#include "process/HTProcess.h"
#include "process/HTProcessGroup.h"

#include <memory>
#include <string>
#include <vector>

class HTRecordingFormatter : public HTOutputFormatter {
public:
    using Log = std::vector<std::string>;

    HTRecordingFormatter(std::string tag, std::shared_ptr<Log> log, bool listsRegions = false)
        : tag_(std::move(tag)), log_(std::move(log)), listsRegions_(listsRegions)
    {
    }

    static std::string pages(uint64_t bytes) { return std::to_string(bytes / 4096); }
    static std::string totals(const HTMemoryTotals& t)
    {
        return "d" + pages(t.dirty) + " s" + pages(t.swapped) + " c" + pages(t.clean) + " r" + pages(t.reclaimable) +
            " w" + pages(t.wired) + " n" + std::to_string(t.regions);
    }
    static std::string categories(const HTCategoryMap& map)
    {
        std::string text = "[";
        for (const auto& [key, category] : map) {
            if (text.size() > 1) text += ", ";
            text += key + "(" +
                totals({category->totalDirtySize(), category->totalSwappedSize(), category->totalCleanSize(),
                        category->totalReclaimableSize(), category->totalWiredSize(),
                        static_cast<uint32_t>(category->totalRegions())}) +
                ")";
        }
        return text + "]";
    }
    static std::string pids(const HTOutputFormatter::ProcessList& processes)
    {
        std::string text = "{";
        for (const auto& process : processes) text += (text.size() > 1 ? "," : "") + std::to_string(process->pid());
        return text + "}";
    }
    static std::string aux(const std::shared_ptr<HTAuxDataMap>& data)
    {
        if (!data) return "none";
        std::string text = "{";
        for (const auto& [key, value] : *data) {
            auto* datum = dynamic_cast<HTAuxData*>(value.get());
            text += (text.size() > 1 ? "," : "") + key + "=" + (datum ? std::to_string(datum->value()) : "map");
        }
        return text + "}";
    }

    bool respondsToSpanlistLikeOutput() const override { return listsRegions_; }
    void printSpanlistLikeOutputForProcess(const HTProcess& process, const RegionList& regions) override
    {
        add("listing " + std::to_string(process.pid()) + " regions=" + std::to_string(regions.size()));
    }
    void printProcessHeader(const HTProcess& process) override { add("header " + std::to_string(process.pid())); }
    void printProcessTotal(uint64_t heft, const HTProcess& process) override
    {
        add("heft " + std::to_string(process.pid()) + " " + pages(heft));
    }
    void endProcessHeader(const HTProcess& process) override { add("endHeader " + std::to_string(process.pid())); }
    void printProcessCategories(const HTCategoryMap& map, const HTMemoryTotals& total) override
    {
        add("private " + categories(map) + " total " + totals(total));
    }
    void printSharedCategories(const HTCategoryMap& map, const HTProcessGroup& group, const HTProcess& process,
                               bool hasProcessView, const HTMemoryTotals& total) override
    {
        add("shared " + pids(group.processes()) + " for " + std::to_string(process.pid()) +
            (hasProcessView ? " view " : " ") + categories(map) + " total " + totals(total));
    }
    void printProcessAuxData(const std::shared_ptr<HTAuxDataMap>& data) override { add("aux " + aux(data)); }
    void printProcessesWithWarnings(const ProcessList& warned, const ProcessList& failed,
                                    const std::vector<std::string>& globalErrors) override
    {
        std::string errors;
        for (const auto& error : globalErrors) errors += " '" + error + "'";
        add("diagnostics warnings" + pids(warned) + " errors" + pids(failed) + errors);
    }
    void printSummaryCategories(const HTCategoryMap& map, const HTMemoryTotals& total, bool hadErrors) override
    {
        add("summary " + categories(map) + " total " + totals(total) + (hadErrors ? " hadErrors" : ""));
    }
    void printGlobalAuxData(const std::shared_ptr<HTAuxDataMap>& data) override { add("globalAux " + aux(data)); }
    void end() override { add("end"); }

private:
    void add(std::string line) { log_->push_back(tag_ + " " + line); }

    std::string tag_;
    std::shared_ptr<Log> log_;
    bool listsRegions_;
};
