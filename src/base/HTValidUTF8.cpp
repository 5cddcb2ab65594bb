#include "base/HTValidUTF8.h"

namespace {

// The length of the well-formed UTF-8 sequence at the start of `p` (which
// holds `left` > 0 bytes), or 0 when none starts there. Overlong forms,
// surrogates and code points above U+10FFFF are not well-formed.
size_t wellFormedSequenceLength(const unsigned char* p, size_t left)
{
    const unsigned char lead = p[0];
    if (lead < 0x80) return 1;
    size_t length;
    unsigned char low = 0x80;  // the range of the second byte
    unsigned char high = 0xBF;
    if (lead >= 0xC2 && lead <= 0xDF) {
        length = 2;
    } else if (lead == 0xE0) {
        length = 3;
        low = 0xA0;
    } else if (lead == 0xED) {
        length = 3;
        high = 0x9F;
    } else if (lead >= 0xE1 && lead <= 0xEF) {
        length = 3;
    } else if (lead == 0xF0) {
        length = 4;
        low = 0x90;
    } else if (lead >= 0xF1 && lead <= 0xF3) {
        length = 4;
    } else if (lead == 0xF4) {
        length = 4;
        high = 0x8F;
    } else {
        return 0;
    }
    if (left < length || p[1] < low || p[1] > high) return 0;
    for (size_t i = 2; i < length; ++i) {
        if ((p[i] & 0xC0) != 0x80) return 0;
    }
    return length;
}

constexpr std::string_view kReplacementCharacter = "\xEF\xBF\xBD";

}  // namespace

std::string_view htValidUTF8(std::string_view text, std::string& scratch)
{
    const auto* bytes = reinterpret_cast<const unsigned char*>(text.data());
    size_t index = 0;
    size_t length = 0;
    while (index < text.size() && (length = wellFormedSequenceLength(bytes + index, text.size() - index)) != 0)
        index += length;
    if (index == text.size()) return text;

    // Mend from the first bad byte on. Each bad byte becomes one U+FFFD of
    // its own, so the number of bytes lost stays visible.
    scratch.assign(text.substr(0, index));
    while (index < text.size()) {
        length = wellFormedSequenceLength(bytes + index, text.size() - index);
        if (length == 0) {
            scratch.append(kReplacementCharacter);
            ++index;
        } else {
            scratch.append(text.substr(index, length));
            index += length;
        }
    }
    return scratch;
}
