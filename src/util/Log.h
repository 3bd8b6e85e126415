// The daemon's three log wrappers. Each writes its message (no prefix, level or time stamp) to
// the system log as one entry. The values a message shows ("%s" texts, "%@" descriptions) may come
// from clients: control characters in them are escaped ("\n", "\t", "\r", "\xNN") and a value
// longer than 2048 bytes is cut and ends with "...". The format's own text is kept unchanged.
//
// Object formats are printf formats plus "%@", whose argument is a `const tavrix::plist::Value*`
// rendered by its description, or "(null)" for a null pointer.
#pragma once

#include <cstdarg>
#include <string>

namespace tavrix {

void logObjectFormat(const char* format, ...);
void logObjectFormatV(const char* format, va_list arguments);
void logCFormat(const char* format, ...) __attribute__((format(printf, 1, 2)));

// The message an object format produces, without logging it.
std::string formatObjectMessage(const char* format, va_list arguments);

}  // namespace tavrix
