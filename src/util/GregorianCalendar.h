// The Gregorian calendar in the system time zone (TZ, else the local time configuration), for
// calendar arithmetic that respects daylight-saving changes.
#pragma once

#include <locale.h>

#include <optional>
#include <string>

#include "plist/Value.h"

namespace tavrix {

class GregorianCalendar {
  public:
    // The date numberOfDays calendar days from date (back for negative counts) at the same local
    // wall-clock time, with the fraction of a second kept. Nothing when the result cannot be
    // represented.
    std::optional<plist::Date> addingDays(plist::Date date, long numberOfDays) const;

    // The date as local wall-clock time in strftime's format, in the given time locale (the
    // process's own when none); nothing when it cannot be represented.
    std::optional<std::string> localText(plist::Date date, const char* format,
                                         locale_t locale = locale_t{}) const;
};

}  // namespace tavrix
