#include <gtest/gtest.h>
#include <unistd.h>

#include <climits>
#include <clocale>
#include <cstdint>
#include <cstdlib>
#include <ctime>
#include <filesystem>

#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "device/TXUtility.h"
#include "plist/DateText.h"
#include "plist/PropertyListFormat.h"

namespace tavrix {
namespace {

using plist::Value;

TEST(TXUtilityFacts, StringFactsComeFromTheTableAndAreKeptForTheProcess) {
    test::writeDeviceTable({{"SerialNumber", Value("C02XYZ")},
                            {"DeviceClass", Value("Tablet")},
                            {"ProductType", Value("Tab1,2")},
                            {"ProductVersion", Value("3.1")},
                            {"BuildVersion", Value("3B12")},
                            {"ReleaseType", Value(7)},
                            {"HWModelStr", Value("T12AP")}});
    EXPECT_EQ(TXUtility::serialNumber(), "C02XYZ");
    EXPECT_EQ(TXUtility::currentProductCategory(), "Tablet");
    EXPECT_EQ(TXUtility::currentProductType(), "Tab1,2");
    EXPECT_EQ(TXUtility::currentProductVersion(), "3.1");
    EXPECT_EQ(TXUtility::currentProductBuild(), "3B12");
    EXPECT_EQ(TXUtility::currentReleaseType(), std::nullopt);
    EXPECT_EQ(TXUtility::currentHardwareModel(), "T12AP");

    test::writeDeviceTable({{"DeviceClass", Value("Phone")}, {"ReleaseType", Value("Beta")}});
    EXPECT_EQ(TXUtility::currentProductCategory(), "Tablet");
    EXPECT_EQ(TXUtility::currentReleaseType(), std::nullopt);
    EXPECT_EQ(TXUtility::serialNumber(), "C02XYZ");
}

// Radio capabilities follow the table as it is now; only booleans count.
TEST(TXUtilityFacts, RadioCapabilitiesFollowTheTable) {
    test::writeDeviceTable({{"contains-cellular-radio", Value(true)}, {"wi-fi", Value(true)}});
    EXPECT_TRUE(TXUtility::hasCellularRadio());
    EXPECT_TRUE(TXUtility::isWiFiCapable());
    test::writeDeviceTable({{"contains-cellular-radio", Value("yes")}, {"wi-fi", Value(false)}});
    EXPECT_FALSE(TXUtility::hasCellularRadio());
    EXPECT_FALSE(TXUtility::isWiFiCapable());
}

TEST(TXUtilityDiskSpace, NeedsStrictlyMoreFreeBytesThanAskedOnTheHomeFileSystem) {
    EXPECT_FALSE(TXUtility::freeSpaceExceeds(4096, 10, 40960));
    EXPECT_TRUE(TXUtility::freeSpaceExceeds(4096, 10, 40959));
    EXPECT_FALSE(TXUtility::freeSpaceExceeds(4096, 0, 0));
    EXPECT_FALSE(TXUtility::freeSpaceExceeds(1, UINT64_MAX, UINT64_MAX));
    EXPECT_TRUE(TXUtility::freeSpaceExceeds(1, UINT64_MAX, UINT64_MAX - 1));
    // Past 64 bits is more than any request, not a wrapped small number.
    EXPECT_TRUE(
        TXUtility::freeSpaceExceeds(UINT64_C(1) << 32, (UINT64_C(1) << 32) + 1, UINT64_MAX));

    // The home's own file system is asked; a home that cannot be asked answers NO.
    EXPECT_TRUE(TXUtility::hasEnoughDiskSpace(0));
    EXPECT_FALSE(TXUtility::hasEnoughDiskSpace(UINT64_MAX));
    ::setenv("HOME", "/nonexistent/tavrix-home", 1);  // the test has a process of its own
    EXPECT_FALSE(TXUtility::hasEnoughDiskSpace(0));
}

TEST(TXUtilityFiles, URLIfFileExistsAnswersExistingPathsOnly) {
    test::TempDir dir;
    std::string file = dir / "present";
    test::writeText(file, "x");
    EXPECT_EQ(TXUtility::URLIfFileExists(file), file);
    EXPECT_EQ(TXUtility::URLIfFileExists(dir.path().string()), dir.path().string());
    EXPECT_EQ(TXUtility::URLIfFileExists(dir / "absent"), std::nullopt);
    EXPECT_EQ(TXUtility::URLIfFileExists(""), std::nullopt);
    std::filesystem::create_symlink(dir / "absent", dir / "dangling");
    EXPECT_EQ(TXUtility::URLIfFileExists(dir / "dangling"), std::nullopt);
}

// Runs in the zone a test asks for (skipped when its data is not installed) and puts the previous
// one back afterwards.
class CalendarInZone : public testing::Test {
  protected:
    bool useZone(const char* zone) {
        ::setenv("TZ", zone, 1);
        ::tzset();
        return std::filesystem::exists(std::string("/usr/share/zoneinfo/") + zone);
    }
    void TearDown() override {
        saved_ ? ::setenv("TZ", saved_->c_str(), 1) : ::unsetenv("TZ");
        ::tzset();
    }

