#include "util/GregorianCalendar.h"

#include <cmath>
#include <ctime>
#include <limits>

namespace tavrix {
namespace {

bool sameFields(const std::tm& a, const std::tm& b) {
    return a.tm_year == b.tm_year && a.tm_mon == b.tm_mon && a.tm_mday == b.tm_mday &&
           a.tm_hour == b.tm_hour && a.tm_min == b.tm_min && a.tm_sec == b.tm_sec;
}

// mktime answers -1 both for failure and for the second before the epoch; only the latter
// normalises the fields to that second.
bool mktimeFailed(std::time_t result, const std::tm& normalised) {
    if (result != static_cast<std::time_t>(-1)) {
        return false;
    }
    std::tm previous{};
    std::time_t minusOne = -1;
    return ::localtime_r(&minusOne, &previous) == nullptr || !sameFields(previous, normalised);
}

}  // namespace

std::optional<plist::Date> GregorianCalendar::addingDays(plist::Date date,
                                                         long numberOfDays) const {
    double unixTime = date.unixTime();
    double whole = std::floor(unixTime);
    // time_t's limits as doubles: the minimum is exact, the maximum rounds up to 2^63.
    constexpr double kTimeMin = static_cast<double>(std::numeric_limits<std::time_t>::min());
    constexpr double kTimeMax = static_cast<double>(std::numeric_limits<std::time_t>::max());
    if (!std::isfinite(whole) || whole < kTimeMin || whole >= kTimeMax) {
        return std::nullopt;
    }
    double fraction = unixTime - whole;
    std::time_t seconds = static_cast<std::time_t>(whole);

    ::tzset();  // pick up a TZ changed since the last conversion
    std::tm local{};
    if (::localtime_r(&seconds, &local) == nullptr) {
        return std::nullopt;
    }
    int day = 0;
    if (__builtin_add_overflow(local.tm_mday, numberOfDays, &day)) {
        return std::nullopt;
    }
    local.tm_mday = day;
    local.tm_isdst = -1;  // the offset of the new day, not of the starting one
    std::time_t result = std::mktime(&local);
    if (mktimeFailed(result, local)) {
        return std::nullopt;
    }
    return plist::Date::fromUnixTime(static_cast<double>(result) + fraction);
}

}  // namespace tavrix
