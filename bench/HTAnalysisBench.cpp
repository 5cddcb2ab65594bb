// Cost of the analysis of a large run: 1,000 processes of 200 regions each,
// shaped like a desktop system. Every process maps a few dozen libraries
// that everyone maps (their __TEXT shared, their data copy-on-write and
// partly touched), some rarer libraries, shared memory segments shared by
// small groups, shared cache pieces, and mostly private anonymous memory.
//
// "Gather" times gathering (the scripted sources build their regions on the
// worker threads), routing, finalising and hefts. "Full" adds the sharing
// analysis, the categories and a report to a formatter that discards it.
// "Report" times the report alone. The argument turns the breakdown mode
// off (0) or on (1).

#include "../tests/analysis/HTScriptedProcess.h"
#include "analysis/HTHeft.h"
#include "model/HTCategoryMap.h"
#include "output/HTOutputFormatter.h"
#include "platform/fake/HTFakePlatform.h"

#include <benchmark/benchmark.h>

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;
constexpr int kProcesses = 1000;
constexpr int kRegionsPerProcess = 200;
constexpr uint64_t kCommonLibraries = 30;
constexpr uint64_t kRareLibraries = 270;
constexpr uint64_t kSharedCachePieces = 50;
constexpr uint64_t kSharedMemoryGroupSize = 8;

// A fixed, cheap pseudo-random sequence, so that every run sees one input.
uint64_t mix(uint64_t value)
{
    value ^= value >> 33;
    value *= 0xff51afd7ed558ccdull;
    value ^= value >> 33;
    value *= 0xc4ceb9fe1a85ec53ull;
    return value ^ (value >> 33);
}

// Object identities as the Linux backend forms them: files and shared
// memory with the top bit set, private anonymous memory with the top two
// bits 01.
uint64_t fileId(uint64_t file) { return 0x8000000000000000ull | (mix(file + 1) >> 1); }
uint64_t anonymousId(uint64_t pid, uint64_t index) { return 0x4000000000000000ull | (mix((pid << 20) | index) >> 2); }

class NullFormatter : public HTOutputFormatter {
public:
    void printProcessHeader(const HTProcess&) override { ++calls; }
    void printProcessTotal(uint64_t, const HTProcess&) override { ++calls; }
    void endProcessHeader(const HTProcess&) override { ++calls; }
    void printProcessCategories(const HTCategoryMap& categories, const HTMemoryTotals&) override
    {
        calls += categories.size();
    }
    void printSharedCategories(const HTCategoryMap& categories, const HTProcessGroup&, const HTProcess&, bool,
                               const HTMemoryTotals&) override
    {
        calls += categories.size();
    }
    void printProcessAuxData(const std::shared_ptr<HTAuxDataMap>&) override { ++calls; }
    void printProcessesWithWarnings(const ProcessList&, const ProcessList&, const std::vector<std::string>&) override
    {
        ++calls;
    }
    void printSummaryCategories(const HTCategoryMap& categories, const HTMemoryTotals&, bool) override
    {
        calls += categories.size();
    }
    void printGlobalAuxData(const std::shared_ptr<HTAuxDataMap>&) override { ++calls; }
    void end() override { ++calls; }

    uint64_t calls = 0;
};

void addLibrary(std::vector<HTScriptedRegion>& script, uint64_t library, uint64_t pid, bool withLinkedit)
{
    const std::string name = "lib" + std::to_string(library) + ".so";
    const uint64_t textPages = 16 + mix(library) % 240;
    HTScriptedRegion text{.objectId = fileId(library),
                          .size = textPages * kPage,
                          .clean = (textPages / 2) * kPage,
                          .shareMode = SM_COW,
                          .segment = HTSegmentText,
                          .name = std::string("mapped file"),
                          .detailedName = name};
    script.push_back(text);

    // The data segment: copy-on-write, touched by most processes.
    const uint64_t dataPages = 1 + mix(library * 7) % 8;
    const uint64_t touched = mix(pid * 131 + library) % 4 == 0 ? 0 : 1 + mix(pid + library) % dataPages;
    HTScriptedRegion data{.objectId = fileId(library),
                          .offset = textPages * kPage,
                          .size = dataPages * kPage,
                          .dirty = touched * kPage,
                          .clean = (dataPages - touched) * kPage,
                          .shareMode = SM_COW,
                          .segment = HTSegmentOther,
                          .name = std::string("mapped file"),
                          .detailedName = name};
    script.push_back(data);

    if (withLinkedit) {
        HTScriptedRegion linkedit = text;
        linkedit.offset = (textPages + dataPages) * kPage;
        linkedit.size = 4 * kPage;
        linkedit.clean = 2 * kPage;
        linkedit.segment = HTSegmentLinkEdit;
        script.push_back(linkedit);
    }
}

