// Arbitrary bytes read as a snapfile; whatever opens is gathered and
// reported, with -v, as a run over that one snapfile would. No input may
// crash, hang, assert or exhaust memory on the way.
#include "analysis/HTHeft.h"
#include "base/HTNoticeLog.h"
#include "output/HTOutputFormatterText.h"
#include "platform/linux/HTLinuxPlatform.h"
#include "process/HTSnapfileProcess.h"

#include <cstdio>
#include <cstdlib>

// Pages with identities are analysed one by one, in time and memory in
// proportion to them up to the reader's bound (gigabytes): past 2^20 of
// them the fuzzer would only spend its time on sheer size.
static uint64_t identifiedPages(const HTSnapshotGraph& graph)
{
    uint64_t pages = 0;
    for (const HTSnapshotRegion& region : graph.regions)
        if (region.pages)
            for (const HTSnapshotPageRun& run : *region.pages) pages += run.identity != 0 ? run.count : 0;
    return pages;
}

extern "C" int LLVMFuzzerInitialize(int*, char***)
{
    // The report goes nowhere; libFuzzer speaks on standard error.
    if (std::freopen("/dev/null", "w", stdout) == nullptr) std::abort();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static const auto platform = std::make_shared<HTLinuxPlatform>();
    HTError error;
    auto graph = HTSnapshotGraph::openSnapshotGraph({reinterpret_cast<const char*>(data), size}, &error);
    if (!graph || identifiedPages(*graph) > (uint64_t{1} << 20)) return 0;
    HTSettings settings;
    auto process = HTSnapfileProcess::processWithGraph(platform, settings, std::move(graph), &error);
    if (!process) return 0;
    // The snapfile's analysis mode is the run's, as in a run from the command line.
    settings.breakDownPhysHeft = process->breakDownPhysHeft();
    settings.verbose = true;
    HTHeft heft({process}, settings);
    heft.gatherData();
    heft.addOutputFormatter(std::make_shared<HTOutputFormatterText>(settings));
    heft.printOutputVerbose(settings.verbose, settings.summarize);
    // The notices a run would print at its end are dropped, not kept.
    HTNoticeLog::standardError().take();
    return 0;
}
