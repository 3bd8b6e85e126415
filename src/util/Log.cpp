#include "util/Log.h"

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <cwchar>
#include <string_view>

#include "plist/Value.h"
#include "util/FormatConversion.h"
#include "util/SystemLog.h"

namespace tavrix {
namespace {

int syslogPriority(LogPriority priority) {
    return priority == LogPriority::Warning ? LOG_WARNING : LOG_NOTICE;
}

// Values (a "%s" text or a "%@" description) come from clients, carrier files and the network: a
// longer one is cut to this many bytes and marked, so one call cannot write megabytes of log.
constexpr std::size_t kMaxValueBytes = 2048;
constexpr std::string_view kCutMark = "...";

// Control characters in a value are written as escapes, so that a value can neither end its
// message early (a new line starts a new journal entry with a priority of its own) nor hide text.
void appendValue(std::string& out, std::string_view value) {
    bool cut = value.size() > kMaxValueBytes;
    if (cut) {
        value = value.substr(0, kMaxValueBytes);
    }
    for (char c : value) {
        auto byte = static_cast<unsigned char>(c);
        if (byte >= 0x20 && byte != 0x7F) {
            out += c;
        } else if (c == '\n') {
            out += "\\n";
        } else if (c == '\t') {
            out += "\\t";
        } else if (c == '\r') {
            out += "\\r";
        } else {
            static constexpr char kHex[] = "0123456789abcdef";
            out += "\\x";
            out += kHex[byte >> 4];
            out += kHex[byte & 0xF];
        }
    }
    if (cut) {
        out += kCutMark;
    }
}

using logformat::Length;
using logformat::Reads;

// Formats one printf conversion (already stripped of '*') with one argument.
template <typename T>
void appendFormatted(std::string& out, const std::string& spec, T value) {
    char small[256];
    int needed = std::snprintf(small, sizeof small, spec.c_str(), value);
    if (needed < 0) {
        return;
    }
    if (static_cast<std::size_t>(needed) < sizeof small) {
        out.append(small, static_cast<std::size_t>(needed));
        return;
    }
    std::string large(static_cast<std::size_t>(needed) + 1, '\0');
    std::snprintf(large.data(), large.size(), spec.c_str(), value);
    out.append(large.data(), static_cast<std::size_t>(needed));
}

void appendSigned(std::string& out, const std::string& spec, Length length, va_list& arguments) {
    switch (length) {
        case Length::Long:
            appendFormatted(out, spec, va_arg(arguments, long));
            break;
        case Length::LongLong:
            appendFormatted(out, spec, va_arg(arguments, long long));
            break;
        case Length::IntMax:
            appendFormatted(out, spec, va_arg(arguments, intmax_t));
            break;
        case Length::Size:
            appendFormatted(out, spec, va_arg(arguments, ssize_t));
            break;
        case Length::PtrDiff:
            appendFormatted(out, spec, va_arg(arguments, ptrdiff_t));
            break;
        default:
            appendFormatted(out, spec, va_arg(arguments, int));
            break;
    }
}

void appendUnsigned(std::string& out, const std::string& spec, Length length, va_list& arguments) {
    switch (length) {
        case Length::Long:
            appendFormatted(out, spec, va_arg(arguments, unsigned long));
            break;
        case Length::LongLong:
            appendFormatted(out, spec, va_arg(arguments, unsigned long long));
            break;
        case Length::IntMax:
            appendFormatted(out, spec, va_arg(arguments, uintmax_t));
            break;
        case Length::Size:
            appendFormatted(out, spec, va_arg(arguments, size_t));
            break;
        case Length::PtrDiff:
            appendFormatted(out, spec, va_arg(arguments, ptrdiff_t));
            break;
        default:
            appendFormatted(out, spec, va_arg(arguments, unsigned int));
            break;
    }
}

// The message an object format produces.
std::string formatObjectMessage(const char* format, va_list arguments) {
    std::string out;
    if (format == nullptr) {
        return out;
    }
    va_list cursor;
    va_copy(cursor, arguments);
    const char* p = format;
    while (*p != '\0') {
        const char* percent = std::strchr(p, '%');
        if (percent == nullptr) {
            out += p;
            break;
        }
        out.append(p, static_cast<std::size_t>(percent - p));
        const logformat::Conversion conversion = logformat::parseConversion(percent + 1);
        p = conversion.next;
        // Width and precision given as '*' are taken from the arguments and written in place;
        // spec leaves the length out, for the conversions that read a promoted argument.
        std::string spec = "%";
        spec += conversion.flags;
        auto appendNumber = [&](std::string_view number) {
            if (number == "*") {
                spec += std::to_string(va_arg(cursor, int));
            } else {
                spec += number;
            }
        };
        appendNumber(conversion.width);
        if (conversion.hasPrecision) {
            spec += '.';
            appendNumber(conversion.precision);
        }
        const char letter = conversion.letter;
        const std::string withLength = spec + std::string(conversion.lengthText);
        const Length length = conversion.length;
        switch (logformat::readsOf(letter)) {
            case Reads::Nothing:
                if (letter == '%') {
                    out += '%';
                } else {
                    // An unknown conversion, or the end of the format inside one, is kept as text.
                    out += withLength;
                    out += std::string_view(&letter, letter == '\0' ? 0 : 1);
                }
                break;
            case Reads::Object: {
                const auto* value = va_arg(cursor, const plist::Value*);
                appendValue(out, plist::describe(value));
                break;
            }
            case Reads::Signed:
                appendSigned(out, withLength + letter, length, cursor);
                break;
            case Reads::Unsigned:
                appendUnsigned(out, withLength + letter, length, cursor);
                break;
            case Reads::Character:
                if (length == Length::Long) {
                    appendFormatted(out, withLength + letter, va_arg(cursor, wint_t));
                } else {
                    appendFormatted(out, spec + letter, va_arg(cursor, int));
                }
                break;
            case Reads::Real:
                if (length == Length::LongDouble) {
                    appendFormatted(out, withLength + letter, va_arg(cursor, long double));
                } else {
                    appendFormatted(out, spec + letter, va_arg(cursor, double));
                }
                break;
            case Reads::Text:
                if (length == Length::Long) {
                    const auto* text = va_arg(cursor, const wchar_t*);
                    appendFormatted(out, withLength + letter, text == nullptr ? L"(null)" : text);
                } else {
                    const char* text = va_arg(cursor, const char*);
                    // Only what can be shown is read, and the rest is never copied.
                    std::string shown(text == nullptr ? "(null)" : text,
                                      text == nullptr ? 6 : ::strnlen(text, kMaxValueBytes + 1));
                    std::string formatted;
                    appendFormatted(formatted, spec + letter, shown.c_str());
                    appendValue(out, formatted);
                }
                break;
            case Reads::Pointer:
                appendFormatted(out, spec + letter, va_arg(cursor, void*));
                break;
            case Reads::Count:
                // Writing through a log argument is never wanted; the pointer is skipped.
                (void)va_arg(cursor, void*);
                break;
        }
    }
    va_end(cursor);
    return out;
}

}  // namespace

void logObjectFormatV(LogPriority priority, const char* format, va_list arguments) {
    writeSystemLog(syslogPriority(priority), formatObjectMessage(format, arguments));
}

void logObjectFormatV(const char* format, va_list arguments) {
    logObjectFormatV(LogPriority::Notice, format, arguments);
}

void logObjectFormatArguments(LogPriority priority, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    logObjectFormatV(priority, format, arguments);
    va_end(arguments);
}

// The same formatter as the object formats, so values are escaped and cut alike.
void logCFormat(LogPriority priority, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    logObjectFormatV(priority, format, arguments);
    va_end(arguments);
}

void logCFormat(const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    logObjectFormatV(LogPriority::Notice, format, arguments);
    va_end(arguments);
}

}  // namespace tavrix
