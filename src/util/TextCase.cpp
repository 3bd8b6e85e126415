#include "util/TextCase.h"

#include <locale.h>
#include <wctype.h>

#include <cstdint>

namespace tavrix {
namespace {

// The C.UTF-8 character tables are built into the C library, so this never depends on which
// locales the device image installs; without them only ASCII letters change.
locale_t unicodeTables() {
    static const locale_t tables = newlocale(LC_CTYPE_MASK, "C.UTF-8", locale_t{});
    return tables;
}

// The code point starting at text[at] and its length in bytes, or a length of 0 when the bytes
// there are not a valid, shortest-form sequence.
std::pair<char32_t, std::size_t> decodeAt(std::string_view text, std::size_t at) {
    auto lead = static_cast<unsigned char>(text[at]);
    if (lead < 0x80) {
        return {lead, 1};
    }
    std::size_t length = lead >= 0xF0 ? 4 : lead >= 0xE0 ? 3 : lead >= 0xC0 ? 2 : 0;
    if (length == 0 || lead > 0xF4 || at + length > text.size()) {
        return {0, 0};
    }
    char32_t codePoint = lead & (0x7F >> length);
    for (std::size_t i = 1; i < length; ++i) {
        auto next = static_cast<unsigned char>(text[at + i]);
        if ((next & 0xC0) != 0x80) {
            return {0, 0};
        }
        codePoint = (codePoint << 6) | (next & 0x3F);
    }
    static constexpr char32_t kSmallest[] = {0, 0, 0x80, 0x800, 0x10000};
    if (codePoint < kSmallest[length] || codePoint > 0x10FFFF ||
        (codePoint >= 0xD800 && codePoint <= 0xDFFF)) {
        return {0, 0};
    }
    return {codePoint, length};
}

void appendUtf8(std::string& out, char32_t codePoint) {
    if (codePoint < 0x80) {
        out += static_cast<char>(codePoint);
    } else if (codePoint < 0x800) {
        out += static_cast<char>(0xC0 | (codePoint >> 6));
        out += static_cast<char>(0x80 | (codePoint & 0x3F));
    } else if (codePoint < 0x10000) {
        out += static_cast<char>(0xE0 | (codePoint >> 12));
        out += static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (codePoint & 0x3F));
    } else {
        out += static_cast<char>(0xF0 | (codePoint >> 18));
        out += static_cast<char>(0x80 | ((codePoint >> 12) & 0x3F));
        out += static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (codePoint & 0x3F));
    }
}

char32_t lowercaseCodePoint(char32_t codePoint) {
    if (codePoint >= 'A' && codePoint <= 'Z') {
        return codePoint - 'A' + 'a';
    }
    locale_t tables = unicodeTables();
    if (codePoint < 0x80 || tables == locale_t{}) {
        return codePoint;
    }
    auto lowered = static_cast<char32_t>(towlower_l(static_cast<wint_t>(codePoint), tables));
    // A mapping outside the valid range would not encode; keep the original then.
    return lowered <= 0x10FFFF && !(lowered >= 0xD800 && lowered <= 0xDFFF) ? lowered : codePoint;
}

}  // namespace

std::string lowercaseText(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (std::size_t at = 0; at < text.size();) {
        auto [codePoint, length] = decodeAt(text, at);
        if (length == 0) {
            out += text[at++];
            continue;
        }
        appendUtf8(out, lowercaseCodePoint(codePoint));
        at += length;
    }
    return out;
}

}  // namespace tavrix
