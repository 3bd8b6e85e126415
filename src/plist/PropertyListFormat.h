// Reading and writing property lists in their XML and binary file formats.
// All parsing is done by libplist (writing is PropertyListWriter's); damaged or hostile input is
// "no value", never a crash: files must be regular and at most kMaxPropertyListBytes long, and
// documents stay within the limits of PropertyListBounds.h before libplist sees them.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/Result.h"
#include "plist/PropertyListBounds.h"
#include "plist/Value.h"

namespace tavrix::plist {

enum class Format { Xml, Binary };

// Why a read answered no value.
struct Refusal {
    // The errno of a file that could not be opened or read (ENOENT: there is none), else 0.
    int error = 0;
    // For a log line: "it is not a regular file", "it nests deeper than 512 levels", ...
    std::string reason;
};

// The value encoded in bytes (XML or binary, detected from the content), or nothing when the
// bytes are not a complete property list or exceed the limits.
std::optional<Value> parse(std::string_view bytes, Refusal* refusal = nullptr);

// The value stored in the file at path (symbolic links followed), or nothing when the file is
// missing, not a regular file, too large, unreadable or not a property list.
std::optional<Value> readFile(const std::string& path, Refusal* refusal = nullptr);

// The value encoded in the given format. XML dates are whole seconds, as every reader of the
// format expects; binary dates keep their fractions. Fails when the value cannot be encoded or
// parse() would refuse the encoding (the bounds of PropertyListBounds.h), so that nothing is
// written that its reader refuses.
Result<std::string> serialize(const Value& value, Format format = Format::Xml);

// Writes the serialized value over the file at path (not atomically). False when the file
// cannot be written.
bool writeFile(const std::string& path, const Value& value, Format format = Format::Xml);

// Reads the whole of a regular file of at most kMaxPropertyListBytes into memory, or nothing.
// Opening never blocks (a FIFO or device is refused, not waited on).
std::optional<std::string> readFileBytes(const std::string& path, Refusal* refusal = nullptr);

// The same for a file the caller opened (read from its current offset).
std::optional<std::string> readOpenFileBytes(int fd, Refusal* refusal = nullptr);
std::optional<Value> readOpenFile(int fd, Refusal* refusal = nullptr);

}  // namespace tavrix::plist
