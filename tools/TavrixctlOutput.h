// How tavrixctl shows the status view to people (JSON goes through PlistJson.h).
#pragma once

#include <string>

#include "plist/Value.h"

namespace tavrix::tools {

// A date as "YYYY-MM-DD HH:MM:SS UTC".
std::string readableDate(const plist::Date& date);

// The status view, one fact a line, for a terminal.
std::string readableStatus(const plist::Dictionary& status);

}  // namespace tavrix::tools
