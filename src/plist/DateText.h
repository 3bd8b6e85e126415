// XML property-list date texts ("2026-12-07T23:49:17Z") and the seconds since 2001-01-01 UTC they
// stand for, computed in 64-bit arithmetic whatever the width of time_t, for years 1 to 9999.
#pragma once

#include <optional>
#include <string>
#include <string_view>

// The client library carries these for the value type's descriptions without offering them.
#pragma GCC visibility push(hidden)

namespace tavrix::plist {

// Seconds clamped to years 1 to 9999, the dates both formats' writers produce (NaN: the first).
double clampedDateSeconds(double secondsSinceReferenceDate);

// The text of a date in whole seconds (the fraction dropped, as every reader of the format
// expects); dates outside years 1 to 9999 are written as the nearest one inside.
std::string xmlDateText(double secondsSinceReferenceDate);

// Whether a date lies in years 1 to 9999, the dates these texts spell (NaN does not).
bool hasDateText(double secondsSinceReferenceDate);

// "2026-12-07 23:49:17": the date in whole seconds in UTC as people read it, clamped as
// xmlDateText is.
std::string readableDateText(double secondsSinceReferenceDate);

// The date a text stands for, its fraction included; nothing when it is not
// "YYYY-MM-DDTHH:MM:SS[.fraction]Z" with fields in range.
std::optional<double> parseXmlDateText(std::string_view text);

}  // namespace tavrix::plist

#pragma GCC visibility pop
