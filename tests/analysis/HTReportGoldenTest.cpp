// Whole reports, text and JSON, compared character for character with the
// expected reports: the one place that asserts the text of whole reports.
// tests/data/reports/README.md says how scenarios are written.

#include "analysis/HTHeftTestSupport.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "output/HTExpectedReport.h"
#include "output/HTOutputFormatterJSON.h"
#include "output/HTOutputFormatterText.h"
#include "process/HTKernelProcess.h"
#include "process/HTKernelScript.h"

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
            if (kind == "global-error") HTProcess::_addGlobalError(line.argument);
            if (kind == "kernel") {
                auto kernel = std::make_shared<HTKernelProcess>(platform_);
                kernel->setSettings(settings_);
                kernel->initWithBsdInfo(
                    platform_->addProcess(0, 0, "kernel", {}, PROC_FLAG_SYSTEM | PROC_FLAG_LP64).info);
                processes.push_back(kernel);
            }
            scriptKernel(*platform_, line);
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
                settings_.summaryFormat = static_cast<int64_t>(line.number("format", HTTextFormatFormatted));
                settings_.textOptions = static_cast<int64_t>(line.number("options"));
                settings_.textSort = line.text("sort").value_or("Dirty");
                settings_.verbose = line.number("verbose");
                settings_.summarize = line.number("summarize");
                settings_.breakDownPhysHeft = line.number("breakdown");
                settings_.sharingAnalysisDisabled = line.number("nosharing");
                platform_->sharedPagesIdentifiable = !line.number("noidentities");
            } else if (kind == "process") {
                processes.push_back(last = process(std::stoi(line.argument), {}, line.text("bits") != "32"));
                if (line.text("name")) last->setName(*line.text("name"));
                last->setDisplayString(last->name() + " [" + line.argument + "]");
                last->setHiddenFromDisplay(line.text("hidden").has_value());
                for (auto [at, end] = line.fields.equal_range("warning"); at != end; ++at)
                    last->warnings().push_back(at->second);
                if (auto error = line.text("error")) last->scriptError(*error);
                last->setPageSize(line.number("pagesize", kPage));
            } else if (kind == "forked") {
                std::vector<std::string> pages;
                std::istringstream list(line.text("pages").value_or(""));
                for (std::string page; std::getline(list, page, ',');) pages.push_back(page);
                processes.push_back(forkedProcess(platform_, std::stoi(line.argument), pages, line.number("per"),
                                                  settings_, line.text("file")));
            } else if (kind == "region") {
                const uint64_t dirty = line.number("dirty"), clean = line.number("clean"),
                               swapped = line.number("swapped");
                last->script().push_back(
                    {.objectId = line.number("id"),
                     .offset = line.number("offset") * kPage,
                     .size = line.number("pages", dirty + clean + swapped) * kPage + line.number("extra"),
                     .dirty = dirty * kPage,
                     .swapped = swapped * kPage,
                     .clean = clean * kPage,
                     .shareMode = line.text("cow") ? SM_COW : SM_SHARED,
                     .segment = static_cast<uint8_t>(line.number("segment", HTSegmentNoImage)),
                     .name = line.text("name"),
                     .detailedName = line.text("path"),
                     .inSharedCache = line.text("cache").has_value(),
                     .start = line.number("start"),
                     .owned = line.text("owned").has_value(),
                     .fake = line.text("unmapped").has_value(),
                     .wired = line.text("wired").has_value(),
                     .reclaimable = line.number("reclaimable") * kPage});
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
