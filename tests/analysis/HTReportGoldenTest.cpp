// Whole reports, text and JSON, driven through the analysis from scripted
// processes and compared character for character with the expected reports
// under tests/data/reports/. This is the one place that asserts the text of
// whole reports. When a change to the output is meant, run the tests with
// HEFT_UPDATE_REPORTS=1: the reports are written back from what heft prints
// now, and the diff of tests/data/ shows what changed.

#include "analysis/HTHeftTestSupport.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "output/HTOutputFormatterJSON.h"
#include "output/HTOutputFormatterText.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>

namespace {

HTScriptedRegion region(uint64_t id, const std::string& name, uint64_t dirtyPages, uint64_t cleanPages = 0,
                        uint64_t swappedPages = 0, const char* path = nullptr, uint64_t start = 0)
{
    HTScriptedRegion made{.objectId = id,
                          .size = (dirtyPages + cleanPages + swappedPages) * kPage,
                          .dirty = dirtyPages * kPage,
                          .swapped = swappedPages * kPage,
                          .clean = cleanPages * kPage,
                          .name = name,
                          .start = start};
    if (path) made.detailedName = std::string(path);
    return made;
}

HTScriptedRegion owned(HTScriptedRegion region, bool unmapped = false)
{
    region.owned = true;
    region.fake = unmapped;
    return region;
}

// A map of the keys and values; a value of -1 opens a map of the keys that follow.
std::shared_ptr<HTAuxDataMap> aux(std::vector<std::pair<std::string, int64_t>> entries)
{
    auto data = std::make_shared<HTAuxDataMap>(), into = data;
    for (const auto& [key, value] : entries) {
        auto inner = std::make_shared<HTAuxDataMap>();
        into->set(key, value < 0 ? HTAuxDataMap::Value(inner) : std::make_shared<HTAuxData>(value, true));
        if (value < 0) into = inner;
    }
    return data;
}

std::string contents(const std::string& path)
{
    std::stringstream text;
    text << std::ifstream(path, std::ios::binary).rdbuf();
    return text.str();
}

void expectReport(const std::string& name, const std::string& actual)
{
    const std::string path = std::string(HEFT_TEST_DATA_DIR) + "/reports/" + name;
    const char* update = std::getenv("HEFT_UPDATE_REPORTS");
    if (update && *update && std::string(update) != "0") {
        std::ofstream(path, std::ios::binary) << actual;
        return;
    }
    EXPECT_EQ(actual, contents(path)) << "differs from " << path << "; HEFT_UPDATE_REPORTS=1 rewrites it";
}

class HTReportGoldenTest : public HTAnalysisTest {
protected:
    struct Scenario {
        const char* name;
        std::function<HTHeft::ProcessList()> processes;
        std::function<void(HTSettings&)> settings = [](HTSettings&) {};
    };

