// Whole reports, text and JSON, driven through the analysis from scripted
// processes and compared character for character with the expected reports
// under tests/data/reports/ (see output/HTExpectedReport.h). This is the one
// place that asserts the text of whole reports.

#include "analysis/HTHeftTestSupport.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "output/HTExpectedReport.h"
#include "output/HTOutputCapture.h"
#include "output/HTOutputFormatterJSON.h"
#include "output/HTOutputFormatterText.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <functional>
#include <string>
#include <unistd.h>

namespace {

HTScriptedRegion region(uint64_t id, const char* name, uint64_t dirtyPages, uint64_t cleanPages = 0,
                        uint64_t swappedPages = 0, const char* path = nullptr, uint64_t start = 0)
{
    HTScriptedRegion made{.objectId = id,
                          .size = (dirtyPages + cleanPages + swappedPages) * kPage,
                          .dirty = dirtyPages * kPage,
                          .swapped = swappedPages * kPage,
                          .clean = cleanPages * kPage,
                          .name = std::string(name),
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

std::shared_ptr<HTAuxDataMap> aux(const char* key, int64_t value)
{
    auto data = std::make_shared<HTAuxDataMap>();
    if (key) data->set(key, std::make_shared<HTAuxData>(value, true));
    return data;
}

std::string contents(const std::string& path)
{
    std::string written;
    if (FILE* in = std::fopen(path.c_str(), "rb")) {
        for (int c; (c = std::fgetc(in)) != EOF;) written += static_cast<char>(c);
        std::fclose(in);
    }
    return written;
}

class HTReportGoldenTest : public HTAnalysisTest {
protected:
    struct Scenario {
        const char* name;
        std::function<HTHeft::ProcessList()> processes;
        std::function<void(HTSettings&)> settings = [](HTSettings&) {};
    };

    // Reports the scenario's processes as text and as JSON, after its
    // settings, and compares both with NAME.txt and NAME.json.
    void expectReports(const Scenario& scenario)
    {
        SCOPED_TRACE(scenario.name);
        const HTSettings defaults = settings_;
        scenario.settings(settings_);
        char dir[] = "/tmp/htgoldenXXXXXX";
        ASSERT_NE(mkdtemp(dir), nullptr);
        const std::string path = std::string(dir) + "/report.json";
        HTOutputCapture out;
        {
            auto heft = gathered(scenario.processes());
            heft->addOutputFormatter(std::make_shared<HTOutputFormatterText>(settings_, out.file()));
            heft->addOutputFormatter(
                HTOutputFormatterJSON::initWithPath(path, settings_.breakDownPhysHeft, kPage, nullptr));
            heft->printOutputVerbose(settings_.verbose, settings_.summarize);
        }
        expectReport(std::string(scenario.name) + ".txt", out.take());
        expectReport(std::string(scenario.name) + ".json", contents(path));
        std::remove(path.c_str());
        rmdir(dir);
        settings_ = defaults;
        HTProcess::_clearGlobalErrors();
    }
};

TEST_F(HTReportGoldenTest, Reports)
{
    settings_.summarize = false;
    auto withAux = [](std::shared_ptr<HTScriptedProcess> process, std::shared_ptr<HTAuxDataMap> data) {
        process->setAuxData(std::move(data));
        return process;
    };
    const Scenario scenarios[] = {
        // Sizes below 10000 bytes fit the 7-character field unscaled. One
        // process: the summary is only the counting-mode line, and the
        // auxiliary data is not repeated.
        {"one-process",
         [&] {
             return HTHeft::ProcessList{withAux(
                 process(10, {region(1, "untagged", 2), region(2, "mapped file", 1, 3, 0, "/usr/lib/libfoo.so")}),
                 aux("reserved", 8192))};
         }},
        // An empty map still gets its heading.
        {"one-process-empty-aux",
         [&] { return HTHeft::ProcessList{withAux(process(10, {region(1, "untagged", 1)}), aux(nullptr, 0))}; }},
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
        // In pages, wide: swapped and wired columns and full paths. Equal
        // dirty figures: the one with more clean memory first.
        {"two-sharing-wide-pages",
         [&] {
             return HTHeft::ProcessList{
                 process(20, {region(1, "shared memory", 1), region(3, "mapped file", 1, 1, 0, "/usr/lib/libbar.so")}),
                 process(10, {region(1, "shared memory", 1), region(2, "untagged", 1, 0, 1)})};
         },
         [](HTSettings& s) {
             s.summaryFormat = HTTextFormatPages;
             s.textOptions = HTTextOptionWired | HTTextOptionSwapped | HTTextOptionWide;
         }},
        // The stack is mapped but never touched: last by dirty size, third
        // by name. Only the low 40 bits of the object id are listed.
        {"verbose-by-category",
         [&] {
             HTScriptedRegion stack = region(5, "stack", 0, 0, 0, nullptr, 0x30000);
             stack.size = kPage;
             return HTHeft::ProcessList{process(10,
                                                {region(4, "IOKit", 2, 0, 0, nullptr, 0x10000),
                                                 region(3, "mapped file", 1, 1, 0, "/lib/x.so", 0x20000), stack,
                                                 region(0x12300000002, "untagged", 3, 0, 0, nullptr, 0x40000)})};
         },
         [](HTSettings& s) {
             s.textSort = "Category";
             s.verbose = true;
         }},
        // A process with errors has no heft and no tables, and its
        // auxiliary data stays out of the merged data; a global error.
        {"errors-and-warnings",
         [&] {
             auto failed = withAux(process(10, {region(2, "heap", 2)}), aux("x", 5));
             failed->scriptError("cannot read");
             auto warned = withAux(process(20, {region(1, "untagged", 1)}), aux("x", 7));
             warned->scriptWarning("exited");
             HTProcess::_addGlobalError("task port");
             return HTHeft::ProcessList{warned, failed};
         }},
        // p30 maps both pages of the object, the others one each: every
        // member sees its own figures.
        {"process-views",
         [&] {
             HTScriptedRegion secondPage = region(7, "shm", 1);
             secondPage.offset = kPage;
             return HTHeft::ProcessList{process(10, {region(7, "shm", 1)}), process(20, {region(7, "shm", 1)}),
                                        process(30, {region(7, "shm", 1), secondPage})};
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
             auto hidden = process(30, {region(1, "shm", 1), region(3, "other", 4)});
             hidden->setHiddenFromDisplay(true);
             return HTHeft::ProcessList{
                 process(10, {owned(region(1, "shm", 1)), owned(region(1, "shm", 1), true), region(2, "heap", 2)}),
                 hidden};
         },
         [](HTSettings& s) { s.breakDownPhysHeft = true; }},
        // Nothing visible: the formatters still get the closing stages.
        {"only-hidden",
         [&] {
             auto hidden = process(30, {region(3, "other", 4)});
             hidden->setHiddenFromDisplay(true);
             return HTHeft::ProcessList{hidden};
         },
         [](HTSettings& s) { s.verbose = true; }},
    };
    for (const Scenario& scenario : scenarios) expectReports(scenario);
}

}  // namespace
