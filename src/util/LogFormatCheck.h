// The compile-time check of an object format against its arguments: each conversion must take an
// argument of the type it reads (as -Wformat checks a printf format), "%@" a plist::Value pointer,
// and there must be as many arguments as conversions. A mismatch does not compile.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <type_traits>

#include "util/FormatConversion.h"

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

constexpr bool isPointer(Kind kind) {
    return kind == Kind::Pointer || kind == Kind::Text || kind == Kind::WideText ||
           kind == Kind::Value || kind == Kind::Null;
}

// The integer a conversion with this length reads, as the platform defines intmax_t, size_t and
// ptrdiff_t.
consteval Kind integerKind(Length length) {
    switch (length) {
        case Length::Long:
            return Kind::Long;
        case Length::LongLong:
            return Kind::LongLong;
        case Length::IntMax:
            return kindOf<std::intmax_t>();
        case Length::Size:
            return kindOf<std::size_t>();
        case Length::PtrDiff:
            return kindOf<std::ptrdiff_t>();
        default:
            return Kind::Int;
    }
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
    for (const char* p = format; *p != '\0';) {
        if (*p++ != '%') {
            continue;
        }
        const Conversion conversion = parseConversion(p);
        p = conversion.next;
        if (conversion.width == "*") {
            take(is(Kind::Int));
        }
        if (conversion.precision == "*") {
            take(is(Kind::Int));
        }
        const bool wide = conversion.length == Length::Long;
        switch (readsOf(conversion.letter)) {
            case Reads::Signed:
            case Reads::Unsigned:
                take(is(integerKind(conversion.length)));
                break;
            case Reads::Character:
                // An int, or a wint_t of the same width.
                take(is(Kind::Int));
                break;
            case Reads::Real:
                take(is(conversion.length == Length::LongDouble ? Kind::LongDouble : Kind::Double));
                break;
            case Reads::Text:
                take([wide](Kind kind) {
                    return kind == (wide ? Kind::WideText : Kind::Text) || kind == Kind::Null;
                });
                break;
            case Reads::Object:
                take([](Kind kind) { return kind == Kind::Value || kind == Kind::Null; });
                break;
            case Reads::Pointer:
                take(isPointer);
                break;
            case Reads::Count:
                // Writing through a log argument is never wanted.
                formatDoesNotMatchItsArguments();
                break;
            case Reads::Nothing:
                // "%%" and a lone '%' at the end are text; an unknown conversion is a typo.
                if (conversion.letter != '%' && conversion.letter != '\0') {
                    formatDoesNotMatchItsArguments();
                }
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
