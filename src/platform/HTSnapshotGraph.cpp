#include "platform/HTSnapshotGraph.h"

#include "base/HTStringFormat.h"
#include "platform/linux/HTFileDescriptor.h"
#include "platform/linux/HTPreadFully.h"

#include <rapidjson/document.h>
#include <rapidjson/error/en.h>

#include <cerrno>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <limits>
#include <sys/stat.h>
#include <unistd.h>

namespace {

constexpr uint64_t kMaxU16 = std::numeric_limits<uint16_t>::max();
constexpr uint64_t kMaxU64 = std::numeric_limits<uint64_t>::max();
constexpr uint64_t kMaxPid = std::numeric_limits<int32_t>::max();
// Every disposition bit a page query answers.
constexpr int64_t kDispositionBits = 0x1 | 0x2 | 0x4 | 0x8 | 0x10 | 0x20 | 0x40 | 0x80 | 0x100 | 0x200 | 0x400 | 0x800;
// Identities lie below this (the platform's bound for shared pages).
constexpr uint64_t kIdentityLimit = uint64_t{1} << 58;
constexpr uint32_t kProtectionBits = 7;

// The ending of a noun counted `count` times.
const char* plural(uint64_t count) { return count == 1 ? "" : "s"; }

const char* typeName(const rapidjson::Value& value)
{
    if (value.IsNull()) return "null";
    if (value.IsBool()) return "a boolean";
    if (value.IsString()) return "a string";
    if (value.IsArray()) return "an array";
    if (value.IsObject()) return "an object";
    if (value.IsInt64() || value.IsUint64()) return "a whole number";
    // The parser holds whole numbers beyond 64 bits, and numbers written
    // with a point or an exponent, as doubles.
    const double number = value.GetDouble();
    if (std::fabs(number) >= 0x1p63) return "a number too large";
    return number == std::trunc(number) ? "a number written with a point or exponent" : "a fraction";
}

// Reads the members of one JSON object, each checked for its type and
// range. The first problem found is kept, said with where it lies ("region
// 4 (at 0x1000): ...").
class FieldReader {
public:
    FieldReader(const rapidjson::Value& object, std::string where, std::string& problem)
        : object_(object), where_(std::move(where)), problem_(problem)
    {
    }

    bool ok() const { return problem_.empty(); }

    void fail(const std::string& text)
    {
        if (problem_.empty()) problem_ = where_.empty() ? text : where_ + ": " + text;
    }

    // The member `name`, which must be there unless `optional` (then null
    // when absent), and there once: readers differ on which of two members
    // of one name counts.
    const rapidjson::Value* member(const char* name, bool optional = false)
    {
        if (!ok()) return nullptr;
        auto found = object_.FindMember(name);
        if (found == object_.MemberEnd()) {
            if (!optional) fail(htStringWithFormat("\"%s\" is missing", name));
            return nullptr;
        }
        for (auto other = found + 1; other != object_.MemberEnd(); ++other) {
            if (other->name == found->name) {
                fail(htStringWithFormat("\"%s\" appears more than once", name));
                return nullptr;
            }
        }
        return &found->value;
    }

    uint64_t number(const char* name, uint64_t lowest, uint64_t highest)
    {
        const rapidjson::Value* value = member(name);
        if (value == nullptr) return lowest;
        if (!value->IsUint64()) {
            fail(htStringWithFormat("\"%s\" must be a whole number from %" PRIu64 " to %" PRIu64 ", not %s", name,
                                    lowest, highest, value->IsInt64() ? "a negative number" : typeName(*value)));
            return lowest;
        }
        const uint64_t found = value->GetUint64();
        if (found < lowest || found > highest) {
            fail(htStringWithFormat("\"%s\" is %" PRIu64 ", outside %" PRIu64 " to %" PRIu64, name, found, lowest,
                                    highest));
            return lowest;
        }
        return found;
    }

    bool boolean(const char* name)
    {
        const rapidjson::Value* value = member(name);
        if (value == nullptr) return false;
        if (!value->IsBool()) {
            fail(htStringWithFormat("\"%s\" must be true or false, not %s", name, typeName(*value)));
            return false;
        }
        return value->GetBool();
    }

