// Encoders from the value type straight to the XML and binary file formats, without building a
// libplist tree first (that tree and its copy of every string cost more than the writing).
// What they write is read back by libplist, Python's plistlib and plistutil.
#pragma once

#include <string>

#include "plist/Value.h"

namespace tavrix::plist {

// XML with whole-second dates, as every reader of the format expects.
std::string writeXml(const Value& value);

// Binary; dates keep their fractions, equal strings and keys are stored once.
std::string writeBinary(const Value& value);

}  // namespace tavrix::plist
