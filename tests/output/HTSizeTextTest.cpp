#include "output/HTSizeText.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>

namespace {

template<typename Format>
std::string text(Format format, uint64_t value)
{
    char out[kHTSizeTextCapacity];
    return std::string(out, format(value, out));
}

}  // namespace

TEST(HTSizeText, HumanizedSizesRoundAtEachUnitBoundary)
{
    const uint64_t KB = 1024, MB = KB * KB, GB = MB * KB;
    struct Row {
        uint64_t size;
        const char* expected;
    } rows[] = {
        {0, "0 B"},
        {9999, "9999 B"},
        {10000, "10 KB"},
        // Only the last division rounds, to nearest, half up.
        {10 * KB + 511, "10 KB"},
        {10 * KB + 512, "11 KB"},
        {9999 * KB + 511, "9999 KB"},
        // 9999.5 KB would take five digits: one unit up instead.
        {9999 * KB + 512, "10 MB"},
        {9999 * MB + 512 * KB - 1, "9999 MB"},
        {9999 * MB + 512 * KB, "10 GB"},
        {5 * GB, "5120 MB"},
        {INT64_MAX, "8192 PB"},
        // Sizes read as signed: a sign and at most three digits.
        {UINT64_MAX, "-1 B"},
        {UINT64_MAX - 998, "-999 B"},
        {UINT64_MAX - 999, "-1 KB"},
        {0 - MB, "-1 MB"},
        {(uint64_t{1} << 63) + 1, "-8 EB"},
        {uint64_t{1} << 63, "-922337"},
    };
    for (const Row& row : rows) EXPECT_EQ(text(htHumanizedText, row.size), row.expected) << row.size;
}

TEST(HTSizeText, BytesAndPagesAreWholeNumbers)
{
    EXPECT_EQ(text(htBytesText, 0), "0 B");
    EXPECT_EQ(text(htBytesText, 16384), "16384 B");
    EXPECT_EQ(text(htBytesText, INT64_MAX), "9223372036854775807 B");
    EXPECT_EQ(text(htBytesText, UINT64_MAX), "-1 B");
    EXPECT_EQ(text(htPagesText, 0), "0 pages");
    EXPECT_EQ(text(htPagesText, UINT64_MAX), "18446744073709551615 pages");
}
