// The Gregorian calendar in the system time zone (TZ, else the local time configuration), for
// calendar arithmetic that respects daylight-saving changes.
#pragma once

#include <optional>

#include "plist/Value.h"

namespace tavrix {

class GregorianCalendar {
  public:
    // The date numberOfDays calendar days from date (back for negative counts) at the same local
    // wall-clock time, with the fraction of a second kept. Nothing when the result cannot be
    // represented.
    std::optional<plist::Date> addingDays(plist::Date date, long numberOfDays) const;
};

}  // namespace tavrix
