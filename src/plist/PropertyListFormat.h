// Reading and writing property lists in their XML and binary file formats.
// All parsing and serialization is done by libplist; damaged input is "no value", never a crash.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "plist/Value.h"

namespace tavrix::plist {

enum class Format { Xml, Binary };

// The value encoded in bytes (XML or binary, detected from the content), or nothing when the
// bytes are not a complete property list.
std::optional<Value> parse(std::string_view bytes);

// The value stored in the file at path (symbolic links followed), or nothing when the file is
// missing, unreadable or not a property list.
std::optional<Value> readFile(const std::string& path);

// The value encoded in the given format. Dates keep microsecond fractions in both formats.
std::string serialize(const Value& value, Format format = Format::Xml);

// Writes the serialized value over the file at path (not atomically). False when the file
// cannot be written.
bool writeFile(const std::string& path, const Value& value, Format format = Format::Xml);

// Reads the whole file into memory, or nothing when it cannot be read.
std::optional<std::string> readFileBytes(const std::string& path);

}  // namespace tavrix::plist
