// Arbitrary bytes read as a snapfile, or two parted by a NUL (which no
// snapfile holds), gathered and reported with -v as a run over them would:
// no input may crash, hang, assert or exhaust memory on the way.
#include "analysis/HTHeft.h"
#include "base/HTNoticeLog.h"
#include "output/HTOutputFormatterText.h"
#include "platform/linux/HTLinuxPlatform.h"
#include "process/HTSnapfileProcess.h"

#include <cstdio>
#include <cstdlib>

// Identified pages cost time and memory one by one, up to the reader's
// bound (gigabytes); past 2^20 the fuzzer would only spend its time on size.
static uint64_t identifiedPages(const HTSnapshotGraph& graph)
{
    uint64_t pages = 0;
    for (const HTSnapshotRegion& region : graph.regions)
        if (region.pages)
            for (const HTSnapshotPageRun& run : *region.pages) pages += run.identity != 0 ? run.count : 0;
    return pages;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static const auto platform = std::make_shared<HTLinuxPlatform>();
    static FILE* const sink = std::fopen("/dev/null", "w");  // for the report
    if (sink == nullptr) std::abort();
    const std::string_view input(reinterpret_cast<const char*>(data), size);
    const size_t nul = std::min(input.find('\0'), size);
    HTSettings settings;
    std::vector<std::shared_ptr<HTSnapfileProcess>> read;
    for (std::string_view part : {input.substr(0, nul), input.substr(std::min(nul + 1, size))}) {
        HTError error;
        auto graph = HTSnapshotGraph::openSnapshotGraph(part, &error);
        if (!graph || identifiedPages(*graph) > (uint64_t{1} << 20)) continue;
        auto process = HTSnapfileProcess::processWithGraph(platform, settings, std::move(graph), &error);
        // As on the command line: one analysis mode, and one process a pid.
        if (process &&
            (read.empty() ||
             (process->breakDownPhysHeft() == read[0]->breakDownPhysHeft() && process->pid() != read[0]->pid())))
            read.push_back(process);
    }
    if (read.empty()) return 0;
    // As a run takes them: by pid, matching pages only within one capture.
    if (read.back()->pid() < read[0]->pid()) std::swap(read.front(), read.back());
    for (const auto& process : read) process->setIgnoresPageIdentities(read.back()->capture() != read[0]->capture());
    settings.breakDownPhysHeft = read[0]->breakDownPhysHeft();
    settings.verbose = true;
    HTHeft heft(HTHeft::ProcessList(read.begin(), read.end()), settings);
    heft.gatherData();
    heft.addOutputFormatter(std::make_shared<HTOutputFormatterText>(settings, sink));
    heft.printOutputVerbose(settings.verbose, settings.summarize);
    // The notices a run would print at its end are dropped, not kept.
    HTNoticeLog::standardError().take();
    return 0;
}
