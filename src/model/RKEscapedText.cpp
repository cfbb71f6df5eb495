#include "model/RKEscapedText.h"

#include <cstddef>

namespace {

// Length of the printable UTF-8 sequence that starts at text[at], or 0 when the byte there must
// be escaped. Follows the well-formed byte sequences of Unicode (no overlong forms, no
// surrogates, nothing above U+10FFFF).
size_t printableLength(std::string_view text, size_t at) {
    const auto lead = static_cast<unsigned char>(text[at]);
    if (lead >= 0x20 && lead < 0x7F) return 1;
    size_t length = 0;
    unsigned char low = 0x80;
    unsigned char high = 0xBF;
    if (lead == 0xC2) {
        length = 2;
        low = 0xA0;  // U+0080 to U+009F are the C1 controls
    } else if (lead >= 0xC3 && lead <= 0xDF) {
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
    if (text.size() - at < length) return 0;
    const auto second = static_cast<unsigned char>(text[at + 1]);
    if (second < low || second > high) return 0;
    for (size_t k = 2; k < length; ++k) {
        const auto next = static_cast<unsigned char>(text[at + k]);
        if (next < 0x80 || next > 0xBF) return 0;
    }
    return length;
}

}  // namespace

std::string RKEscapedText(std::string_view text) {
    static constexpr char kHex[] = "0123456789abcdef";
    std::string escaped;
    size_t copied = 0;  // text before this index is already in `escaped`
    size_t at = 0;
    while (at < text.size()) {
        const size_t length = printableLength(text, at);
        if (length > 0) {
            at += length;
            continue;
        }
        if (escaped.empty()) escaped.reserve(text.size() + 8);
        escaped.append(text.substr(copied, at - copied));
        const auto byte = static_cast<unsigned char>(text[at]);
        escaped += "\\x";
        escaped += kHex[byte >> 4];
        escaped += kHex[byte & 0xF];
        copied = ++at;
    }
    if (copied == 0) return std::string(text);
    escaped.append(text.substr(copied));
    return escaped;
}