    std::string string(const char* name)
    {
        const rapidjson::Value* value = member(name);
        if (value == nullptr) return {};
        if (!value->IsString()) {
            fail(htStringWithFormat("\"%s\" must be a string, not %s", name, typeName(*value)));
            return {};
        }
        return std::string(value->GetString(), value->GetStringLength());
    }

private:
    const rapidjson::Value& object_;
    std::string where_;
    std::string& problem_;
};

std::string regionPlace(size_t index, uint64_t address)
{
    return htStringWithFormat("region %zu (at 0x%" PRIx64 ")", index, address);
}

// The page runs of one region, checked against it: [firstPage, count,
// disposition, identity] four numbers a run, ascending without overlap.
bool readPageRuns(const rapidjson::Value& list, FieldReader& fields, uint64_t regionPages,
                  std::vector<HTSnapshotPageRun>& runs, uint64_t& identified, uint64_t& covered)
{
    if (!list.IsArray()) {
        fields.fail(htStringWithFormat("\"pages\" must be an array, not %s", typeName(list)));
        return false;
    }
    if (list.Size() % 4 != 0) {
        fields.fail(htStringWithFormat("\"pages\" holds %u numbers, not four to a run", list.Size()));
        return false;
    }
    uint64_t end = 0;
    runs.reserve(list.Size() / 4);
    for (rapidjson::SizeType i = 0; i < list.Size(); i += 4) {
        const unsigned run = i / 4;
        for (rapidjson::SizeType j = i; j < i + 4; ++j) {
            if (!list[j].IsUint64()) {
                fields.fail(htStringWithFormat("page run %u of \"pages\" must hold whole numbers, not %s", run,
                                               typeName(list[j])));
                return false;
            }
        }
        const uint64_t first = list[i].GetUint64();
        const uint64_t count = list[i + 1].GetUint64();
        const uint64_t disposition = list[i + 2].GetUint64();
        const uint64_t identity = list[i + 3].GetUint64();
        if (count == 0) {
            fields.fail(htStringWithFormat("page run %u of \"pages\" holds no pages", run));
            return false;
        }
        if (first < end) {
            fields.fail(htStringWithFormat("page run %u of \"pages\" starts at page %" PRIu64 ", before page %" PRIu64
                                           ", the end of the run before it: runs must ascend without overlapping",
                                           run, first, end));
            return false;
        }
        if (first > regionPages || count > regionPages - first) {
            fields.fail(htStringWithFormat("page run %u of \"pages\" (%" PRIu64 " page%s from page %" PRIu64
                                           ") runs past page %" PRIu64 ", the end of the region",
                                           run, count, plural(count), first, regionPages));
            return false;
        }
        if (disposition == 0 || (disposition & ~static_cast<uint64_t>(kDispositionBits)) != 0) {
            fields.fail(htStringWithFormat(
                "page run %u of \"pages\" has disposition 0x%" PRIx64 ", which no page query gives", run, disposition));
            return false;
        }
        if (identity != 0 && (identity >= kIdentityLimit || count > kIdentityLimit - identity)) {
            fields.fail(htStringWithFormat("page run %u of \"pages\" gives its %" PRIu64
                                           " page%s identities from %" PRIu64
                                           " on: the largest a page may have is %" PRIu64,
                                           run, count, plural(count), identity, kIdentityLimit - 1));
            return false;
        }
        covered += count;
        if (identity != 0) identified += count;
        if (covered > HTSnapshotGraph::kMaxRunPages || identified > HTSnapshotGraph::kMaxIdentifiedPages) {
            fields.fail(htStringWithFormat("page run %u of \"pages\" takes the snapfile's page runs past the %" PRIu64
                                           " pages (%" PRIu64 " with identities) a snapfile may hold",
                                           run, HTSnapshotGraph::kMaxRunPages, HTSnapshotGraph::kMaxIdentifiedPages));
            return false;
        }
        end = first + count;
        runs.push_back(HTSnapshotPageRun{first, count, static_cast<int32_t>(disposition), identity});
    }
    return true;
}

// One region record, checked on its own and against the region before it.
bool readRegion(const rapidjson::Value& value, size_t index, uint64_t pageSize, uint64_t previousEnd,
                HTSnapshotRegion& region, uint64_t& identified, uint64_t& covered, std::string& problem)
{
    if (!value.IsObject()) {
        problem = htStringWithFormat("region %zu must be an object, not %s", index, typeName(value));
        return false;
    }
    // The place is known once the address is.
    std::string place = htStringWithFormat("region %zu", index);
    auto address = value.FindMember("address");
    if (address != value.MemberEnd() && address->value.IsUint64())
        place = regionPlace(index, address->value.GetUint64());
    FieldReader fields(value, place, problem);
    region.address = fields.number("address", 0, kMaxU64);
    region.length = fields.number("length", 1, kMaxU64);
    if (!fields.ok()) return false;
    if (region.length > kMaxU64 - region.address) {
        fields.fail(
            htStringWithFormat("its length, %" PRIu64 ", runs past the end of the address space", region.length));
        return false;
    }
    if (region.address < previousEnd) {
        fields.fail(htStringWithFormat("it starts below 0x%" PRIx64
                                       ", the end of the region before it: regions must ascend "
                                       "without overlapping",
                                       previousEnd));
        return false;
    }
    region.type = fields.string("type");
    region.path = fields.string("path");
    region.prot = static_cast<uint32_t>(fields.number("prot", 0, kProtectionBits));
    region.maxProt = static_cast<uint32_t>(fields.number("maxProt", 0, kProtectionBits));
    region.offset = fields.number("offset", 0, kMaxU64);
    region.user_tag = static_cast<uint32_t>(fields.number("user_tag", 0, 255));
    region.resident_size = fields.number("resident_size", 0, region.length);
    region.shared_now_private_size = fields.number("shared_now_private_size", 0, region.length);
    region.swapped_out_size = fields.number("swapped_out_size", 0, region.length);
    region.dirty_size = fields.number("dirty_size", 0, region.length);
    region.reusable_size = fields.number("reusable_size", 0, region.length);
    region.ref_count = static_cast<uint16_t>(fields.number("ref_count", 0, kMaxU16));
    region.external_pager = static_cast<uint8_t>(fields.number("external_pager", 0, 1));
    region.share_mode = static_cast<uint8_t>(fields.number("share_mode", 0, 8));
    region.is_submap = static_cast<uint32_t>(fields.number("is_submap", 0, 0));
    region.object_id = fields.number("object_id", 0, kMaxU64);
    region.purgeable = static_cast<int32_t>(fields.number("purgeable", 0, 3));
    region.inheritance = static_cast<uint32_t>(fields.number("inheritance", 0, 2));
    region.user_wired_count = static_cast<uint16_t>(fields.number("user_wired_count", 0, kMaxU16));
    if (!fields.ok()) return false;
    const rapidjson::Value* pages = fields.member("pages", true);
    if (pages == nullptr) return fields.ok();
    const uint64_t regionPages = region.length / pageSize + (region.length % pageSize != 0 ? 1 : 0);
    region.pages.emplace();
    return readPageRuns(*pages, fields, regionPages, *region.pages, identified, covered);
}

bool readRegions(const rapidjson::Value& list, HTSnapshotGraph& graph, std::string& problem)
{
    if (!list.IsArray()) {
        problem = htStringWithFormat("\"regions\" must be an array, not %s", typeName(list));
        return false;
    }
    uint64_t previousEnd = 0;
    uint64_t identified = 0;
    uint64_t covered = 0;
    // Grown one checked region at a time: a list of empty objects costs
    // no more than its text.
    for (rapidjson::SizeType i = 0; i < list.Size(); ++i) {
        HTSnapshotRegion region;
        if (!readRegion(list[i], i, graph.snapshotPageSize, previousEnd, region, identified, covered, problem))
            return false;
        previousEnd = region.address + region.length;
        graph.regions.push_back(std::move(region));
    }
    return true;
}

bool readGraph(const rapidjson::Document& document, HTSnapshotGraph& graph, std::string& problem)
{
    if (!document.IsObject()) {
        problem = htStringWithFormat("not a heft snapfile: the document is %s, not an object", typeName(document));
        return false;
    }
    FieldReader fields(document, "", problem);
    const rapidjson::Value* formatName = fields.member("format", true);
    if (fields.ok() &&
        (formatName == nullptr || !formatName->IsString() ||
         std::string_view(formatName->GetString(), formatName->GetStringLength()) != HTSnapshotGraph::kFormat)) {
        problem =
            htStringWithFormat("not a heft snapfile: it has no \"format\": \"%s\" member", HTSnapshotGraph::kFormat);
    }
    const uint64_t version = fields.number("version", 0, kMaxU64);
    if (fields.ok() && version != HTSnapshotGraph::kVersion) {
        fields.fail(htStringWithFormat("it is of version %" PRIu64 "; this heft reads version %" PRIu64, version,
                                       HTSnapshotGraph::kVersion));
    }
    graph.snapshotPid = static_cast<int32_t>(fields.number("pid", 1, kMaxPid));
    graph.snapshotProcessName = fields.string("name");
    graph.snapshotProcessDescription = fields.string("description");
    graph.snapshotIs64Bit = fields.boolean("is64Bit");
    graph.snapshotPageSize = static_cast<uint32_t>(fields.number("pageSize", 512, uint64_t{1} << 30));
    if (fields.ok() && (graph.snapshotPageSize & (graph.snapshotPageSize - 1)) != 0)
        fields.fail(htStringWithFormat("\"pageSize\" is %u, not a power of two", graph.snapshotPageSize));
    graph.snapshotPhysHeft = fields.number("physHeft", 0, kMaxU64);
    graph.snapshotPhysHeftPeak = fields.number("physHeftPeak", 0, kMaxU64);
    graph.snapshotShowsPhysHeft = fields.boolean("showsPhysHeft");
    graph.snapshotIdentifiesSharedPages = fields.boolean("identifiesSharedPages");
    graph.snapshotPageTableSize = fields.number("pageTableSize", 0, kMaxU64);
    graph.snapshotCapture = fields.string("capture");
    const rapidjson::Value* regions = fields.member("regions");
    return fields.ok() && readRegions(*regions, graph, problem);
}

HTError fileError(int error)
{
    return HTError(HTSnapshotGraph::kErrorDomain, HTSnapshotGraph::ErrorCodeFile, std::strerror(error));
}

HTError formatError(std::string text)
{
    return HTError(HTSnapshotGraph::kErrorDomain, HTSnapshotGraph::ErrorCodeFormat, std::move(text));
}

}  // namespace

