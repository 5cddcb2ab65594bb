#include "output/HTTerminalText.h"

#include <cstdint>

namespace {

// The length of the valid UTF-8 sequence at the start of `text` that
// encodes a printable character; 0 when it is not one (a stray or
// truncated byte, an overlong form, a surrogate, a C1 control).
size_t printableSequenceLength(std::string_view text)
{
    const auto byte = [&](size_t i) { return static_cast<uint8_t>(text[i]); };
    const uint8_t lead = byte(0);
    size_t length;
    uint32_t code;
    if (lead >= 0x20 && lead < 0x7F) return 1;
    if (lead >= 0xC2 && lead <= 0xDF) {
        length = 2;
        code = lead & 0x1F;
    } else if (lead >= 0xE0 && lead <= 0xEF) {
        length = 3;
        code = lead & 0x0F;
    } else if (lead >= 0xF0 && lead <= 0xF4) {
        length = 4;
        code = lead & 0x07;
    } else {
        return 0;
    }
    if (text.size() < length) return 0;
    for (size_t i = 1; i < length; ++i) {
        if ((byte(i) & 0xC0) != 0x80) return 0;
        code = code << 6 | (byte(i) & 0x3F);
    }
    constexpr uint32_t kSmallest[] = {0, 0, 0x80, 0x800, 0x10000};
    if (code < kSmallest[length] || code > 0x10FFFF || (code >= 0xD800 && code <= 0xDFFF)) return 0;
    // C1 controls, which some terminals obey as escape sequences.
    if (code < 0xA0) return 0;
    return length;
}

void appendEscape(std::string& out, uint8_t byte)
{
    switch (byte) {
    case '\n':
        out.append("\\n");
        return;
    case '\t':
        out.append("\\t");
        return;
    case '\r':
        out.append("\\r");
        return;
    default:
        break;
    }
    constexpr char kHex[] = "0123456789ABCDEF";
    const char escape[] = {'\\', 'x', kHex[byte >> 4], kHex[byte & 0xF]};
    out.append(escape, sizeof(escape));
}

}  // namespace

void htAppendTerminalSafe(std::string& out, std::string_view text)
{
    while (!text.empty()) {
        const size_t length = printableSequenceLength(text);
        if (length == 0) {
            appendEscape(out, static_cast<uint8_t>(text.front()));
            text.remove_prefix(1);
        } else {
            out.append(text.data(), length);
            text.remove_prefix(length);
        }
    }
}

std::string htTerminalSafe(std::string_view text)
{
    std::string out;
    out.reserve(text.size());
    htAppendTerminalSafe(out, text);
    return out;
}
