#include "output/HTSizeText.h"

#include <charconv>
#include <cstring>

namespace {

constexpr uint64_t kUnit = 1024;
constexpr char kPrefixes[] = {'\0', 'K', 'M', 'G', 'T', 'P', 'E'};
// The negative size whose magnitude no signed 64-bit count can hold. It is
// shown unscaled, cut to the seven characters a humanized size may take.
constexpr uint64_t kUnscalableSize = uint64_t{1} << 63;
constexpr const char kUnscalableText[] = "-922337";

size_t appendNumber(uint64_t value, char* out)
{
    return static_cast<size_t>(std::to_chars(out, out + 20, value).ptr - out);
}

size_t appendText(const char* text, size_t length, char* out)
{
    std::memcpy(out, text, length);
    return length;
}

}  // namespace

size_t htBytesText(uint64_t bytes, char* out)
{
    // Read as signed, as the humanized form reads it.
    const auto count = static_cast<int64_t>(bytes);
    size_t length = static_cast<size_t>(std::to_chars(out, out + 20, count).ptr - out);
    return length + appendText(" B", 2, out + length);
}

size_t htPagesText(uint64_t pages, char* out)
{
    size_t length = appendNumber(pages, out);
    return length + appendText(" pages", 6, out + length);
}

size_t htHumanizedText(uint64_t bytes, char* out)
{
    if (bytes == kUnscalableSize) return appendText(kUnscalableText, sizeof(kUnscalableText) - 1, out);
    const bool negative = bytes > kUnscalableSize;
    uint64_t magnitude = negative ? 0 - bytes : bytes;
    // Seven characters in all: four digits before " KB", or a sign and three.
    const uint64_t limit = negative ? 1000 : 10000;

    // Scale down while the number is too long, or is the longest that fits
    // but would round up to one digit more.
    uint64_t remainder = 0;
    size_t scale = 0;
    while (magnitude >= limit || (magnitude == limit - 1 && remainder >= kUnit / 2)) {
        remainder = magnitude % kUnit;
        magnitude /= kUnit;
        ++scale;
    }
    // Only the last division's remainder rounds.
    magnitude += (remainder + kUnit / 2) / kUnit;

    size_t length = 0;
    if (negative) out[length++] = '-';
    length += appendNumber(magnitude, out + length);
    out[length++] = ' ';
    if (scale > 0) out[length++] = kPrefixes[scale];
    out[length++] = 'B';
    return length;
}
