// Whole JSON documents, awkward names among them, are compared with expected
// reports in analysis/HTReportGoldenTest.cpp; here, the mending of bytes
// that are not UTF-8 and the file that cannot be opened.

#include "output/HTOutputFormatterJSON.h"

#include <gtest/gtest.h>

#include <string>

TEST(HTOutputFormatterJSON, ValidUTF8MendsOnlyBadBytes)
{
    std::string scratch;
    // Well-formed text, up to four-byte sequences, passes through uncopied.
    const std::string good = "ascii \xc3\xbc \xe2\x82\xac \xf0\x9f\x98\x80 \xf4\x8f\xbf\xbf";
    EXPECT_EQ(HTOutputFormatterJSON::validUTF8(good, scratch).data(), good.data());
    // Overlong forms, a surrogate, above U+10FFFF, truncated sequences,
    // stray continuation bytes; "?" stands for U+FFFD.
    const std::pair<std::string, std::string> rows[] = {
        {"\xc0\x80", "??"},           {"\xe0\x80\xaf", "???"}, {"\xed\xa0\x80", "???"},
        {"\xf4\x90\x80\x80", "????"}, {"x\xe2\x82", "x??"},    {"\xe2\x82x\xe2\x82\xac", "??x\xe2\x82\xac"},
        {"\x80\xbf", "??"},
    };
    for (const auto& [in, mended] : rows) {
        std::string expected;
        for (char c : mended) expected += c == '?' ? "\xEF\xBF\xBD" : std::string(1, c);
        EXPECT_EQ(std::string(HTOutputFormatterJSON::validUTF8(in, scratch)), expected) << mended;
    }
}

TEST(HTOutputFormatterJSON, UnopenablePathGivesNoFormatter)
{
    std::string error;
    EXPECT_EQ(HTOutputFormatterJSON::initWithPath("/nonexistent-heft-dir/report.json", true, 4096, &error), nullptr);
    EXPECT_EQ(error, "Unable to open JSON output file '/nonexistent-heft-dir/report.json': No such file or directory");
}
