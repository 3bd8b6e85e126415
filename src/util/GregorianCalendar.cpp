// The C library's 64-bit time functions, also where time_t is 32 bits wide by default (Debian
// 12's armhf): local dates past 2038 are ordinary dates. Only this file asks for them, and no
// time_t leaves it, so the rest of the program and the libraries it calls keep their time_t.
#define _FILE_OFFSET_BITS 64
#define _TIME_BITS 64

#include "util/GregorianCalendar.h"

#include <cmath>
#include <ctime>
#include <limits>

namespace tavrix {
namespace {

static_assert(sizeof(std::time_t) == 8);

// The whole seconds of a date as a time_t, when they fit.
std::optional<std::time_t> wholeSeconds(double unixTime) {
    const double whole = std::floor(unixTime);
    // time_t's limits as doubles: the minimum is exact, the maximum rounds up to 2^63.
    constexpr double kTimeMin = static_cast<double>(std::numeric_limits<std::time_t>::min());
    constexpr double kTimeMax = static_cast<double>(std::numeric_limits<std::time_t>::max());
    if (!std::isfinite(whole) || whole < kTimeMin || whole >= kTimeMax) {
        return std::nullopt;
    }
    return static_cast<std::time_t>(whole);
}

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
    const std::optional<std::time_t> whole = wholeSeconds(date.unixTime());
    if (!whole) {
        return std::nullopt;
    }
    std::time_t seconds = *whole;
    const double fraction = date.unixTime() - static_cast<double>(seconds);

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

std::optional<std::string> GregorianCalendar::localText(plist::Date date, const char* format,
                                                        locale_t locale) const {
    const std::optional<std::time_t> seconds = wholeSeconds(date.unixTime());
    ::tzset();
    std::tm local{};
    char text[256];
    if (!seconds || ::localtime_r(&*seconds, &local) == nullptr ||
        (locale != locale_t{} ? ::strftime_l(text, sizeof text, format, &local, locale)
                              : std::strftime(text, sizeof text, format, &local)) == 0) {
        return std::nullopt;
    }
    return text;
}

}  // namespace tavrix