std::unique_ptr<HTSnapshotGraph> HTSnapshotGraph::openSnapshotGraph(std::string_view contents, HTError* error)
{
    if (contents.empty()) {
        if (error) *error = formatError("the file is empty");
        return nullptr;
    }
    // The parser takes a NUL byte for the end of the text, and would read
    // no further: JSON text holds none.
    if (const size_t nul = contents.find('\0'); nul != std::string_view::npos) {
        if (error)
            *error = formatError(htStringWithFormat("not a heft snapfile: bad JSON at byte %zu (a NUL byte)", nul));
        return nullptr;
    }
    rapidjson::Document document;
    // Iterative parsing: nesting depth costs heap, not stack.
    document.Parse<rapidjson::kParseIterativeFlag>(contents.data(), contents.size());
    if (document.HasParseError()) {
        const size_t offset = document.GetErrorOffset();
        const char* reason = rapidjson::GetParseError_En(document.GetParseError());
        if (error)
            *error =
                formatError(offset >= contents.size()
                                ? htStringWithFormat("the file ends early, at byte %zu: it is cut short", offset)
                                : htStringWithFormat("not a heft snapfile: bad JSON at byte %zu (%s)", offset, reason));
        return nullptr;
    }
    auto graph = std::make_unique<HTSnapshotGraph>();
    std::string problem;
    if (!readGraph(document, *graph, problem)) {
        if (error) *error = formatError(problem);
        return nullptr;
    }
    return graph;
}

