// The daemon's three log wrappers. Each writes its message (no prefix, level or time stamp) to
// the system log as one entry. The values a message shows ("%s" texts, "%@" descriptions) may come
// from clients: control characters in them are escaped ("\n", "\t", "\r", "\xNN") and a value
// longer than 2048 bytes is cut and ends with "...". The format's own text is kept unchanged.
//
// Object formats are printf formats plus "%@", whose argument is a `const tavrix::plist::Value*`
// rendered by its description, or "(null)" for a null pointer. C formats are plain printf
// formats. The compiler checks both against their arguments (LogFormatCheck.h, and the format
// attribute).
//
// A message is a notice unless its caller says it reports a failure (LogPriority::Warning).
#pragma once

#include <cstdarg>
#include <string>
#include <type_traits>

#include "util/LogFormatCheck.h"

namespace tavrix {

enum class LogPriority { Notice, Warning };

// What the checked calls below hand their arguments to.
void logObjectFormatArguments(LogPriority priority, const char* format, ...);

template <typename... Args>
void logObjectFormat(ObjectFormat<std::type_identity_t<Args>...> format, Args... arguments) {
    logObjectFormatArguments(LogPriority::Notice, format.text, arguments...);
}
template <typename... Args>
void logObjectFormat(LogPriority priority, ObjectFormat<std::type_identity_t<Args>...> format,
                     Args... arguments) {
    logObjectFormatArguments(priority, format.text, arguments...);
}
void logObjectFormatV(const char* format, va_list arguments);
void logObjectFormatV(LogPriority priority, const char* format, va_list arguments);
void logCFormat(const char* format, ...) __attribute__((format(printf, 1, 2)));
void logCFormat(LogPriority priority, const char* format, ...)
    __attribute__((format(printf, 2, 3)));

}  // namespace tavrix
