// One printf conversion as an object format reads it. The compile-time check of a format and the
// formatter that runs it both parse with this, so they cannot disagree on what a conversion takes.
#pragma once

#include <string_view>

namespace tavrix::logformat {

// The length modifier: which integer (or real, for 'L') a conversion reads.
enum class Length { None, Char, Short, Long, LongLong, IntMax, Size, PtrDiff, LongDouble };

// What a conversion letter reads from the arguments.
enum class Reads { Nothing, Signed, Unsigned, Character, Real, Text, Object, Pointer, Count };

constexpr Reads readsOf(char letter) {
    switch (letter) {
        case 'd':
        case 'i':
            return Reads::Signed;
        case 'u':
        case 'o':
        case 'x':
        case 'X':
            return Reads::Unsigned;
        case 'c':
            return Reads::Character;
        case 'e':
        case 'E':
        case 'f':
        case 'F':
        case 'g':
        case 'G':
        case 'a':
        case 'A':
            return Reads::Real;
        case 's':
            return Reads::Text;
        case '@':
            return Reads::Object;
        case 'p':
            return Reads::Pointer;
        case 'n':
            return Reads::Count;
        default:
            // "%%", an unknown conversion kept as text and a lone '%' at the end.
            return Reads::Nothing;
    }
}

struct Conversion {
    std::string_view flags;
    std::string_view width;  // digits, "*" (taken from the arguments) or ""
    bool hasPrecision = false;
    std::string_view precision;  // as width, after the '.'
    std::string_view lengthText;
    Length length = Length::None;
    char letter = '\0';          // '\0' when the format ends inside the conversion
    const char* next = nullptr;  // where the text after the conversion starts
};

constexpr bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

// Folds one length character into length; false when c is none.
constexpr bool takeLength(Length& length, char c) {
    switch (c) {
        case 'h':
            length = length == Length::Short ? Length::Char : Length::Short;
            return true;
        case 'l':
            length = length == Length::Long ? Length::LongLong : Length::Long;
            return true;
        case 'q':
            length = Length::LongLong;
            return true;
        case 'j':
            length = Length::IntMax;
            return true;
        case 'z':
            length = Length::Size;
            return true;
        case 't':
            length = Length::PtrDiff;
            return true;
        case 'L':
            length = Length::LongDouble;
            return true;
        default:
            return false;
    }
}

// The conversion whose '%' comes just before p.
constexpr Conversion parseConversion(const char* p) {
    auto span = [](const char* from, const char* to) {
        return std::string_view(from, static_cast<std::size_t>(to - from));
    };
    auto skipNumber = [](const char* at) {
        if (*at == '*') {
            return at + 1;
        }
        while (isDigit(*at)) {
            ++at;
        }
        return at;
    };
    Conversion conversion;
    const char* start = p;
    while (*p == '-' || *p == '+' || *p == ' ' || *p == '#' || *p == '0' || *p == '\'') {
        ++p;
    }
    conversion.flags = span(start, p);
    start = p;
    p = skipNumber(p);
    conversion.width = span(start, p);
    if (*p == '.') {
        conversion.hasPrecision = true;
        start = ++p;
        p = skipNumber(p);
        conversion.precision = span(start, p);
    }
    start = p;
    while (takeLength(conversion.length, *p)) {
        ++p;
    }
    conversion.lengthText = span(start, p);
    conversion.letter = *p;
    conversion.next = *p == '\0' ? p : p + 1;
    return conversion;
}

}  // namespace tavrix::logformat
