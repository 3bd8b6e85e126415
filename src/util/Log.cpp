#include "util/Log.h"

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <cwchar>
#include <string_view>

#include "plist/Value.h"
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

enum class Length { None, Char, Short, Long, LongLong, IntMax, Size, PtrDiff, LongDouble };

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

}  // namespace

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
        p = percent + 1;
        std::string spec = "%";
        while (*p != '\0' && std::strchr("-+ #0'", *p) != nullptr) {
            spec += *p++;
        }
        // Width and precision given as '*' are taken from the arguments and written in place.
        auto takeNumber = [&]() {
            if (*p == '*') {
                spec += std::to_string(va_arg(cursor, int));
                ++p;
                return;
            }
            while (*p >= '0' && *p <= '9') {
                spec += *p++;
            }
        };
        takeNumber();
        if (*p == '.') {
            spec += *p++;
            takeNumber();
        }
        Length length = Length::None;
        std::size_t lengthStart = spec.size();
        for (bool more = true; more && *p != '\0';) {
            switch (*p) {
                case 'h':
                    length = length == Length::Short ? Length::Char : Length::Short;
                    break;
                case 'l':
                    length = length == Length::Long ? Length::LongLong : Length::Long;
                    break;
                case 'q':
                    length = Length::LongLong;
                    break;
                case 'j':
                    length = Length::IntMax;
                    break;
                case 'z':
                    length = Length::Size;
                    break;
                case 't':
                    length = Length::PtrDiff;
                    break;
                case 'L':
                    length = Length::LongDouble;
                    break;
                default:
                    more = false;
                    continue;
            }
            spec += *p++;
        }
        char conversion = *p;
        if (conversion == '\0') {
            out += spec;  // a format ending in a lone '%' keeps its text
            break;
        }
        ++p;
        if (conversion == 'q') {
            conversion = 'd';
        }
        switch (conversion) {
            case '%':
                out += '%';
                break;
            case '@': {
                const auto* value = va_arg(cursor, const plist::Value*);
                appendValue(out, plist::describe(value));
                break;
            }
            case 'd':
            case 'i':
                appendSigned(out, spec + conversion, length, cursor);
                break;
            case 'u':
            case 'o':
            case 'x':
            case 'X':
                appendUnsigned(out, spec + conversion, length, cursor);
                break;
            case 'c':
                if (length == Length::Long) {
                    appendFormatted(out, spec + conversion, va_arg(cursor, wint_t));
                } else {
                    appendFormatted(out, spec.substr(0, lengthStart) + conversion,
                                    va_arg(cursor, int));
                }
                break;
            case 'e':
            case 'E':
            case 'f':
            case 'F':
            case 'g':
            case 'G':
            case 'a':
            case 'A':
                if (length == Length::LongDouble) {
                    appendFormatted(out, spec + conversion, va_arg(cursor, long double));
                } else {
                    appendFormatted(out, spec.substr(0, lengthStart) + conversion,
                                    va_arg(cursor, double));
                }
                break;
            case 's': {
                if (length == Length::Long) {
                    const auto* text = va_arg(cursor, const wchar_t*);
                    appendFormatted(out, spec + conversion, text == nullptr ? L"(null)" : text);
                } else {
                    const char* text = va_arg(cursor, const char*);
                    // Only what can be shown is read, and the rest is never copied.
                    std::string shown(text == nullptr ? "(null)" : text,
                                      text == nullptr ? 6 : ::strnlen(text, kMaxValueBytes + 1));
                    std::string formatted;
                    appendFormatted(formatted, spec.substr(0, lengthStart) + conversion,
                                    shown.c_str());
                    appendValue(out, formatted);
                }
                break;
            }
            case 'p':
                appendFormatted(out, spec.substr(0, lengthStart) + conversion,
                                va_arg(cursor, void*));
                break;
            case 'n':
                // Writing through a log argument is never wanted; the pointer is skipped.
                (void)va_arg(cursor, void*);
                break;
            default:
                // An unknown conversion is kept as text; it consumes no argument.
                out += spec + conversion;
                break;
        }
    }
    va_end(cursor);
    return out;
}

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
