#pragma once

#include <string>

class HTSnapshotGraph;

// Writes a snapshot graph as a snapfile (the document HTSnapshotGraph
// reads), whole or not at all.
class HTSnapshotGraphWriter {
public:
    // False, with `errorText` set, when the file could not be written; no
    // file is then left at `path`.
    static bool writeToPath(const HTSnapshotGraph& graph, const std::string& path, std::string* errorText);
};