std::unique_ptr<HTSnapshotGraph> HTSnapshotGraph::openSnapshotFile(const std::string& path, HTError* error)
{
    // Without O_NONBLOCK, opening a FIFO would wait for a writer.
    HTFileDescriptor fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    struct stat status {};
    if (!fd.isOpen() || ::fstat(fd.get(), &status) != 0) {
        if (error) *error = fileError(errno);
        return nullptr;
    }
    if (S_ISDIR(status.st_mode)) {
        if (error) *error = formatError("it is a directory");
        return nullptr;
    }
    if (!S_ISREG(status.st_mode)) {
        if (error) *error = formatError("it is not a regular file");
        return nullptr;
    }
    const uint64_t size = static_cast<uint64_t>(status.st_size);
    if (size > kMaxFileSize) {
        if (error)
            *error = formatError(htStringWithFormat(
                "the file holds %" PRIu64 " bytes, more than the %" PRIu64 " a snapfile may hold", size, kMaxFileSize));
        return nullptr;
    }
    if (size == 0) return openSnapshotGraph({}, error);
    // Read rather than mapped: a file cut short while mapped would end the
    // program with SIGBUS.
    std::string contents(size, '\0');
    const ssize_t read = htPreadFully(fd.get(), contents.data(), size, 0);
    if (read < 0) {
        if (error) *error = fileError(errno);
        return nullptr;
    }
    contents.resize(static_cast<size_t>(read));
    return openSnapshotGraph(contents, error);
}

void HTSnapshotGraph::enumerateSnapshotRegions(
    const std::function<void(const HTSnapshotRegion&, bool& stop)>& callback) const
{
    bool stop = false;
    for (const HTSnapshotRegion& region : regions) {
        callback(region, stop);
        if (stop) return;
    }
}