std::vector<HTScriptedRegion> scriptForProcess(uint64_t pid)
{
    std::vector<HTScriptedRegion> script;
    script.reserve(kRegionsPerProcess);
    for (uint64_t library = 0; library < kCommonLibraries; ++library) addLibrary(script, library, pid, library < 10);
    for (uint64_t i = 0; i < 15; ++i)
        addLibrary(script, kCommonLibraries + mix(pid * 1000 + i) % kRareLibraries, pid, false);

    for (uint64_t i = 0; i < 5; ++i) {
        const uint64_t segment = 1000000 + (pid / kSharedMemoryGroupSize) * 8 + i;
        script.push_back(HTScriptedRegion{.objectId = fileId(segment),
                                          .size = 16 * kPage,
                                          .dirty = 8 * kPage,
                                          .clean = 8 * kPage,
                                          .shareMode = SM_SHARED,
                                          .name = std::string("shared memory"),
                                          .detailedName = "/dev/shm/seg" + std::to_string(segment)});
    }
    for (uint64_t i = 0; i < 5; ++i) {
        const uint64_t piece = mix(pid * 17 + i) % kSharedCachePieces;
        script.push_back(HTScriptedRegion{.objectId = 7,
                                          .size = 32 * kPage,
                                          .clean = 16 * kPage,
                                          .shareMode = SM_COW,
                                          .name = std::string("shared cache"),
                                          .inSharedCache = true,
                                          .start = 0x7f0000000000ull + piece * 32 * kPage});
    }

    static const char* const kPrivateNames[] = {"VM_ALLOCATE", "sbrk", "stack", "named anonymous"};
    for (uint64_t i = 0; script.size() < kRegionsPerProcess; ++i) {
        const uint64_t pages = 1 + mix(pid * 4096 + i) % 64;
        const uint64_t dirty = mix(pid + i * 3) % (pages + 1);
        const uint64_t swapped = mix(pid + i * 5) % 8 == 0 ? (pages - dirty) / 2 : 0;
        script.push_back(HTScriptedRegion{.objectId = anonymousId(pid, i),
                                          .size = pages * kPage,
                                          .dirty = dirty * kPage,
                                          .swapped = swapped * kPage,
                                          .clean = (pages - dirty - swapped) * kPage,
                                          .shareMode = SM_PRIVATE,
                                          .name = std::string(kPrivateNames[i % 4])});
    }
    return script;
}

const std::vector<std::vector<HTScriptedRegion>>& scripts()
{
    static const auto all = [] {
        std::vector<std::vector<HTScriptedRegion>> made;
        for (int pid = 1; pid <= kProcesses; ++pid) made.push_back(scriptForProcess(static_cast<uint64_t>(pid)));
        return made;
    }();
    return all;
}

HTSettings settingsWithBreakdown(bool on)
{
    HTSettings settings;
    settings.breakDownPhysHeft = on;
    return settings;
}

HTHeft::ProcessList freshProcesses(const HTSettings& settings)
{
    auto platform = std::make_shared<HTFakePlatform>();
    HTHeft::ProcessList processes;
    processes.reserve(kProcesses);
    for (int pid = 1; pid <= kProcesses; ++pid) {
        auto process = std::make_shared<HTScriptedProcess>(platform, pid, scripts()[pid - 1]);
        process->setSettings(settings);
        processes.push_back(std::move(process));
    }
    return processes;
}

void BM_AnalysisFull(benchmark::State& state)
{
    const HTSettings settings = settingsWithBreakdown(state.range(0) != 0);
    uint64_t calls = 0;
    for (auto _ : state) {
        state.PauseTiming();
        auto heft = std::make_unique<HTHeft>(freshProcesses(settings), settings);
        auto formatter = std::make_shared<NullFormatter>();
        state.ResumeTiming();

        heft->gatherData();
        heft->addOutputFormatter(formatter);
        heft->printOutputVerbose(false, false);
        calls = formatter->calls;

        state.PauseTiming();
        heft.reset();
        state.ResumeTiming();
    }
    state.counters["formatter_calls"] = static_cast<double>(calls);
    state.counters["regions"] = kProcesses * kRegionsPerProcess;
}

void BM_AnalysisReport(benchmark::State& state)
{
    const HTSettings settings = settingsWithBreakdown(state.range(0) != 0);
    for (auto _ : state) {
        state.PauseTiming();
        auto heft = std::make_unique<HTHeft>(freshProcesses(settings), settings);
        heft->gatherData();
        auto formatter = std::make_shared<NullFormatter>();
        heft->addOutputFormatter(formatter);
        state.ResumeTiming();

        heft->printOutputVerbose(false, false);
        benchmark::DoNotOptimize(formatter->calls);

        state.PauseTiming();
        heft.reset();
        state.ResumeTiming();
    }
}

// Gathering, routing, finalising and hefts, without the report.
void BM_AnalysisGather(benchmark::State& state)
{
    const HTSettings settings = settingsWithBreakdown(state.range(0) != 0);
    for (auto _ : state) {
        state.PauseTiming();
        auto heft = std::make_unique<HTHeft>(freshProcesses(settings), settings);
        state.ResumeTiming();

        heft->gatherData();

        state.PauseTiming();
        heft.reset();
        state.ResumeTiming();
    }
}

BENCHMARK(BM_AnalysisGather)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond)->UseRealTime();
BENCHMARK(BM_AnalysisFull)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond)->UseRealTime();
BENCHMARK(BM_AnalysisReport)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace
