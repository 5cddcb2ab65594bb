// Whole reports, text and JSON, compared character for character with the
// expected reports: the one place that asserts the text of whole reports.
// tests/data/reports/README.md says how scenarios are written.

#include "analysis/HTHeftTestSupport.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "output/HTExpectedReport.h"
#include "output/HTOutputFormatterJSON.h"
#include "output/HTOutputFormatterText.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iomanip>
#include <map>
#include <sstream>
#include <string>

namespace {

const std::string kReports = std::string(HEFT_TEST_DATA_DIR) + "/reports/";

class HTReportGoldenTest : public HTAnalysisTest {
protected:
    // The processes of the scenario, after its settings.
    HTHeft::ProcessList readScenario(const std::string& path)
    {
        settings_ = HTSettings{.breakDownPhysHeft = false, .summarize = false};
        HTHeft::ProcessList processes;
        std::shared_ptr<HTScriptedProcess> last;
        std::shared_ptr<HTAuxDataMap> auxInto;
        std::istringstream lines(contentsOf(path));
        for (std::string raw; std::getline(lines, raw);) {
            const HTScenarioLine line(raw);
            const std::string& kind = line.kind;
            auto text = [&](const char* key) { return line.text(key); };
            auto number = [&](const char* key, uint64_t fallback = 0) { return line.number(key, fallback); };
            if (kind == "global-error") HTProcess::_addGlobalError(line.argument);
            if (kind == "aux") {
                if (!last->auxData()) last->setAuxData(auxInto = std::make_shared<HTAuxDataMap>());
                if (line.fields.empty()) continue;
                const auto& [key, value] = *line.fields.begin();
                auto inner = std::make_shared<HTAuxDataMap>();
                auxInto->set(key,
                             value == "map" ? HTAuxDataMap::Value(inner)
                                            : std::make_shared<HTAuxData>(std::stoll(value), true));
                if (value == "map") auxInto = inner;
            }
            if (kind == "set") {
                settings_.summaryFormat = static_cast<int64_t>(number("format", HTTextFormatFormatted));
                settings_.textOptions = static_cast<int64_t>(number("options"));
                settings_.textSort = text("sort").value_or("Dirty");
                settings_.verbose = number("verbose");
                settings_.summarize = number("summarize");
                settings_.breakDownPhysHeft = number("breakdown");
                settings_.sharingAnalysisDisabled = number("nosharing");
                platform_->sharedPagesIdentifiable = !number("noidentities");
            } else if (kind == "process") {
                processes.push_back(last = process(std::stoi(line.argument), {}, text("bits") != "32"));
                if (text("name")) last->setName(*text("name"));
                last->setDisplayString(last->name() + " [" + line.argument + "]");
                last->setHiddenFromDisplay(text("hidden").has_value());
                for (auto [at, end] = line.fields.equal_range("warning"); at != end; ++at)
                    last->warnings().push_back(at->second);
                if (auto error = text("error")) last->scriptError(*error);
                last->setPageSize(number("pagesize", kPage));
            } else if (kind == "forked") {
                std::vector<std::string> pages;
                std::istringstream list(text("pages").value_or(""));
                for (std::string page; std::getline(list, page, ',');) pages.push_back(page);
                processes.push_back(
                    forkedProcess(platform_, std::stoi(line.argument), pages, number("per"), settings_, text("file")));
            } else if (kind == "region") {
                const uint64_t dirty = number("dirty"), clean = number("clean"), swapped = number("swapped");
                last->script().push_back({.objectId = number("id"),
                                          .offset = number("offset") * kPage,
                                          .size = number("pages", dirty + clean + swapped) * kPage + number("extra"),
                                          .dirty = dirty * kPage,
                                          .swapped = swapped * kPage,
                                          .clean = clean * kPage,
                                          .shareMode = text("cow") ? SM_COW : SM_SHARED,
                                          .segment = static_cast<uint8_t>(number("segment", HTSegmentNoImage)),
                                          .name = text("name"),
                                          .detailedName = text("path"),
                                          .inSharedCache = text("cache").has_value(),
                                          .start = number("start"),
                                          .owned = text("owned").has_value(),
                                          .fake = text("unmapped").has_value(),
                                          .wired = text("wired").has_value(),
                                          .reclaimable = number("reclaimable") * kPage});
            }
        }
        return processes;
    }

    // The kernel's page size differs from the processes' so that the JSON
    // shows which one it took.
    void expectReports(const std::string& name)
    {
        SCOPED_TRACE(name);
        const std::string path = testing::TempDir() + "heft-golden-report";
        {
            HTHeft::ProcessList processes = readScenario(kReports + name + ".scenario");
            FILE* text = std::fopen((path + ".txt").c_str(), "w");
            testing::internal::CaptureStderr();
            auto heft = gathered(processes);
            const std::string told = testing::internal::GetCapturedStderr();
            heft->addOutputFormatter(std::make_shared<HTOutputFormatterText>(settings_, text));
            heft->addOutputFormatter(
                HTOutputFormatterJSON::initWithPath(path + ".json", settings_.breakDownPhysHeft, 4 * kPage, nullptr));
            heft->printOutputVerbose(settings_.verbose, settings_.summarize);
            std::fprintf(text, "%s", told.c_str());
            std::fclose(text);
        }
        for (const char* extension : {".txt", ".json"}) {
            expectReport(name + extension, contentsOf(path + extension));
            std::remove((path + extension).c_str());
        }
        HTProcess::_clearGlobalErrors();
    }
};

TEST_F(HTReportGoldenTest, Reports)
{
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(kReports))
        if (entry.path().extension() == ".scenario") names.push_back(entry.path().stem());
    EXPECT_GE(names.size(), 12u);
    for (const std::string& name : names) expectReports(name);
}

}  // namespace
