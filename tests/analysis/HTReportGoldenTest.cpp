// Whole reports, driven through the analysis from scripted processes and
// compared character for character with the expected reports under
// tests/data/reports/ (see output/HTExpectedReport.h).

#include "analysis/HTHeftTestSupport.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "output/HTExpectedReport.h"
#include "output/HTOutputCapture.h"
#include "output/HTOutputFormatterJSON.h"
#include "output/HTOutputFormatterText.h"

#include <gtest/gtest.h>

#include <cstdio>
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

class HTReportGoldenTest : public HTAnalysisTest {
protected:
    HTSettings textSettings(int64_t format, int64_t options, std::string sort)
    {
        HTSettings settings = settings_;
        settings.summaryFormat = format;
        settings.textOptions = options;
        settings.textSort = std::move(sort);
        return settings;
    }

    // Reports the processes as text, and as JSON too when `json` names its
    // expected report, and compares both with the expected reports.
    void expectReports(const HTHeft::ProcessList& processes, const std::string& text, int64_t format, int64_t options,
                       const std::string& sort, bool verbose = false, const std::string& json = "")
    {
        char dir[] = "/tmp/htgoldenXXXXXX";
        ASSERT_NE(mkdtemp(dir), nullptr);
        const std::string path = std::string(dir) + "/report.json";
        HTOutputCapture out;
        {
            auto heft = gathered(processes);
            heft->addOutputFormatter(
                std::make_shared<HTOutputFormatterText>(textSettings(format, options, sort), out.file()));
            if (!json.empty())
                heft->addOutputFormatter(HTOutputFormatterJSON::initWithPath(path, false, kPage, nullptr));
            heft->printOutputVerbose(verbose, /*summarize=*/false);
        }
        expectReport(text, out.take());
        if (!json.empty()) {
            std::string written;
            if (FILE* in = std::fopen(path.c_str(), "rb")) {
                for (int c; (c = std::fgetc(in)) != EOF;) written += static_cast<char>(c);
                std::fclose(in);
            }
            expectReport(json, written);
        }
        std::remove(path.c_str());
        rmdir(dir);
    }

    // Two processes mapping one object (pages of `shared`), each with a
    // private object of its own.
    HTHeft::ProcessList twoSharing(HTScriptedRegion shared, HTScriptedRegion first, HTScriptedRegion second)
    {
        return {process(20, {shared, second}), process(10, {shared, first})};
    }
};

TEST_F(HTReportGoldenTest, OneProcessPrivateTablesAndAuxiliaryData)
{
    // Sizes below 10000 bytes fit the 7-character field unscaled. One
    // process: the summary is only the counting-mode line, and the merged
    // auxiliary data is not repeated.
    auto p10 = process(10, {region(1, "untagged", 2), region(2, "mapped file", 1, 3, 0, "/usr/lib/libfoo.so")});
    auto aux = std::make_shared<HTAuxDataMap>();
    aux->set("reserved", std::make_shared<HTAuxData>(8192, true));
    p10->setAuxData(aux);
    expectReports({p10}, "one-process.txt", HTTextFormatFormatted, 0, "Dirty");

    // An empty map still gets its heading.
    auto quiet = process(10, {region(1, "untagged", 1)});
    quiet->setAuxData(std::make_shared<HTAuxDataMap>());
    expectReports({quiet}, "one-process-empty-aux.txt", HTTextFormatFormatted, 0, "Dirty");
}

TEST_F(HTReportGoldenTest, TwoProcessesCountSharedObjectOnceInSummary)
{
    // In bytes; the JSON report beside the text one says the same.
    expectReports(twoSharing(region(1, "shared memory", 1), region(2, "untagged", 2), region(3, "untagged", 1)),
                  "two-sharing-bytes.txt", HTTextFormatBytes, 0, "Dirty", false, "two-sharing.json");

    // In pages, wide: swapped and wired columns and full paths. Equal dirty
    // figures: the one with more clean memory first.
    expectReports(twoSharing(region(1, "shared memory", 1), region(2, "untagged", 1, 0, 1),
                             region(3, "mapped file", 1, 1, 0, "/usr/lib/libbar.so")),
                  "two-sharing-wide-pages.txt", HTTextFormatPages,
                  HTTextOptionWired | HTTextOptionSwapped | HTTextOptionWide, "Dirty");
}

TEST_F(HTReportGoldenTest, VerboseListingAndRowsSortedByCategory)
{
    // The stack is mapped but never touched: last by dirty size, third by
    // name. Only the low 40 bits of the object id are listed.
    HTScriptedRegion stack = region(5, "stack", 0, 0, 0, nullptr, 0x30000);
    stack.size = kPage;
    auto p10 =
        process(10,
                {region(4, "IOKit", 2, 0, 0, nullptr, 0x10000), region(3, "mapped file", 1, 1, 0, "/lib/x.so", 0x20000),
                 stack, region(0x12300000002, "untagged", 3, 0, 0, nullptr, 0x40000)});
    expectReports({p10}, "verbose-by-category.txt", HTTextFormatFormatted, 0, "Category", /*verbose=*/true);
}

TEST_F(HTReportGoldenTest, ErrorsAndWarningsInHeadersDiagnosticsAndSummary)
{
    auto failed = process(10, {region(2, "heap", 2)});
    failed->scriptError("cannot read");
    auto warned = process(20, {region(1, "untagged", 1)});
    warned->scriptWarning("exited");
    expectReports({warned, failed}, "errors-and-warnings.txt", HTTextFormatFormatted, 0, "Dirty");
}

}  // namespace
