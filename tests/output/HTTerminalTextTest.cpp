#include "output/HTTerminalText.h"

#include <gtest/gtest.h>

#include <string>

TEST(HTTerminalText, ControlCharactersAndInvalidUTF8AreEscaped)
{
    const struct {
        std::string text;
        std::string shown;
    } rows[] = {
        {"plain name [42]", "plain name [42]"},
        {"caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x90\x8D", "caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x90\x8D"},
        {"evil\nSummary Heft: 0 B", "evil\\nSummary Heft: 0 B"},
        {"tab\there\rback", "tab\\there\\rback"},
        {"\x1B[7mreverse\x1B[0m", "\\x1B[7mreverse\\x1B[0m"},
        {std::string("nul\0byte", 8), "nul\\x00byte"},
        {"del\x7F", "del\\x7F"},
        // C1 controls, stray continuation bytes, truncated and overlong
        // sequences, surrogates.
        {"csi\xC2\x9B"
         "31m",
         "csi\\xC2\\x9B31m"},
        {"stray\x80", "stray\\x80"},
        {"cut\xE2\x82", "cut\\xE2\\x82"},
        {"overlong\xC0\xAF", "overlong\\xC0\\xAF"},
        {"surrogate\xED\xA0\x80", "surrogate\\xED\\xA0\\x80"},
        {"", ""},
    };
    for (const auto& row : rows) {
        EXPECT_EQ(htTerminalSafe(row.text), row.shown) << row.shown;
        std::string appended = "> ";
        htAppendTerminalSafe(appended, row.text);
        EXPECT_EQ(appended, "> " + row.shown);
    }
}
