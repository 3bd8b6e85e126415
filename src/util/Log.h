// The daemon's three log wrappers. Each writes its message (no prefix, level or time stamp) to
// the system log as one entry. The values a message shows ("%s" texts, "%@" descriptions) may come
// from clients: control characters in them are escaped ("\n", "\t", "\r", "\xNN") and a value
// longer than 2048 bytes is cut and ends with "...". The format's own text is kept unchanged.
//
// Object formats are printf formats plus "%@", whose argument is a `const tavrix::plist::Value*`
// rendered by its description, or "(null)" for a null pointer. C formats are plain printf
// formats, checked by the compiler.
//
// A message is a notice unless its caller says it reports a failure (LogPriority::Warning).
#pragma once

#include <cstdarg>
#include <string>

namespace tavrix {

enum class LogPriority { Notice, Warning };

void logObjectFormat(const char* format, ...);
void logObjectFormat(LogPriority priority, const char* format, ...);
void logObjectFormatV(const char* format, va_list arguments);
void logObjectFormatV(LogPriority priority, const char* format, va_list arguments);
void logCFormat(const char* format, ...) __attribute__((format(printf, 1, 2)));
void logCFormat(LogPriority priority, const char* format, ...)
    __attribute__((format(printf, 2, 3)));

// The message an object format produces, without logging it.
std::string formatObjectMessage(const char* format, va_list arguments);

}  // namespace tavrix
