#include "output/HTOutputFormatterJSON.h"

#include "base/HTAssert.h"
#include "base/HTOutputFile.h"
#include "base/HTValidUTF8.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "model/HTMemoryCategory.h"
#include "model/HTMemoryRegion.h"
#include "process/HTProcess.h"
#include "process/HTProcessGroup.h"

#include <rapidjson/filewritestream.h>
#include <rapidjson/writer.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

// The output file and the streaming writer on it. The file keeps its name
// only once the document is finished and every byte written.
struct HTOutputFormatterJSON::Writer {
    Writer(std::unique_ptr<HTOutputFile> f, std::string p)
        : file(std::move(f)), path(std::move(p)), stream(file->stream(), buffer, sizeof(buffer)), json(stream)
    {
    }

    std::unique_ptr<HTOutputFile> file;
    std::string path;
    char buffer[64 * 1024];
    rapidjson::FileWriteStream stream;
    rapidjson::Writer<rapidjson::FileWriteStream> json;
    // Where strings that are not valid UTF-8 are mended.
    std::string scratch;
};

std::shared_ptr<HTOutputFormatterJSON> HTOutputFormatterJSON::initWithPath(const std::string& path,
                                                                           bool breakDownPhysHeft,
                                                                           uint64_t kernelPageSize,
                                                                           std::string* errorText)
{
    std::string reason;
    std::unique_ptr<HTOutputFile> file = HTOutputFile::open(path, &reason);
    if (!file) {
        if (errorText) *errorText = "Unable to open JSON output file '" + path + "': " + reason;
        return nullptr;
    }
    std::shared_ptr<HTOutputFormatterJSON> formatter(
        new HTOutputFormatterJSON(std::make_unique<Writer>(std::move(file), path), kernelPageSize));

    formatter->startObject();
    formatter->key("unit");
    formatter->string("byte");
    formatter->key("bytes per unit");
    formatter->number(1);
    if (!breakDownPhysHeft) {
        formatter->key("vm_object_dirty_analysis");
        formatter->boolean(true);
    }
    formatter->key("processes");
    formatter->startArray();
    return formatter;
}

HTOutputFormatterJSON::HTOutputFormatterJSON(std::unique_ptr<Writer> writer, uint64_t kernelPageSize)
    : kernelPageSize_(kernelPageSize), json_(std::move(writer))
{
}

HTOutputFormatterJSON::~HTOutputFormatterJSON() = default;

// --- writer steps ----------------------------------------------------------
// RapidJSON's writer keeps track of the commas between elements and escapes
// double quotes, backslashes and control characters in strings.

void HTOutputFormatterJSON::startObject()
{
    if (json_) json_->json.StartObject();
}

void HTOutputFormatterJSON::endObject()
{
    if (json_) json_->json.EndObject();
}

void HTOutputFormatterJSON::startArray()
{
    if (json_) json_->json.StartArray();
}

void HTOutputFormatterJSON::endArray()
{
    if (json_) json_->json.EndArray();
}

void HTOutputFormatterJSON::key(std::string_view name)
{
    if (!json_) return;
    std::string_view valid = htValidUTF8(name, json_->scratch);
    json_->json.Key(valid.data(), static_cast<rapidjson::SizeType>(valid.size()));
}

void HTOutputFormatterJSON::string(std::string_view value)
{
    if (!json_) return;
    std::string_view valid = htValidUTF8(value, json_->scratch);
    json_->json.String(valid.data(), static_cast<rapidjson::SizeType>(valid.size()));
}

void HTOutputFormatterJSON::number(uint64_t value)
{
    if (json_) json_->json.Uint64(value);
}

void HTOutputFormatterJSON::signedNumber(int64_t value)
{
    if (json_) json_->json.Int64(value);
}

void HTOutputFormatterJSON::boolean(bool value)
{
    if (json_) json_->json.Bool(value);
}

void HTOutputFormatterJSON::writeStringArray(const std::vector<std::string>& strings)
{
    startArray();
    for (const auto& text : strings) string(text);
    endArray();
}

// A region's own figures: dirty without swapped, and only the sizes that
// are not zero. Regions without an address get no "addr".
void HTOutputFormatterJSON::writeRegion(const HTMemoryRegion& region)
{
    startObject();
    key("id");
    number(region.object_id());
    key("name");
    string(region.fullName().value_or(""));
    if (region.start() != HTNoAddress) {
        key("addr");
        number(region.start());
    }
    key("vsize");
    number(region.size());
    const std::pair<const char*, uint64_t> optionalFigures[] = {
        {"offset", region.offset()},
        {"dirty", region.dirtySize()},
        {"swapped", region.swappedSize()},
        {"clean", region.cleanNonSpecSize()},
        {"reclaimable", region.reclaimableSize()},
        {"wired", region.wiredSize()},
    };
    for (const auto& [name, value] : optionalFigures) {
        if (value == 0) continue;
        key(name);
        number(value);
    }
    endObject();
}

void HTOutputFormatterJSON::writeCategoriesObject(const HTCategoryMap& categories)
{
    startObject();
    JSONForCategories(categories);
    endObject();
}

// --- the report ------------------------------------------------------------

void HTOutputFormatterJSON::printSpanlistLikeOutputForProcess(const HTProcess& process, const RegionList& regions)
{
    verbose_ = true;
}

