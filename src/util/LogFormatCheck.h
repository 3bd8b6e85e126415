// The compile-time check of an object format against its arguments: each conversion must take an
// argument of the type it reads (as -Wformat checks a printf format), "%@" a plist::Value pointer,
// and there must be as many arguments as conversions. A mismatch does not compile.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <type_traits>

namespace tavrix {

namespace plist {
class Value;
}

namespace logformat {

// What an argument is once it has passed through "...".
enum class Kind {
    Int,
    Long,
    LongLong,
    Double,
    LongDouble,
    Text,
    WideText,
    Value,
    Null,
    Pointer,
    Other
};

template <typename T>
consteval Kind kindOf() {
    using U = std::remove_cv_t<T>;
    if constexpr (std::is_same_v<U, std::nullptr_t>) {
        return Kind::Null;
    } else if constexpr (std::is_pointer_v<U>) {
        using Pointee = std::remove_cv_t<std::remove_pointer_t<U>>;
        if constexpr (std::is_same_v<Pointee, char>) {
            return Kind::Text;
        } else if constexpr (std::is_same_v<Pointee, wchar_t>) {
            return Kind::WideText;
        } else if constexpr (std::is_same_v<Pointee, plist::Value>) {
            return Kind::Value;
        } else {
            return Kind::Pointer;
        }
    } else if constexpr (std::is_same_v<U, long> || std::is_same_v<U, unsigned long>) {
        return Kind::Long;
    } else if constexpr (std::is_same_v<U, long long> || std::is_same_v<U, unsigned long long>) {
        return Kind::LongLong;
    } else if constexpr (std::is_integral_v<U> && sizeof(U) <= sizeof(int)) {
        // Promoted to int (or passed as unsigned int, of the same width).
        return Kind::Int;
    } else if constexpr (std::is_same_v<U, float> || std::is_same_v<U, double>) {
        return Kind::Double;
    } else if constexpr (std::is_same_v<U, long double>) {
        return Kind::LongDouble;
    } else {
        return Kind::Other;
    }
}

// Not constexpr: reaching it while checking a format stops the compilation there.
void formatDoesNotMatchItsArguments();

constexpr bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

constexpr bool isPointer(Kind kind) {
    return kind == Kind::Pointer || kind == Kind::Text || kind == Kind::WideText ||
           kind == Kind::Value || kind == Kind::Null;
}

template <std::size_t Count>
consteval void check(const char* format, const std::array<Kind, Count>& arguments) {
    std::size_t next = 0;
    auto take = [&](auto accepts) {
        if (next >= Count || !accepts(arguments[next])) {
            formatDoesNotMatchItsArguments();
        }
        ++next;
    };
    auto is = [](Kind wanted) { return [wanted](Kind kind) { return kind == wanted; }; };
    for (const char* p = format; *p != '\0'; ++p) {
        if (*p != '%') {
            continue;
        }
        ++p;
        while (*p == '-' || *p == '+' || *p == ' ' || *p == '#' || *p == '0' || *p == '\'') {
            ++p;
        }
        for (int part = 0; part < 2; ++part) {
            if (*p == '*') {
                take(is(Kind::Int));
                ++p;
            }
            while (isDigit(*p)) {
                ++p;
            }
            if (part == 0 && *p != '.') {
                break;
            }
            if (part == 0) {
                ++p;
            }
        }
        // The length modifier: which integer or real the conversion reads.
        Kind integer = Kind::Int;
        bool longForm = false;
        if (*p == 'h') {
            p += p[1] == 'h' ? 2 : 1;
        } else if (*p == 'l' && p[1] == 'l') {
            integer = Kind::LongLong;
            p += 2;
        } else if (*p == 'q') {
            integer = Kind::LongLong;
            ++p;
        } else if (*p == 'l') {
            integer = Kind::Long;
            longForm = true;
            ++p;
        } else if (*p == 'j' || *p == 'z' || *p == 't') {
            // Whichever type the platform's intmax_t, size_t and ptrdiff_t are.
            integer = *p == 'j'   ? kindOf<std::intmax_t>()
                      : *p == 'z' ? kindOf<std::size_t>()
                                  : kindOf<std::ptrdiff_t>();
            ++p;
        } else if (*p == 'L') {
            longForm = true;
            ++p;
        }
        switch (*p) {
            case '\0':
                // A lone '%' ends the format as text.
                --p;
                break;
            case 'd':
            case 'i':
            case 'u':
            case 'o':
            case 'x':
            case 'X':
                take(is(integer));
                break;
            case 'c':
                take(is(Kind::Int));
                break;
            case 'e':
            case 'E':
            case 'f':
            case 'F':
            case 'g':
            case 'G':
            case 'a':
            case 'A':
                take(is(longForm ? Kind::LongDouble : Kind::Double));
                break;
            case 's':
                take([longForm](Kind kind) {
                    return kind == (longForm ? Kind::WideText : Kind::Text) || kind == Kind::Null;
                });
                break;
            case '@':
                take([](Kind kind) { return kind == Kind::Value || kind == Kind::Null; });
                break;
            case 'p':
            case 'n':
                take(isPointer);
                break;
            default:
                // "%%", and an unknown conversion kept as text, read nothing.
                break;
        }
    }
    if (next != Count) {
        formatDoesNotMatchItsArguments();
    }
}

}  // namespace logformat

// An object format checked against the types of the arguments that follow it.
template <typename... Args>
struct ObjectFormat {
    consteval ObjectFormat(const char* format) : text(format) {
        logformat::check(
            format, std::array<logformat::Kind, sizeof...(Args)>{logformat::kindOf<Args>()...});
    }
    const char* text;
};

}  // namespace tavrix
