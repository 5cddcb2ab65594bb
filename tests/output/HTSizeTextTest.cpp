#include "output/HTSizeText.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>

TEST(HTSizeText, EachFormatAtItsBoundaries)
{
    const uint64_t KB = 1024, MB = KB * KB, GB = MB * KB;
    const struct {
        size_t (*format)(uint64_t, char*);
        uint64_t size;
        const char* shown;
    } rows[] = {
        {htHumanizedText, 9999, "9999 B"},
        {htHumanizedText, 10000, "10 KB"},
        // Only the last division rounds, to nearest, half up.
        {htHumanizedText, 10 * KB + 511, "10 KB"},
        {htHumanizedText, 10 * KB + 512, "11 KB"},
        {htHumanizedText, 9999 * KB + 511, "9999 KB"},
        // 9999.5 KB would take five digits: one unit up instead.
        {htHumanizedText, 9999 * KB + 512, "10 MB"},
        {htHumanizedText, 9999 * MB + 512 * KB - 1, "9999 MB"},
        {htHumanizedText, 9999 * MB + 512 * KB, "10 GB"},
        {htHumanizedText, 5 * GB, "5120 MB"},
        {htHumanizedText, INT64_MAX, "8192 PB"},
        // Sizes read as signed: a sign and at most three digits.
        {htHumanizedText, UINT64_MAX, "-1 B"},
        {htHumanizedText, UINT64_MAX - 998, "-999 B"},
        {htHumanizedText, UINT64_MAX - 999, "-1 KB"},
        {htHumanizedText, 0 - MB, "-1 MB"},
        {htHumanizedText, (uint64_t{1} << 63) + 1, "-8 EB"},
        {htHumanizedText, uint64_t{1} << 63, "-922337"},
        {htBytesText, INT64_MAX, "9223372036854775807 B"},
        {htBytesText, UINT64_MAX, "-1 B"},
        {htPagesText, UINT64_MAX, "18446744073709551615 pages"},
    };
    for (const auto& row : rows) {
        char out[kHTSizeTextCapacity];
        EXPECT_EQ(std::string(out, row.format(row.size, out)), row.shown) << row.size;
    }
}