// The process object stays open until printProcessAuxData.
void HTOutputFormatterJSON::printProcessHeader(const HTProcess& process)
{
    startObject();
    key("name");
    string(process.name());
    key("pid");
    signedNumber(process.pid());
    const std::vector<std::string> errors = process.errors();
    if (!errors.empty()) {
        key("errors");
        writeStringArray(errors);
    }
    if (!process.warnings().empty()) {
        key("warnings");
        writeStringArray(process.warnings());
    }
    if (verbose_) {
        key("regions");
        startArray();
        for (const auto& region : process.memoryRegions()) writeRegion(*region);
        endArray();
    }
    if (pageSize_ == 0) pageSize_ = process.pageSize();
}

void HTOutputFormatterJSON::printProcessTotal(uint64_t processHeft, const HTProcess& process)
{
    key("heft");
    number(processHeft);
}

void HTOutputFormatterJSON::printProcessCategories(const HTCategoryMap& categories, const HTMemoryTotals& total)
{
    key("categories");
    writeCategoriesObject(categories);
}

// A table common to all members of a group is collected once, however many
// members report it; a table that gives one process's own view is collected
// for every process that reports it.
void HTOutputFormatterJSON::printSharedCategories(const HTCategoryMap& categories, const HTProcessGroup& sharedWith,
                                                  const HTProcess& forProcess, bool hasProcessView,
                                                  const HTMemoryTotals& total)
{
    SharedEntry entry;
    if (hasProcessView) {
        entry.specificPid = forProcess.pid();
    } else if (!addedProcessGroups_.insert(&sharedWith).second) {
        return;
    }
    for (const auto& member : sharedWith.processes()) entry.pids.push_back(member->pid());
    entry.categories = categories;
    shared_.push_back(std::move(entry));
}

void HTOutputFormatterJSON::printProcessAuxData(const std::shared_ptr<HTAuxDataMap>& auxData)
{
    key("auxiliary");
    JSONForAuxData(auxData.get());
    endObject();
}

void HTOutputFormatterJSON::printProcessesWithWarnings(const ProcessList& processesWithWarnings,
                                                       const ProcessList& processesWithErrors,
                                                       const std::vector<std::string>& globalErrors)
{
    endArray();  // "processes"

    key("errors");
    startArray();
    for (const auto& text : globalErrors) string(text);
    for (const auto& process : processesWithErrors) {
        for (const auto& text : process->errors()) string(text);
    }
    endArray();

    key("warnings");
    startArray();
    for (const auto& process : processesWithWarnings) {
        for (const auto& text : process->warnings()) string(text);
    }
    endArray();
}

void HTOutputFormatterJSON::printSummaryCategories(const HTCategoryMap& categories, const HTMemoryTotals& total,
                                                   bool hadErrors)
{
    key("summary");
    startObject();
    JSONForCategories(categories);
    key("total");
    startObject();
    key("dirty");
    number(total.dirty + total.swapped);
    key("swapped");
    number(total.swapped);
    key("clean");
    number(total.clean);
    key("reclaimable");
    number(total.reclaimable);
    key("wired");
    number(total.wired);
    key("regions");
    number(total.regions);
    endObject();
    endObject();

    key("total heft");
    number(total.dirty + total.swapped);
}

void HTOutputFormatterJSON::printGlobalAuxData(const std::shared_ptr<HTAuxDataMap>& auxData)
{
    key("auxiliary");
    JSONForAuxData(auxData.get());
}

void HTOutputFormatterJSON::end()
{
    key("shared");
    startArray();
    for (const auto& entry : shared_) {
        startObject();
        key("pids");
        startArray();
        for (int32_t pid : entry.pids) signedNumber(pid);
        endArray();
        if (entry.specificPid) {
            key("specific_to_pid");
            signedNumber(*entry.specificPid);
        }
        key("categories");
        writeCategoriesObject(entry.categories);
        endObject();
    }
    endArray();

    if (pageSize_ == 0) pageSize_ = kernelPageSize_;
    key("page size");
    number(pageSize_);
    endObject();

    json_->stream.Flush();
    std::string reason;
    if (!json_->file->commit(&reason))
        writeError_ = "Unable to write JSON output file '" + json_->path + "': " + reason;
    json_.reset();
    shared_.clear();
}

// Category figures: "dirty" counts swapped memory too, as everywhere a
// category is shown. A category without members has no name of its own and
// is filed under its key in the map.
void HTOutputFormatterJSON::JSONForCategories(const HTCategoryMap& categories)
{
    for (const auto& [mapKey, category] : categories) {
        key(category->fullName().value_or(mapKey));
        startObject();
        key("dirty");
        number(category->totalDirtySize() + category->totalSwappedSize());
        key("swapped");
        number(category->totalSwappedSize());
        key("clean");
        number(category->totalCleanSize());
        key("reclaimable");
        number(category->totalReclaimableSize());
        key("wired");
        number(category->totalWiredSize());
        key("regions");
        number(static_cast<uint32_t>(category->totalRegions()));
        endObject();
    }
}

void HTOutputFormatterJSON::JSONForAuxData(const HTAuxDataType* value)
{
    if (!value) {
        number(0);
    } else if (const auto* map = dynamic_cast<const HTAuxDataMap*>(value)) {
        startObject();
        for (const auto& [name, nested] : *map) {
            key(name);
            JSONForAuxData(nested.get());
        }
        endObject();
    } else if (const auto* datum = dynamic_cast<const HTAuxData*>(value)) {
        signedNumber(datum->value());
    } else {
        HT_FATAL("HTOutputFormatterJSON", "auxiliary value is neither a datum nor a map");
    }
}
