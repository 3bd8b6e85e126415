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

// A read that answers no value fails with a reason for a log line ("it is not a regular file",
// "it nests deeper than 512 levels", ...) and, when the file could not be opened or read, its
// errno (ENOENT: there is none).

// The value encoded in bytes (XML or binary, detected from the content); a failure when the
// bytes are not a complete property list or exceed the limits.
Result<Value> parse(std::string_view bytes);

// The value stored in the file at path (symbolic links followed); a failure when the file is
// missing, not a regular file, too large, unreadable or not a property list.
Result<Value> readFile(const std::string& path);

// The value encoded in the given format. XML dates are whole seconds, as every reader of the
// format expects; binary dates keep their fractions. Fails when the value cannot be encoded or
// parse() would refuse the encoding (the bounds of PropertyListBounds.h), so that nothing is
// written that its reader refuses.
Result<std::string> serialize(const Value& value, Format format = Format::Xml);

// Writes the serialized value over the file at path (not atomically). False when the file
// cannot be written.
bool writeFile(const std::string& path, const Value& value, Format format = Format::Xml);

// Reads the whole of a regular file of at most kMaxPropertyListBytes into memory. Opening never
// blocks (a FIFO or device is refused, not waited on).
Result<std::string> readFileBytes(const std::string& path);

// The same for a file the caller opened (read from its current offset).
Result<std::string> readOpenFileBytes(int fd);
Result<Value> readOpenFile(int fd);

}  // namespace tavrix::plist