    // Reports the scenario's processes as text and as JSON, after its
    // settings, and compares both with NAME.txt and NAME.json. The kernel's
    // page size differs from the processes' so that the JSON shows which
    // one it took.
    void expectReports(const Scenario& scenario)
    {
        SCOPED_TRACE(scenario.name);
        const HTSettings defaults = settings_;
        scenario.settings(settings_);
        const std::string path = testing::TempDir() + "heft-golden-report";
        {
            FILE* text = std::fopen((path + ".txt").c_str(), "w");
            auto heft = gathered(scenario.processes());
            heft->addOutputFormatter(std::make_shared<HTOutputFormatterText>(settings_, text));
            heft->addOutputFormatter(
                HTOutputFormatterJSON::initWithPath(path + ".json", settings_.breakDownPhysHeft, 4 * kPage, nullptr));
            heft->printOutputVerbose(settings_.verbose, settings_.summarize);
            std::fclose(text);
        }
        for (const char* extension : {".txt", ".json"}) {
            expectReport(scenario.name + std::string(extension), contents(path + extension));
            std::remove((path + extension).c_str());
        }
        settings_ = defaults;
        HTProcess::_clearGlobalErrors();
    }
};

TEST_F(HTReportGoldenTest, Reports)
{
    settings_.summarize = false;
    auto with = [](std::shared_ptr<HTScriptedProcess> process, std::function<void(HTScriptedProcess&)> change) {
        change(*process);
        return process;
    };
    const Scenario scenarios[] = {
        // Sizes below 10000 bytes fit the 7-character field unscaled. One
        // process: the summary is only the counting-mode line, and the
        // auxiliary data, nested, is not repeated.
        {"one-process",
         [&] {
             return HTHeft::ProcessList{
                 with(process(10, {region(1, "untagged", 2), region(2, "mapped file", 1, 3, 0, "/usr/lib/libfoo.so")}),
                      [](auto& p) {
                          p.setAuxData(aux({{"reserved", 8192}, {"ledger", -1}, {"page_table", 4096}}));
                      })};
         }},
        // An empty map still gets its heading.
        {"one-process-empty-aux",
         [&] {
             return HTHeft::ProcessList{
                 with(process(10, {region(1, "untagged", 1)}), [](auto& p) { p.setAuxData(aux({})); })};
         }},
        // Two processes share an object, counted once in the summary, in
        // bytes and by short names.
        {"two-sharing-bytes",
         [&] {
             return HTHeft::ProcessList{process(20, {region(1, "shared memory", 1), region(3, "untagged", 1)}),
                                        process(10, {region(1, "shared memory", 1), region(2, "untagged", 2)})};
         },
         [](HTSettings& s) {
             s.summaryFormat = HTTextFormatBytes;
             s.summarize = true;
         }},
        // In pages, wide: swapped and wired columns, full paths, the listing
        // too; an empty table. Equal dirty figures: the one with more clean
        // memory first. Auxiliary data in pages, rounded up.
        {"two-sharing-wide-pages",
         [&] {
             return HTHeft::ProcessList{
                 process(20, {region(1, "shared memory", 1), region(3, "mapped file", 1, 1, 0, "/usr/lib/libbar.so")}),
                 with(process(10, {region(1, "shared memory", 1), region(2, "untagged", 1, 0, 1)}),
                      [](auto& p) {
                          p.setAuxData(aux({{"phys_heft", 4097}}));
                      }),
                 process(5, {})};
         },
         [](HTSettings& s) {
             s.summaryFormat = HTTextFormatPages;
             s.textOptions = HTTextOptionWired | HTTextOptionSwapped | HTTextOptionWide;
             s.verbose = true;
         }},
        // The stack is mapped but never touched: last by dirty size, third
        // by name. Only the low 40 bits of the object id are listed; an
        // unmapped region has no addresses, a size not a page multiple
        // counts the page begun.
        {"verbose-by-category",
         [&] {
             HTScriptedRegion stack = region(5, "stack", 0, 0, 0, nullptr, 0x30000);
             stack.size = kPage;
             HTScriptedRegion odd = region(6, "heap", 1, 0, 1, nullptr, 0x50000);
             odd.size += 1;
             return HTHeft::ProcessList{process(10,
                                                {region(4, "IOKit", 2, 0, 0, nullptr, 0x10000),
                                                 region(3, "mapped file", 1, 1, 0, "/lib/x.so", 0x20000), stack,
                                                 region(0x12300000002, "untagged", 3, 0, 0, nullptr, 0x40000), odd,
                                                 owned(region(7, "owned", 1), true)})};
         },
         [](HTSettings& s) {
             s.textSort = "Category";
             s.textOptions = HTTextOptionWired | HTTextOptionSwapped;
             s.verbose = true;
         }},
        // A process with errors has no heft and no tables, and its
        // auxiliary data stays out of the merged data; a 32-bit process
        // with warnings; a global error.
        {"errors-and-warnings",
         [&] {
             auto failed = with(process(10, {region(2, "heap", 2)}), [](auto& p) {
                 p.setAuxData(aux({{"x", 5}}));
                 p.scriptError("cannot read");
             });
             auto warned = with(process(20, {region(1, "untagged", 1)}, false), [](auto& p) {
                 p.setAuxData(aux({{"x", 7}}));
                 p.warnings() = {"exited", "second warning"};
             });
             HTProcess::_addGlobalError("task port");
             return HTHeft::ProcessList{warned, failed};
         }},
        // p30 maps both pages of the object, the others one each: every
        // member sees its own figures. Warnings alone do not put the
        // summary in doubt.
        {"process-views",
         [&] {
             HTScriptedRegion secondPage = region(7, "shm", 1);
             secondPage.offset = kPage;
             return HTHeft::ProcessList{
                 with(process(10, {region(7, "shm", 1)}), [](auto& p) { p.warnings() = {"exited"}; }),
                 process(20, {region(7, "shm", 1)}), process(30, {region(7, "shm", 1), secondPage})};
         }},
        // Memory p10 owns is clean to p20; the summary counts it once, dirty.
        // Memory without a name is still shown, under "unknown".
        {"owned-memory",
         [&] {
             HTScriptedRegion unnamed{.objectId = 10, .dirty = kPage, .name = std::nullopt};
             return HTHeft::ProcessList{process(10, {owned(region(8, "shm", 1))}),
                                        process(20, {region(8, "shm", 1), region(9, "heap", 2), unnamed})};
         },
         [](HTSettings& s) { s.breakDownPhysHeft = true; }},
        // The hidden process maps memory p10 owns and has a fake region
        // for, so it joins that memory's group; its other memory stays out.
        {"hidden-process",
         [&] {
             auto hidden = with(process(30, {region(1, "shm", 1), region(3, "other", 4)}),
                                [](auto& p) { p.setHiddenFromDisplay(true); });
             return HTHeft::ProcessList{
                 process(10, {owned(region(1, "shm", 1)), owned(region(1, "shm", 1), true), region(2, "heap", 2)}),
                 hidden};
         },
         [](HTSettings& s) { s.breakDownPhysHeft = true; }},
        // Nothing visible: the formatters still get the closing stages, and
        // a run's error alone.
        {"only-hidden",
         [&] {
             HTProcess::_addGlobalError("interrupted");
             return HTHeft::ProcessList{
                 with(process(30, {region(3, "other", 4)}), [](auto& p) { p.setHiddenFromDisplay(true); })};
         },
         [](HTSettings& s) { s.verbose = true; }},
        // Groups of up to twenty name the others; larger ones count them.
        // A figure wider than its column pushes the row along.
        {"crowd",
         [&] {
             HTHeft::ProcessList crowd;
             for (int32_t pid = 1; pid <= 21; ++pid)
                 crowd.push_back(process(pid,
                                         pid < 21 ? std::vector{region(1, "shm", 244141), region(2, "shm", 1)}
                                                  : std::vector{region(1, "shm", 244141)}));
             return crowd;
         },
         [](HTSettings& s) { s.summaryFormat = HTTextFormatBytes; }},
        // Names, errors, categories and keys that are neither printable nor
        // UTF-8 are escaped in the text and mended in the JSON.
        {"awkward-names",
         [&] {
             const std::string awkward = std::string("a\"b\\c\x01\td\n") + '\0' + "e\xff" + "f\xc3\xbc";
             auto named = with(process(7, {region(1, awkward, 1)}), [&](auto& p) {
                 p.setName(awkward);
                 p.setDisplayString(awkward + " [7]");
             });
             return HTHeft::ProcessList{named, with(process(8, {}), [&](auto& p) { p.scriptError(awkward); })};
         }},
    };
    for (const Scenario& scenario : scenarios) expectReports(scenario);
}

}  // namespace
