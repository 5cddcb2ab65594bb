#include "output/HTOutputFormatterJSON.h"

#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "model/HTMemoryCategory.h"
#include "model/HTMemoryRegion.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTProcess.h"

#include <gtest/gtest.h>
#include <rapidjson/document.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <unistd.h>
#include <vector>

namespace {

constexpr uint64_t kKernelPage = 4096;
constexpr uint64_t kProcessPage = 16384;

// A process whose errors a test can set.
class TestProcess : public HTProcess {
public:
    TestProcess(int32_t pid, std::string name) : HTProcess(std::make_shared<HTFakePlatform>())
    {
        setPid(pid);
        setName(std::move(name));
        setPageSize(kProcessPage);
    }
    void fail(std::string error) { addError(std::move(error)); }
};

std::shared_ptr<TestProcess> process(int32_t pid, std::string name = "proc")
{
    return std::make_shared<TestProcess>(pid, std::move(name));
}

// A category known only by its figures; it has no member to name it, so the
// writer files it under its key.
void addCategory(HTCategoryMap& map, const std::string& name, uint64_t dirty, uint64_t swapped = 0, uint64_t clean = 0,
                 uint64_t reclaimable = 0, uint64_t wired = 0)
{
    auto category = std::make_shared<HTMemoryCategory>(HTSegmentNoImage);
    category->setTotalDirtySize(dirty);
    category->setTotalSwappedSize(swapped);
    category->setTotalCleanSize(clean);
    category->setTotalReclaimableSize(reclaimable);
    category->setTotalWiredSize(wired);
    map.add(name, std::move(category));
}

std::shared_ptr<HTAuxDataMap> auxMap(std::initializer_list<std::pair<std::string, HTAuxDataMap::Value>> values)
{
    auto map = std::make_shared<HTAuxDataMap>();
    for (const auto& [key, value] : values) map->set(key, value);
    return map;
}

HTAuxDataMap::Value datum(int64_t value) { return std::make_shared<HTAuxData>(value, false); }

// Compact JSON text of a parsed value, keys in document order.
std::string json(const rapidjson::Value& value)
{
    rapidjson::StringBuffer buffer;
    rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
    value.Accept(writer);
    return std::string(buffer.GetString(), buffer.GetSize());
}

std::string text(const rapidjson::Value& value) { return std::string(value.GetString(), value.GetStringLength()); }

std::vector<std::string> keys(const rapidjson::Value& object)
{
    std::vector<std::string> names;
    for (const auto& member : object.GetObject()) names.push_back(text(member.name));
    return names;
}

class HTOutputFormatterJSONTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        char pattern[] = "/tmp/heft-json-test-XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        directory_ = pattern;
        path_ = directory_ + "/report.json";
    }

    void TearDown() override
    {
        std::remove(path_.c_str());
        rmdir(directory_.c_str());
    }

    std::shared_ptr<HTOutputFormatterJSON> open(bool breakDownPhysHeft = true)
    {
        std::string error;
        auto formatter = HTOutputFormatterJSON::initWithPath(path_, breakDownPhysHeft, kKernelPage, &error);
        EXPECT_NE(formatter, nullptr) << error;
        return formatter;
    }

    // One process block as the report assembly sends it.
    static void writeProcess(HTOutputFormatterJSON& formatter, const HTProcess& process, uint64_t heft,
                             const HTCategoryMap& categories, const std::shared_ptr<HTAuxDataMap>& aux)
    {
        formatter.printProcessHeader(process);
        if (process.errors().empty()) formatter.printProcessTotal(heft, process);
        formatter.endProcessHeader(process);
        formatter.printProcessCategories(categories, HTMemoryTotals{});
        formatter.printProcessAuxData(aux);
    }

    // The rest of the run after the process blocks.
    static void finishRun(HTOutputFormatterJSON& formatter, const HTCategoryMap& summary = {},
                          const HTMemoryTotals& total = {}, const std::shared_ptr<HTAuxDataMap>& globalAux = nullptr,
                          const HTOutputFormatter::ProcessList& withWarnings = {},
                          const HTOutputFormatter::ProcessList& withErrors = {},
                          const std::vector<std::string>& globalErrors = {})
    {
        formatter.printProcessesWithWarnings(withWarnings, withErrors, globalErrors);
        formatter.printSummaryCategories(summary, total, !withErrors.empty() || !globalErrors.empty());
        formatter.printGlobalAuxData(globalAux);
        formatter.end();
    }

    // Parses the file, which must be valid UTF-8 JSON written compactly:
    // the parsed document written back out gives the file byte for byte.
    // Whole documents are compared with expected reports in
    // analysis/HTReportGoldenTest.cpp.
    rapidjson::Document read()
    {
        std::ifstream in(path_, std::ios::binary);
        std::stringstream content;
        content << in.rdbuf();
        const std::string raw = content.str();

        rapidjson::Document document;
        document.Parse<rapidjson::kParseValidateEncodingFlag>(raw.data(), raw.size());
        EXPECT_FALSE(document.HasParseError())
            << "error " << document.GetParseError() << " at " << document.GetErrorOffset() << " in " << raw;
        if (!document.HasParseError()) {
            EXPECT_EQ(json(document), raw);
        }
        return document;
    }

    std::string directory_;
    std::string path_;
};

