// The daemon's one line for a property-list file its reader refused, naming the file and the
// reason.
#pragma once

#include <optional>
#include <string>

#include "base/Result.h"

namespace tavrix {

// Logs "Property list <path> refused: <reason>; <consequence>".
void logPropertyListRefusal(const std::string& path, const Failure& refusal,
                            const char* consequence);

}  // namespace tavrix
