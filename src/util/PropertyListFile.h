// The daemon's way to read a property-list file: the reader of the property-list layer, with
// every refusal of a file that exists logged as one line naming the file and the reason.
#pragma once

#include <optional>
#include <string>

#include "plist/PropertyListFormat.h"

namespace tavrix {

// Logs "Property list <path> refused: <reason>; <consequence>".
void logPropertyListRefusal(const std::string& path, const plist::Refusal& refusal,
                            const char* consequence);

// The value in the file at path, or nothing. A missing file is not logged (callers decide
// whether that is normal); any other refusal is, with consequence.
std::optional<plist::Value> readPropertyListFile(const std::string& path,
                                                 const char* consequence = "ignoring it");

}  // namespace tavrix
