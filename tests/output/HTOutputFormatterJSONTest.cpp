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

// Writes one run with `process` as its only block, and parses the file,
// which must be valid UTF-8 JSON written compactly: the parsed document
// written back out gives the file byte for byte. Whole documents are
// compared with expected reports in analysis/HTReportGoldenTest.cpp.
rapidjson::Document writtenRun(const std::shared_ptr<TestProcess>& process, const HTCategoryMap& categories,
                               const std::shared_ptr<HTAuxDataMap>& aux)
{
    char directory[] = "/tmp/heft-json-test-XXXXXX";
    EXPECT_NE(mkdtemp(directory), nullptr);
    const std::string path = std::string(directory) + "/report.json";
    std::string error;
    auto formatter = HTOutputFormatterJSON::initWithPath(path, true, kKernelPage, &error);
    EXPECT_NE(formatter, nullptr) << error;
    if (process) {
        formatter->printProcessHeader(*process);
        if (process->errors().empty()) formatter->printProcessTotal(0, *process);
        formatter->endProcessHeader(*process);
        formatter->printProcessCategories(categories, HTMemoryTotals{});
        formatter->printProcessAuxData(aux);
    }
    formatter->printProcessesWithWarnings({}, {}, {});
    formatter->printSummaryCategories({}, {}, false);
    formatter->printGlobalAuxData(nullptr);
    formatter->end();

    std::ifstream in(path, std::ios::binary);
    std::stringstream content;
    content << in.rdbuf();
    const std::string raw = content.str();
    std::remove(path.c_str());
    rmdir(directory);
    rapidjson::Document document;
    document.Parse<rapidjson::kParseValidateEncodingFlag>(raw.data(), raw.size());
    EXPECT_FALSE(document.HasParseError()) << "error " << document.GetParseError() << " in " << raw;
    EXPECT_EQ(document.HasParseError() ? raw : json(document), raw);
    return document;
}

TEST(HTOutputFormatterJSON, PageSizeFallsBackToTheKernelPageSize)
{
    auto noPageSize = process(1);
    noPageSize->setPageSize(0);
    for (const auto& p : {std::shared_ptr<TestProcess>(), noPageSize}) {
        auto doc = writtenRun(p, {}, nullptr);
        ASSERT_TRUE(doc.IsObject());
        EXPECT_EQ(doc["page size"].GetUint64(), kKernelPage) << (p ? "process without page size" : "no process");
    }
}

TEST(HTOutputFormatterJSON, AwkwardStringsStillGiveValidJSON)
{
    const std::string awkward = std::string("a\"b\\c\x01\td") + '\0' + "e\xff" + "f\xc3\xbc";
    const std::string mended = std::string("a\"b\\c\x01\td") + '\0' + "e\xEF\xBF\xBD" + "f\xc3\xbc";
    auto p = process(7, awkward);
    p->fail(awkward);
    HTCategoryMap categories;
    categories.add(awkward, std::make_shared<HTMemoryCategory>(HTSegmentNoImage));
    auto aux = std::make_shared<HTAuxDataMap>();
    aux->set(awkward, std::make_shared<HTAuxData>(3, false));

    auto doc = writtenRun(p, categories, aux);
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
