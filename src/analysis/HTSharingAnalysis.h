#pragma once

#include <memory>
#include <vector>

class HTHeftSharingData;
class HTProcess;

// Which processes map which memory objects: each object that a reported
// process maps, with the set of processes that map it, and one frozen
// process group per distinct set. A hidden process counts only where it
// maps memory that a reported process owns beyond any mapping.
class HTSharingAnalysis {
public:
    using ProcessList = std::vector<std::shared_ptr<HTProcess>>;

    // The processes' regions must have been routed to their objects. Groups
    // and objects keep the order in which they were first met, so that the
    // report is the same run after run.
    static std::unique_ptr<HTHeftSharingData> sharingDataForProcesses(const ProcessList& processes);
};