    static plist::Date localDate(int year, int month, int day, int hour, int minute) {
        std::tm fields{};
        fields.tm_year = year - 1900;
        fields.tm_mon = month - 1;
        fields.tm_mday = day;
        fields.tm_hour = hour;
        fields.tm_min = minute;
        fields.tm_isdst = -1;
        return plist::Date::fromUnixTime(static_cast<double>(std::mktime(&fields)));
    }

  private:
    const char* tz_ = std::getenv("TZ");
    std::optional<std::string> saved_ = tz_ ? std::optional<std::string>(tz_) : std::nullopt;
};

TEST_F(CalendarInZone, DaysFollowTheWallClockAcrossDaylightSaving) {
    if (!useZone("America/New_York")) {
        GTEST_SKIP() << "no time zone data (tzdata)";
    }
    plist::Date before = localDate(2026, 3, 7, 12, 0);
    auto after = TXUtility::addToDate(before, 1);
    ASSERT_TRUE(after.has_value());
    EXPECT_EQ(*after, localDate(2026, 3, 8, 12, 0));
    EXPECT_DOUBLE_EQ(after->secondsSinceReferenceDate - before.secondsSinceReferenceDate,
                     23 * 3600.0);

    auto back = TXUtility::addToDate(*after, -1);
    ASSERT_TRUE(back.has_value());
    EXPECT_EQ(*back, before);
    // Autumn: the day has 25 hours.
    auto autumn = TXUtility::addToDate(localDate(2026, 10, 31, 12, 0), 1);
    ASSERT_TRUE(autumn.has_value());
    EXPECT_EQ(*autumn, localDate(2026, 11, 1, 12, 0));
    EXPECT_DOUBLE_EQ(autumn->secondsSinceReferenceDate -
                         localDate(2026, 10, 31, 12, 0).secondsSinceReferenceDate,
                     25 * 3600.0);
    // Short date and time, in local time.
    std::setlocale(LC_TIME, "C");
    EXPECT_EQ(TXUtility::prettyPrintDate(localDate(2026, 3, 7, 9, 5)), "03/07/26 09:05");

    // The same past 2038, where a 32-bit time_t ends (so the dates are written in UTC here).
    auto utc = [](const char* text) { return plist::Date{*plist::parseXmlDateText(text)}; };
    auto spring2040 = TXUtility::addToDate(utc("2040-03-10T17:00:00Z"), 1);  // noon EST
    ASSERT_TRUE(spring2040.has_value());
    EXPECT_EQ(*spring2040, utc("2040-03-11T16:00:00Z"));  // noon EDT
    EXPECT_EQ(TXUtility::prettyPrintDate(*spring2040), "03/11/40 12:00");
}

// Days move back and across months keeping fractions; results that cannot be represented are
// none.
TEST_F(CalendarInZone, MovesBackAndAcrossMonthsKeepingFractions) {
    if (!useZone("UTC")) {
        GTEST_SKIP() << "no time zone data (tzdata)";
    }
    plist::Date start{800000000.25};  // 2026-05-09 06:13:20.25 UTC
    auto earlier = TXUtility::addToDate(start, -40);
    ASSERT_TRUE(earlier.has_value());
    EXPECT_DOUBLE_EQ(earlier->secondsSinceReferenceDate, 800000000.25 - 40 * 86400.0);
    // Before the Unix epoch the fraction still counts forward from the whole second.
    auto old = TXUtility::addToDate(plist::Date::fromUnixTime(-0.75), 1);
    ASSERT_TRUE(old.has_value());
    EXPECT_DOUBLE_EQ(old->unixTime(), 86400 - 0.75);
    EXPECT_EQ(TXUtility::addToDate(plist::Date{100.5}, LONG_MAX), std::nullopt);
    EXPECT_EQ(TXUtility::addToDate(plist::Date{1e300}, 1), std::nullopt);
}

}  // namespace
}  // namespace tavrix
