#include "platform/HTSnapshotGraphWriter.h"

#include "base/HTOutputFile.h"
#include "base/HTValidUTF8.h"
#include "platform/HTSnapshotGraph.h"

#include <rapidjson/filewritestream.h>
#include <rapidjson/writer.h>

namespace {

using JSONWriter = rapidjson::Writer<rapidjson::FileWriteStream>;

// Names and paths that are not UTF-8 are saved with U+FFFD for each byte
// that is not, as in the JSON report.
void string(JSONWriter& json, const std::string& text, std::string& scratch)
{
    const std::string_view valid = htValidUTF8(text, scratch);
    json.String(valid.data(), static_cast<rapidjson::SizeType>(valid.size()));
}

void number(JSONWriter& json, const char* key, uint64_t value)
{
    json.Key(key);
    json.Uint64(value);
}

void writeRegion(JSONWriter& json, const HTSnapshotRegion& region, std::string& scratch)
{
    json.StartObject();
    number(json, "address", region.address);
    number(json, "length", region.length);
    json.Key("type");
    string(json, region.type, scratch);
    json.Key("path");
    string(json, region.path, scratch);
    number(json, "prot", region.prot);
    number(json, "maxProt", region.maxProt);
    number(json, "offset", region.offset);
    number(json, "user_tag", region.user_tag);
    number(json, "resident_size", region.resident_size);
    number(json, "shared_now_private_size", region.shared_now_private_size);
    number(json, "swapped_out_size", region.swapped_out_size);
    number(json, "dirty_size", region.dirty_size);
    number(json, "reusable_size", region.reusable_size);
    number(json, "ref_count", region.ref_count);
    number(json, "external_pager", region.external_pager);
    number(json, "share_mode", region.share_mode);
    number(json, "is_submap", region.is_submap);
    number(json, "object_id", region.object_id);
    number(json, "purgeable", static_cast<uint32_t>(region.purgeable));
    number(json, "inheritance", region.inheritance);
    number(json, "user_wired_count", region.user_wired_count);
    if (region.pages) {
        json.Key("pages");
        json.StartArray();
        for (const HTSnapshotPageRun& run : *region.pages) {
            json.Uint64(run.firstPage);
            json.Uint64(run.count);
            json.Uint(static_cast<uint32_t>(run.disposition));
            json.Uint64(run.identity);
        }
        json.EndArray();
    }
    json.EndObject();
}

void writeGraph(JSONWriter& json, const HTSnapshotGraph& graph)
{
    std::string scratch;
    json.StartObject();
    json.Key("format");
    json.String(HTSnapshotGraph::kFormat);
    number(json, "version", HTSnapshotGraph::kVersion);
    json.Key("capture");
    string(json, graph.snapshotCapture, scratch);
    number(json, "pid", static_cast<uint64_t>(graph.snapshotPid));
    json.Key("name");
    string(json, graph.snapshotProcessName, scratch);
    json.Key("description");
    string(json, graph.snapshotProcessDescription, scratch);
    json.Key("is64Bit");
    json.Bool(graph.snapshotIs64Bit);
    number(json, "pageSize", graph.snapshotPageSize);
    number(json, "physHeft", graph.snapshotPhysHeft);
    number(json, "physHeftPeak", graph.snapshotPhysHeftPeak);
    json.Key("showsPhysHeft");
    json.Bool(graph.snapshotShowsPhysHeft);
    json.Key("identifiesSharedPages");
    json.Bool(graph.snapshotIdentifiesSharedPages);
    number(json, "pageTableSize", graph.snapshotPageTableSize);
    json.Key("regions");
    json.StartArray();
    for (const HTSnapshotRegion& region : graph.regions) writeRegion(json, region, scratch);
    json.EndArray();
    json.EndObject();
}

}  // namespace

bool HTSnapshotGraphWriter::writeToPath(const HTSnapshotGraph& graph, const std::string& path, std::string* errorText)
{
    std::unique_ptr<HTOutputFile> file = HTOutputFile::open(path, errorText);
    if (!file) return false;
    char buffer[65536];
    rapidjson::FileWriteStream stream(file->stream(), buffer, sizeof(buffer));
    JSONWriter json(stream);
    writeGraph(json, graph);
    stream.Flush();
    return file->commit(errorText);
}
