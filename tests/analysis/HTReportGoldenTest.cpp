// Whole reports, text and JSON, compared character for character with the
// expected reports under tests/data/reports/. This is the one place that
// asserts the text of whole reports. Each NAME.scenario there scripts the
// processes of one run, which are gathered and reported into NAME.txt and
// NAME.json. When a change to the output is meant, run the tests with
// HEFT_UPDATE_REPORTS=1: the reports are written back from what heft prints
// now, and the diff of tests/data/ shows what changed.
//
// A scenario is lines of a keyword and then pairs of a key and a value;
// values may be quoted, %XX stands for a byte, # starts a comment line.
//   set format F options O sort S verbose 1 summarize 1 breakdown 1
//   process PID bits 32 hidden 1 name N warning W error E  (warnings repeat)
//   region id I name N path P dirty D clean C swapped S pages P extra B
//          start A offset P owned 1 unmapped 1   (sizes in pages, extra in bytes)
//   aux [KEY VALUE]   (VALUE "map" opens a map for the aux lines after it)
//   global-error E

#include "analysis/HTHeftTestSupport.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "output/HTOutputFormatterJSON.h"
#include "output/HTOutputFormatterText.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iomanip>
#include <map>
#include <sstream>
#include <string>

namespace {

const std::string kReports = std::string(HEFT_TEST_DATA_DIR) + "/reports/";

std::string contents(const std::string& path)
{
    std::stringstream text;
    text << std::ifstream(path, std::ios::binary).rdbuf();
    return text.str();
}

std::string decoded(const std::string& text)
{
    std::string bytes;
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '%')
            bytes += text[i];
        else
            bytes += static_cast<char>(std::stoi(text.substr(i + 1, 2), nullptr, 16)), i += 2;
    }
    return bytes;
}

class HTReportGoldenTest : public HTAnalysisTest {
protected:
    struct Script {
        int32_t pid;
        std::map<std::string, std::string> fields;
        std::vector<std::string> warnings;
        std::vector<HTScriptedRegion> regions;
        std::shared_ptr<HTAuxDataMap> aux, auxInto;
    };

    // The processes of the scenario, after its settings.
    HTHeft::ProcessList readScenario(const std::string& path)
    {
        settings_.summarize = false;
        std::vector<Script> scripts;
        std::istringstream lines(contents(path));
        for (std::string line, kind; std::getline(lines, line);) {
            std::istringstream in(line);
            if (!(in >> kind) || kind[0] == '#') continue;
            Script read{};
            if (kind == "process") in >> read.pid;
            std::string key, value;
            if (kind == "aux") in >> std::quoted(key) >> std::quoted(value);
            if (kind == "global-error") in >> std::quoted(value);
            while (in >> std::quoted(key) >> std::quoted(value)) {
                if (key == "warning")
                    read.warnings.push_back(decoded(value));
                else
                    read.fields[key] = decoded(value);
            }
            auto number = [&](const char* name) {
                return read.fields.count(name) ? std::stoull(read.fields[name], nullptr, 0) : 0;
            };
            if (kind == "set") {
                if (read.fields.count("format")) settings_.summaryFormat = static_cast<int64_t>(number("format"));
                settings_.textOptions = static_cast<int64_t>(number("options"));
                if (read.fields.count("sort")) settings_.textSort = read.fields["sort"];
                settings_.verbose = number("verbose");
                settings_.summarize = number("summarize");
                settings_.breakDownPhysHeft = number("breakdown");
            } else if (kind == "process") {
                scripts.push_back(read);
            } else if (kind == "region") {
                const uint64_t dirty = number("dirty"), clean = number("clean"), swapped = number("swapped");
                HTScriptedRegion region{.objectId = number("id"),
                                        .offset = number("offset") * kPage,
                                        .size = (number("pages") ?: dirty + clean + swapped) * kPage + number("extra"),
                                        .dirty = dirty * kPage,
                                        .swapped = swapped * kPage,
                                        .clean = clean * kPage,
                                        .name = std::nullopt,
                                        .start = number("start"),
                                        .owned = number("owned") != 0,
                                        .fake = number("unmapped") != 0};
                if (read.fields.count("name")) region.name = read.fields["name"];
                if (read.fields.count("path")) region.detailedName = read.fields["path"];
                scripts.back().regions.push_back(region);
            } else if (kind == "aux") {
                Script& script = scripts.back();
                if (!script.aux) script.aux = script.auxInto = std::make_shared<HTAuxDataMap>();
                auto inner = std::make_shared<HTAuxDataMap>();
                if (!key.empty() && value == "map")
                    script.auxInto->set(key, inner), script.auxInto = inner;
                else if (!key.empty())
                    script.auxInto->set(key, std::make_shared<HTAuxData>(std::stoll(value), true));
            } else if (kind == "global-error") {
                HTProcess::_addGlobalError(decoded(value));
            }
        }
        HTHeft::ProcessList processes;
        for (Script& script : scripts) {
            auto made = process(script.pid, script.regions, script.fields["bits"] != "32");
            if (script.fields.count("name")) made->setName(script.fields["name"]);
            if (script.fields.count("name"))
                made->setDisplayString(made->name() + " [" + std::to_string(script.pid) + "]");
            made->setHiddenFromDisplay(script.fields["hidden"] == "1");
            made->warnings() = script.warnings;
            if (script.fields.count("error")) made->scriptError(script.fields["error"]);
            made->setAuxData(script.aux);
            processes.push_back(made);
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
            auto heft = gathered(processes);
            heft->addOutputFormatter(std::make_shared<HTOutputFormatterText>(settings_, text));
            heft->addOutputFormatter(
                HTOutputFormatterJSON::initWithPath(path + ".json", settings_.breakDownPhysHeft, 4 * kPage, nullptr));
            heft->printOutputVerbose(settings_.verbose, settings_.summarize);
            std::fclose(text);
        }
        const char* update = std::getenv("HEFT_UPDATE_REPORTS");
        for (const char* extension : {".txt", ".json"}) {
            const std::string actual = contents(path + extension), expected = kReports + name + extension;
            if (update && *update && std::string(update) != "0")
                std::ofstream(expected, std::ios::binary) << actual;
            else
                EXPECT_EQ(actual, contents(expected)) << "differs from " << expected;
            std::remove((path + extension).c_str());
        }
        settings_ = HTSettings{.breakDownPhysHeft = false};
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
