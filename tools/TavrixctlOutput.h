// How tavrixctl shows answers: JSON for scripts, and the status view for people.
#pragma once

#include <string>

#include "plist/Value.h"

namespace tavrix::tools {

// The value as one line of JSON: dictionaries as objects, dates as "YYYY-MM-DDTHH:MM:SSZ" text,
// data as base64 text, reals that JSON cannot write as null.
std::string toJson(const plist::Value& value);

// A date as "YYYY-MM-DD HH:MM:SS UTC".
std::string readableDate(const plist::Date& date);

// The status view, one fact a line, for a terminal.
std::string readableStatus(const plist::Dictionary& status);

}  // namespace tavrix::tools