TEST_F(HTOutputFormatterJSONTest, PageSizeFallsBackToTheKernelPageSize)
{
    for (bool withProcess : {false, true}) {
        auto formatter = open();
        if (withProcess) {
            auto p = process(1);
            p->setPageSize(0);
            writeProcess(*formatter, *p, 0, HTCategoryMap{}, nullptr);
        }
        finishRun(*formatter);
        auto doc = read();
        ASSERT_TRUE(doc.IsObject());
        EXPECT_EQ(doc["page size"].GetUint64(), kKernelPage)
            << (withProcess ? "process without page size" : "no process");
    }
}

TEST_F(HTOutputFormatterJSONTest, AwkwardStringsStillGiveValidJSON)
{
    const std::string awkward = std::string("a\"b\\c\x01\td") + '\0' + "e\xff" + "f\xc3\xbc";
    const std::string mended = std::string("a\"b\\c\x01\td") + '\0' + "e\xEF\xBF\xBD" + "f\xc3\xbc";

    auto formatter = open();
    auto p = process(7, awkward);
    p->fail(awkward);
    HTCategoryMap categories;
    addCategory(categories, awkward, 1);
    writeProcess(*formatter, *p, 0, categories, auxMap({{awkward, datum(3)}}));
    finishRun(*formatter, {}, {}, nullptr, {}, {p});

    auto doc = read();
    ASSERT_TRUE(doc.IsObject());
    const auto& proc = doc["processes"][0];
    EXPECT_EQ(text(proc["name"]), mended);
    EXPECT_EQ(text(proc["errors"][0]), mended);
    EXPECT_EQ(keys(proc["categories"]), std::vector<std::string>{mended});
    EXPECT_EQ(keys(proc["auxiliary"]), std::vector<std::string>{mended});
}

TEST(HTOutputFormatterJSON, ValidUTF8MendsOnlyBadBytes)
{
    std::string scratch;
    auto mend = [&](const std::string& in) { return std::string(HTOutputFormatterJSON::validUTF8(in, scratch)); };
    const std::string fffd = "\xEF\xBF\xBD";

    // Well-formed text, up to four-byte sequences, passes through uncopied.
    const std::string good = "ascii \xc3\xbc \xe2\x82\xac \xf0\x9f\x98\x80 \xf4\x8f\xbf\xbf";
    EXPECT_EQ(HTOutputFormatterJSON::validUTF8(good, scratch).data(), good.data());

    EXPECT_EQ(mend("\xc0\x80"), fffd + fffd) << "overlong NUL";
    EXPECT_EQ(mend("\xe0\x80\xaf"), fffd + fffd + fffd) << "overlong three-byte form";
    EXPECT_EQ(mend("\xed\xa0\x80"), fffd + fffd + fffd) << "surrogate";
    EXPECT_EQ(mend("\xf4\x90\x80\x80"), fffd + fffd + fffd + fffd) << "above U+10FFFF";
    EXPECT_EQ(mend("x\xe2\x82"), "x" + fffd + fffd) << "truncated at the end";
    EXPECT_EQ(mend("\xe2\x82x\xe2\x82\xac"), fffd + fffd + "x\xe2\x82\xac") << "truncated before good text";
    EXPECT_EQ(mend("\x80\xbf"), fffd + fffd) << "stray continuation bytes";
}

TEST(HTOutputFormatterJSON, UnopenablePathGivesNoFormatter)
{
    std::string error;
    auto formatter =
        HTOutputFormatterJSON::initWithPath("/nonexistent-heft-dir/report.json", true, kKernelPage, &error);
    EXPECT_EQ(formatter, nullptr);
    EXPECT_EQ(error, "Unable to open JSON output file '/nonexistent-heft-dir/report.json': No such file or directory");
}

}  // namespace
