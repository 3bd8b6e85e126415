// The daemon's one line for a property-list file its reader refused, naming the file and the
// reason.
#pragma once

#include <optional>
#include <string>

#include "plist/PropertyListFormat.h"

namespace tavrix {

// Logs "Property list <path> refused: <reason>; <consequence>".
void logPropertyListRefusal(const std::string& path, const plist::Refusal& refusal,
                            const char* consequence);

}  // namespace tavrix
