// Whole reports, driven through the analysis from scripted processes and
// compared character for character with the text a user would see.

#include "analysis/HTHeftTestSupport.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "output/HTOutputFormatterJSON.h"
#include "output/HTOutputFormatterText.h"

#include <gtest/gtest.h>
#include <rapidjson/document.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>
#include <string>
#include <unistd.h>
#include <vector>

namespace {

const std::string kRule70(70, '=');
const std::string kRule90(90, '=');

const std::string kHeadFormatted = "  Dirty      Clean  Reclaimable    Regions    Category\n";
const std::string kDashFormatted = "    ---        ---          ---        ---    ---\n";
const std::string kHeadBytes = "      Dirty         Clean   Reclaimable    Regions    Category\n";
const std::string kDashBytes = "        ---           ---           ---        ---    ---\n";
const std::string kHeadWide =
    "      Dirty     (Swapped)         Clean   Reclaimable       (Wired)    Regions    Category\n";
const std::string kDashWide =
    "        ---           ---           ---           ---           ---        ---    ---\n";
const std::string kNotBrokenDown = "VM Object Dirty Analysis: Enabled\n";

HTScriptedRegion region(uint64_t id, const char* name, uint64_t dirtyPages, uint64_t cleanPages = 0,
                        uint64_t swappedPages = 0)
{
    return HTScriptedRegion{.objectId = id,
                            .size = (dirtyPages + cleanPages + swappedPages) * kPage,
                            .dirty = dirtyPages * kPage,
                            .swapped = swappedPages * kPage,
                            .clean = cleanPages * kPage,
                            .name = std::string(name)};
}

HTScriptedRegion withPath(HTScriptedRegion line, const char* path)
{
    line.detailedName = std::string(path);
    return line;
}

HTScriptedRegion at(HTScriptedRegion line, uint64_t start)
{
    line.start = start;
    return line;
}

class HTReportGoldenTest : public HTAnalysisTest {
protected:
    // The complete text report of the processes.
    std::string textReport(const HTHeft::ProcessList& processes, int64_t format, int64_t options,
                           const std::string& sort, bool verbose = false)
    {
        char* buffer = nullptr;
        size_t length = 0;
        FILE* stream = open_memstream(&buffer, &length);
        EXPECT_NE(stream, nullptr);
        {
            auto heft = gathered(processes);
            heft->addOutputFormatter(
                std::make_shared<HTOutputFormatterText>(format, options, sort, /*breakDownPhysHeft=*/false, stream));
            heft->printOutputVerbose(verbose, /*summarize=*/false);
        }
        fclose(stream);
        std::string text(buffer, length);
        free(buffer);
        return text;
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
    auto p10 = process(10, {region(1, "untagged", 2), withPath(region(2, "mapped file", 1, 3), "/usr/lib/libfoo.so")});
    auto aux = std::make_shared<HTAuxDataMap>();
    aux->set("reserved", std::make_shared<HTAuxData>(8192, true));
    p10->setAuxData(aux);

    const std::string expected =
        kRule70 + "\n" +
        "proc10 [10]: 64-bit\tHeft: 12 KB (4096 bytes per page)\n" +
        kRule70 + "\n\n" +
        kHeadFormatted + kDashFormatted +
        " 8192 B        0 B          0 B          1    untagged\n"
        " 4096 B      12 KB          0 B          1    mapped file .../libfoo.so\n" +
        kDashFormatted +
        "  12 KB      12 KB          0 B          2    TOTAL\n"
        "\n"
        "Auxiliary data:\n"
        "\treserved: 8192 B\n"
        "\n" +
        // Sizes below 10000 bytes fit the 7-character field unscaled. One
        // process: the summary is only the counting-mode line, and the
        // merged auxiliary data is not repeated.
        kNotBrokenDown;
    EXPECT_EQ(textReport({p10}, HTTextFormatFormatted, 0, "Dirty"), expected);

    // An empty map still gets its heading; no map at all gets nothing.
    auto quiet = process(10, {region(1, "untagged", 1)});
    quiet->setAuxData(std::make_shared<HTAuxDataMap>());
    EXPECT_EQ(textReport({quiet}, HTTextFormatFormatted, 0, "Dirty"),
              kRule70 + "\nproc10 [10]: 64-bit\tHeft: 4096 B (4096 bytes per page)\n" + kRule70 + "\n\n" +
                  kHeadFormatted + kDashFormatted + " 4096 B        0 B          0 B          1    untagged\n" +
                  kDashFormatted + " 4096 B        0 B          0 B          1    TOTAL\n\nAuxiliary data:\n\n" +
                  kNotBrokenDown);
}

TEST_F(HTReportGoldenTest, TwoProcessesInBytesCountSharedObjectOnceInSummary)
{
    auto processes = twoSharing(region(1, "shared memory", 1), region(2, "untagged", 2), region(3, "untagged", 1));

    const std::string expected =
        kRule70 + "\n" +
        "proc10 [10]: 64-bit\tHeft: 12288 B (4096 bytes per page)\n" +
        kRule70 + "\n\n" +
        kHeadBytes + kDashBytes +
        "     8192 B           0 B           0 B          1    untagged\n" +
        kDashBytes +
        "     8192 B           0 B           0 B          1    TOTAL\n"
        "\n"
        "Shared with proc20 [20]:\n" +
        kHeadBytes + kDashBytes +
        "     4096 B           0 B           0 B          2    shared memory\n" +
        kDashBytes +
        "     4096 B           0 B           0 B          2    TOTAL\n"
        "\n" +
        kRule70 + "\n" +
        "proc20 [20]: 64-bit\tHeft: 8192 B (4096 bytes per page)\n" +
        kRule70 + "\n\n" +
        kHeadBytes + kDashBytes +
        "     4096 B           0 B           0 B          1    untagged\n" +
        kDashBytes +
        "     4096 B           0 B           0 B          1    TOTAL\n"
        "\n"
        "Shared with proc10 [10]:\n" +
        kHeadBytes + kDashBytes +
        "     4096 B           0 B           0 B          2    shared memory\n" +
        kDashBytes +
        "     4096 B           0 B           0 B          2    TOTAL\n"
        "\n" +
        kNotBrokenDown +
        kRule70 + "\n" +
        "Summary Heft: 16384 B\n" +
        kRule70 + "\n\n" +
        kHeadBytes + kDashBytes +
        "    12288 B           0 B           0 B          2    untagged\n"
        "     4096 B           0 B           0 B          2    shared memory\n" +
        kDashBytes +
        "    16384 B           0 B           0 B          4    TOTAL\n"
        "\n";
    EXPECT_EQ(textReport(processes, HTTextFormatBytes, 0, "Dirty"), expected);
}

TEST_F(HTReportGoldenTest, WideReportInPagesShowsSwappedWiredAndFullPaths)
{
    auto processes = twoSharing(region(1, "shared memory", 1), region(2, "untagged", 1, 0, 1),
                                withPath(region(3, "mapped file", 1, 1), "/usr/lib/libbar.so"));

    const std::string expected =
        kRule90 + "\n" +
        "proc10 [10]: 64-bit\tHeft: 3 pages (4096 bytes per page)\n" +
        kRule90 + "\n\n" +
        kHeadWide + kDashWide +
        "    2 pages       1 pages       0 pages       0 pages       0 pages          1    untagged\n" +
        kDashWide +
        "    2 pages       1 pages       0 pages       0 pages       0 pages          1    TOTAL\n"
        "\n"
        "Shared with proc20 [20]:\n" +
        kHeadWide + kDashWide +
        "    1 pages       0 pages       0 pages       0 pages       0 pages          2    shared memory\n" +
        kDashWide +
        "    1 pages       0 pages       0 pages       0 pages       0 pages          2    TOTAL\n"
        "\n" +
        kRule90 + "\n" +
        "proc20 [20]: 64-bit\tHeft: 2 pages (4096 bytes per page)\n" +
        kRule90 + "\n\n" +
        kHeadWide + kDashWide +
        "    1 pages       0 pages       1 pages       0 pages       0 pages          1    mapped file /usr/lib/libbar.so\n" +
        kDashWide +
        "    1 pages       0 pages       1 pages       0 pages       0 pages          1    TOTAL\n"
        "\n"
        "Shared with proc10 [10]:\n" +
        kHeadWide + kDashWide +
        "    1 pages       0 pages       0 pages       0 pages       0 pages          2    shared memory\n" +
        kDashWide +
        "    1 pages       0 pages       0 pages       0 pages       0 pages          2    TOTAL\n"
        "\n" +
        kNotBrokenDown +
        kRule90 + "\n" +
        "Summary Heft: 4 pages\n" +
        kRule90 + "\n\n" +
        kHeadWide + kDashWide +
        // Equal dirty figures: the one with more clean memory first.
        "    2 pages       1 pages       0 pages       0 pages       0 pages          1    untagged\n"
        "    1 pages       0 pages       1 pages       0 pages       0 pages          1    mapped file /usr/lib/libbar.so\n"
        "    1 pages       0 pages       0 pages       0 pages       0 pages          2    shared memory\n" +
        kDashWide +
        "    4 pages       1 pages       1 pages       0 pages       0 pages          4    TOTAL\n"
        "\n";
    EXPECT_EQ(textReport(processes, HTTextFormatPages, HTTextOptionWired | HTTextOptionSwapped | HTTextOptionWide,
                         "Dirty"),
              expected);
}

TEST_F(HTReportGoldenTest, VerboseListingAndRowsSortedByCategory)
{
    // Mapped but never touched: last by dirty size, third by name.
    HTScriptedRegion stack = region(5, "stack", 0);
    stack.size = kPage;
    auto p10 = process(10, {at(region(4, "IOKit", 2), 0x10000),
                            at(withPath(region(3, "mapped file", 1, 1), "/lib/x.so"), 0x20000),
                            at(stack, 0x30000),
                            // Only the low 40 bits of the object id are listed.
                            at(region(0x12300000002, "untagged", 3), 0x40000)});

    const std::string expected =
        "proc10 [10]\n\n"
        "           start                end  [objectid]      VRT     DRT     CLN     RCL   tag (detail)\n"
        "      ----------         ----------  ----------    -----   -----   -----   -----   ------------\n"
        "           10000 -            12000 [         4]       2       2       0       0   IOKit\n"
        "           20000 -            22000 [         3]       2       1       1       0   mapped file .../x.so\n"
        "           30000 -            31000 [         5]       1       0       0       0   stack\n"
        "           40000 -            43000 [2300000002]       3       3       0       0   untagged\n"
        "\n" +
        kRule70 + "\n" +
        "proc10 [10]: 64-bit\tHeft: 24 KB (4096 bytes per page)\n" +
        kRule70 + "\n\n" +
        kHeadFormatted + kDashFormatted +
        " 8192 B        0 B          0 B          1    IOKit\n"
        " 4096 B     4096 B          0 B          1    mapped file .../x.so\n"
        "    0 B        0 B          0 B          1    stack\n"
        "  12 KB        0 B          0 B          1    untagged\n" +
        kDashFormatted +
        "  24 KB     4096 B          0 B          4    TOTAL\n"
        "\n" +
        kNotBrokenDown;
    EXPECT_EQ(textReport({p10}, HTTextFormatFormatted, 0, "Category", /*verbose=*/true), expected);
}

TEST_F(HTReportGoldenTest, ErrorsAndWarningsInHeadersDiagnosticsAndSummary)
{
    auto failed = process(10, {region(2, "heap", 2)});
    failed->scriptError("cannot read");
    auto warned = process(20, {region(1, "untagged", 1)});
    warned->scriptWarning("exited");

    const std::string expected =
        kRule70 + "\n" +
        "proc10 [10]: 64-bit\n"
        "Errors were encountered while examining the process. No results gathered.\n"
        "\tcannot read\n" +
        kRule70 + "\n\n" +
        kHeadFormatted + kDashFormatted + kDashFormatted +
        "    0 B        0 B          0 B          0    TOTAL\n"
        "\n" +
        kRule70 + "\n" +
        "proc20 [20]: 64-bit\n"
        "Warnings were encountered while examining the process.\n"
        "\texited\n"
        "\tHeft: 4096 B (4096 bytes per page)\n" +
        kRule70 + "\n\n" +
        kHeadFormatted + kDashFormatted +
        " 4096 B        0 B          0 B          1    untagged\n" +
        kDashFormatted +
        " 4096 B        0 B          0 B          1    TOTAL\n"
        "\n"
        "\n"
        "Warnings were encountered while examining the following processes:\n"
        "\tproc20\n"
        "\n"
        "Errors were encountered while examining the following processes:\n"
        "\tproc10\n"
        "\n"
        "Due to errors, summary results may be invalid\n" +
        kNotBrokenDown +
        kRule70 + "\n" +
        "Summary Heft: 12 KB (may be invalid due to errors)\n" +
        kRule70 + "\n\n" +
        kHeadFormatted + kDashFormatted +
        " 8192 B        0 B          0 B          1    heap\n"
        " 4096 B        0 B          0 B          1    untagged\n" +
        kDashFormatted +
        "  12 KB        0 B          0 B          2    TOTAL\n"
        "\n";
    EXPECT_EQ(textReport({warned, failed}, HTTextFormatFormatted, 0, "Dirty"), expected);
}

TEST_F(HTReportGoldenTest, JSONBesideTextCountsSharedObjectOnce)
{
    char dir[] = "/tmp/htgoldenXXXXXX";
    ASSERT_NE(mkdtemp(dir), nullptr);
    const std::string path = std::string(dir) + "/report.json";

    auto processes = twoSharing(region(1, "shared memory", 1), region(2, "untagged", 2), region(3, "untagged", 1));
    char* buffer = nullptr;
    size_t length = 0;
    FILE* stream = open_memstream(&buffer, &length);
    {
        auto heft = gathered(processes);
        heft->addOutputFormatter(std::make_shared<HTOutputFormatterText>(HTTextFormatBytes, 0, "Dirty", false, stream));
        std::string error;
        auto json = HTOutputFormatterJSON::initWithPath(path, false, kPage, &error);
        ASSERT_NE(json, nullptr) << error;
        heft->addOutputFormatter(json);
        heft->printOutputVerbose(false, false);
    }
    fclose(stream);
    const std::string text(buffer, length);
    free(buffer);
    EXPECT_NE(text.find("Summary Heft: 16384 B\n"), std::string::npos);

    std::ifstream in(path);
    std::stringstream contents;
    contents << in.rdbuf();
    rapidjson::Document document;
    document.Parse(contents.str().c_str());
    ASSERT_FALSE(document.HasParseError()) << contents.str();
    ASSERT_TRUE(document.IsObject());

    std::vector<std::string> keys;
    for (auto it = document.MemberBegin(); it != document.MemberEnd(); ++it) keys.emplace_back(it->name.GetString());
    EXPECT_EQ(keys, (std::vector<std::string>{"unit", "bytes per unit", "vm_object_dirty_analysis", "processes",
                                              "errors", "warnings", "summary", "total heft", "auxiliary", "shared",
                                              "page size"}));

    const auto& reported = document["processes"];
    ASSERT_TRUE(reported.IsArray());
    ASSERT_EQ(reported.Size(), 2u);
    EXPECT_EQ(reported[0]["pid"].GetInt(), 10);
    EXPECT_EQ(reported[0]["heft"].GetUint64(), 3 * kPage);
    EXPECT_EQ(reported[1]["pid"].GetInt(), 20);
    EXPECT_EQ(reported[1]["heft"].GetUint64(), 2 * kPage);
    // 3 + 2 pages of heft, but the shared page is one page of memory.
    EXPECT_EQ(document["total heft"].GetUint64(), 4 * kPage);
    EXPECT_EQ(document["shared"].Size(), 1u);
    EXPECT_EQ(document["page size"].GetUint64(), kPage);

    std::remove(path.c_str());
    rmdir(dir);
}

}  // namespace
