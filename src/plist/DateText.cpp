#include "plist/DateText.h"

#include <cmath>
#include <cstdint>
#include <cstdio>

namespace tavrix::plist {
namespace {

constexpr std::int64_t kSecondsPerDay = 86400;
// 2001-01-01 counted in days from 1970-01-01.
constexpr std::int64_t kReferenceDay = 11323;

// Days from 1970-01-01 to the given day of the proleptic Gregorian calendar.
constexpr std::int64_t daysFromCivil(std::int64_t year, unsigned month, unsigned day) {
    year -= month <= 2 ? 1 : 0;
    const std::int64_t era = (year >= 0 ? year : year - 399) / 400;
    const auto yearOfEra = static_cast<unsigned>(year - era * 400);
    const unsigned dayOfYear = (153 * (month > 2 ? month - 3 : month + 9) + 2) / 5 + day - 1;
    const unsigned dayOfEra = yearOfEra * 365 + yearOfEra / 4 - yearOfEra / 100 + dayOfYear;
    return era * 146097 + static_cast<std::int64_t>(dayOfEra) - 719468;
}

struct CivilDay {
    std::int64_t year;
    unsigned month;
    unsigned day;
};

constexpr CivilDay civilFromDays(std::int64_t days) {
    days += 719468;
    const std::int64_t era = (days >= 0 ? days : days - 146096) / 146097;
    const auto dayOfEra = static_cast<unsigned>(days - era * 146097);
    const unsigned yearOfEra =
        (dayOfEra - dayOfEra / 1460 + dayOfEra / 36524 - dayOfEra / 146096) / 365;
    const unsigned dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);
    const unsigned shifted = (5 * dayOfYear + 2) / 153;
    const unsigned day = dayOfYear - (153 * shifted + 2) / 5 + 1;
    const unsigned month = shifted < 10 ? shifted + 3 : shifted - 9;
    return {static_cast<std::int64_t>(yearOfEra) + era * 400 + (month <= 2 ? 1 : 0), month, day};
}

static_assert(daysFromCivil(2001, 1, 1) == kReferenceDay);

// Reads exactly count digits at text[at...]; false when they are not all digits.
bool readDigits(std::string_view text, std::size_t at, std::size_t count, unsigned& out) {
    if (at + count > text.size()) {
        return false;
    }
    out = 0;
    for (std::size_t i = at; i < at + count; ++i) {
        if (text[i] < '0' || text[i] > '9') {
            return false;
        }
        out = out * 10 + static_cast<unsigned>(text[i] - '0');
    }
    return true;
}

// The first and the last whole second of years 1 to 9999.
constexpr auto kFirstSecond =
    static_cast<double>((daysFromCivil(1, 1, 1) - kReferenceDay) * kSecondsPerDay);
constexpr auto kLastSecond =
    static_cast<double>((daysFromCivil(10000, 1, 1) - kReferenceDay) * kSecondsPerDay - 1);

}  // namespace

double clampedDateSeconds(double secondsSinceReferenceDate) {
    if (!(secondsSinceReferenceDate >= kFirstSecond)) {
        return kFirstSecond;
    }
    return secondsSinceReferenceDate > kLastSecond ? kLastSecond : secondsSinceReferenceDate;
}

bool hasDateText(double secondsSinceReferenceDate) {
    return secondsSinceReferenceDate >= kFirstSecond && secondsSinceReferenceDate < kLastSecond + 1;
}

std::string readableDateText(double secondsSinceReferenceDate) {
    std::string text = xmlDateText(secondsSinceReferenceDate);
    text[10] = ' ';
    text.pop_back();  // the Z
    return text;
}

std::string xmlDateText(double secondsSinceReferenceDate) {
    const double whole = std::floor(clampedDateSeconds(secondsSinceReferenceDate));
    const auto seconds = static_cast<std::int64_t>(whole) + kReferenceDay * kSecondsPerDay;
    std::int64_t days = seconds / kSecondsPerDay;
    std::int64_t inDay = seconds % kSecondsPerDay;
    if (inDay < 0) {
        inDay += kSecondsPerDay;
        --days;
    }
    const CivilDay civil = civilFromDays(days);
    char text[96];
    std::snprintf(text, sizeof text, "%04lld-%02u-%02uT%02lld:%02lld:%02lldZ",
                  static_cast<long long>(civil.year), civil.month, civil.day,
                  static_cast<long long>(inDay / 3600), static_cast<long long>(inDay / 60 % 60),
                  static_cast<long long>(inDay % 60));
    return text;
}

std::optional<double> parseXmlDateText(std::string_view text) {
    unsigned year = 0, month = 0, day = 0, hour = 0, minute = 0, second = 0;
    if (!readDigits(text, 0, 4, year) || text.size() < 20 || text[4] != '-' ||
        !readDigits(text, 5, 2, month) || text[7] != '-' || !readDigits(text, 8, 2, day) ||
        text[10] != 'T' || !readDigits(text, 11, 2, hour) || text[13] != ':' ||
        !readDigits(text, 14, 2, minute) || text[16] != ':' || !readDigits(text, 17, 2, second)) {
        return std::nullopt;
    }
    if (year == 0 || month < 1 || month > 12 || day < 1 || day > 31 || hour > 23 || minute > 59 ||
        second > 60) {
        return std::nullopt;
    }
    double fraction = 0;
    std::size_t at = 19;
    if (text[at] == '.') {
        double scale = 0.1;
        for (++at; at < text.size() && text[at] >= '0' && text[at] <= '9'; ++at) {
            fraction += (text[at] - '0') * scale;
            scale /= 10;
        }
    }
    if (at + 1 != text.size() || text[at] != 'Z') {
        return std::nullopt;
    }
    const std::int64_t days = daysFromCivil(year, month, day) - kReferenceDay;
    const std::int64_t seconds = days * kSecondsPerDay + hour * 3600 + minute * 60 + second;
    return static_cast<double>(seconds) + fraction;
}

}  // namespace tavrix::plist
