#include <gtest/gtest.h>
#include <unistd.h>

#include <climits>
#include <clocale>
#include <cstdint>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <tuple>

#include "TestDoubles.h"
#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "device/BuildCapabilities.h"
#include "device/DeviceInfoService.h"
#include "device/MobileUser.h"
#include "device/RunningSystemFacts.h"
#include "device/TXUtility.h"
#include "plist/DateText.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::device {
namespace {

using plist::Value;

std::string tablePath() {
    return (test::unitTestRoot() / "etc/tavrix/DeviceInfo.plist").string();
}

// Replaced by rename, so every version is a new file to the cache.
void writeTableBytes(const std::string& bytes) {
    std::string staging = tablePath() + ".new";
    test::writeText(staging, bytes);
    std::filesystem::rename(staging, tablePath());
}

class DeviceInfoTable : public testing::Test {
  protected:
    CapturingLogSink sink;
    ScopedLogSink guard{sink};
};

// (Answers by type, several at once and from a changed table show through the device facts.)
TEST_F(DeviceInfoTable, UnusableTableIsLoggedOncePerVersionAndAnswersNothing) {
    writeTableBytes("<?xml version=\"1.0\"?><plist><dict><key>DeviceClass</key>");
    EXPECT_EQ(copyDeviceStringAnswer("DeviceClass"), std::nullopt);
    EXPECT_EQ(copyDeviceAnswers({"DeviceClass", "ReleaseType"}), plist::Dictionary{});
    std::string damaged = "Property list " + tablePath() +
                          " refused: it is not a complete XML property list; ignoring it";
    EXPECT_EQ(sink.messages(), std::vector<std::string>{damaged});

    sink.clear();
    writeTableBytes(*plist::serialize(plist::Array{Value("DeviceClass")}));
    EXPECT_EQ(copyDeviceStringAnswer("DeviceClass"), std::nullopt);
    EXPECT_EQ(copyDeviceStringAnswer("DeviceClass"), std::nullopt);
    EXPECT_EQ(sink.messages(), std::vector<std::string>{"Device information table " + tablePath() +
                                                        " is not a dictionary; ignoring it"});

    sink.clear();
    test::writeDeviceTable(plist::Dictionary{{"DeviceClass", Value("Phone")}});
    EXPECT_EQ(copyDeviceStringAnswer("DeviceClass"), "Phone");
    std::filesystem::remove(tablePath());
    EXPECT_EQ(copyDeviceStringAnswer("DeviceClass"), std::nullopt);
    EXPECT_TRUE(sink.messages().empty());
}

TEST_F(DeviceInfoTable, MissingKeysComeFromTheRunningSystemAndTheTableWins) {
    test::writeText((test::unitTestRoot() / "etc/os-release").string(),
                    "NAME=\"Test OS\"\nVERSION_ID=\"4.2\"\nBUILD_ID=21A100\n");
    test::writeDeviceTable(plist::Dictionary{{"BuildVersion", Value("TableBuild")}});
    EXPECT_EQ(copyDeviceStringAnswer("ProductVersion"), "4.2");
    EXPECT_EQ(copyDeviceStringAnswer("BuildVersion"), "TableBuild");
    // A damaged table still leaves the running system's answers.
    writeTableBytes("not a property list");
    EXPECT_EQ(copyDeviceStringAnswer("BuildVersion"), "21A100");
}

TEST(DeviceInfoOsRelease, ReadsQuotedAndPlainValuesAndSkipsMalformedLines) {
    auto values = parseOsRelease(
        "# a comment\n"
        "\n"
        "NAME=\"Test \\\"OS\\\" \\$HOME \\n\"\n"
        "VERSION_ID=12\r\n"
        "ID_LIKE='debian ubuntu'\n"
        "  PRETTY_NAME=\"padded\"  \n"
        "EMPTY=\n"
        "UNTERMINATED=\"abc\n"
        "TRAILING=\"abc\" junk\n"
        "not a line\n"
        "BAD-KEY=1\n"
        "=novalue\n"
        "VERSION_ID=13");
    EXPECT_EQ(values,
              (std::map<std::string, std::string, std::less<>>{{"NAME", "Test \"OS\" $HOME \\n"},
                                                               {"VERSION_ID", "13"},
                                                               {"ID_LIKE", "debian ubuntu"},
                                                               {"PRETTY_NAME", "padded"},
                                                               {"EMPTY", ""}}));
}

TEST(DeviceInfoRunningSystem, ReadsReleaseFileDeviceTreeDmiAndNetworkDevices) {
    test::TempDir root;
    std::string dir = root.path().string();
    EXPECT_EQ(runningSystemAnswer(dir, "ProductVersion"), std::nullopt);
    test::writeText(root / "usr/lib/os-release", "VERSION_ID=1\n");
    EXPECT_EQ(runningSystemAnswer(dir, "ProductVersion"), Value("1"));
    test::writeText(root / "etc/os-release", "VERSION_ID=2\n");
    EXPECT_EQ(runningSystemAnswer(dir, "ProductVersion"), Value("2"));
    EXPECT_EQ(runningSystemAnswer(dir, "BuildVersion"), std::nullopt);

    test::writeText(root / "sys/firmware/devicetree/base/model", std::string("Board X\0", 8));
    test::writeText(root / "sys/firmware/devicetree/base/serial-number",
                    std::string("0123abc\0", 8));
    test::writeText(root / "sys/class/dmi/id/product_serial", "\n");
    EXPECT_EQ(runningSystemAnswer(dir, "ProductType"), Value("Board X"));
    EXPECT_EQ(runningSystemAnswer(dir, "HWModelStr"), Value("Board X"));
    EXPECT_EQ(runningSystemAnswer(dir, "SerialNumber"), Value("0123abc"));

    std::filesystem::create_directories(root / "sys/class/net/lo");
    test::writeText(root / "sys/class/net/eth0/uevent", "INTERFACE=eth0\nIFINDEX=2\n");
    EXPECT_EQ(runningSystemAnswer(dir, "wi-fi"), Value(false));
    EXPECT_EQ(runningSystemAnswer(dir, "contains-cellular-radio"), Value(false));
    std::filesystem::create_directories(root / "sys/class/net/wlan0/wireless");
    test::writeText(root / "sys/class/net/wwan0/uevent", "DEVTYPE=wwan\nINTERFACE=wwan0\n");
    EXPECT_EQ(runningSystemAnswer(dir, "wi-fi"), Value(true));
    EXPECT_EQ(runningSystemAnswer(dir, "contains-cellular-radio"), Value(true));
    EXPECT_EQ(runningSystemAnswer(dir, "DeviceClass"), std::nullopt);

    // Without a device tree: DMI, and the modem class.
    std::filesystem::remove_all(root / "sys");
    test::writeText(root / "sys/class/dmi/id/product_name", "Laptop 13\n");
    test::writeText(root / "sys/class/dmi/id/board_name", "  MB-7  \n");
    test::writeText(root / "sys/class/dmi/id/product_serial", "SN42\n");
    EXPECT_EQ(runningSystemAnswer(dir, "ProductType"), Value("Laptop 13"));
    EXPECT_EQ(runningSystemAnswer(dir, "HWModelStr"), Value("MB-7"));
    EXPECT_EQ(runningSystemAnswer(dir, "SerialNumber"), Value("SN42"));

    std::filesystem::create_directories(root / "sys/class/wwan");
    EXPECT_EQ(runningSystemAnswer(dir, "contains-cellular-radio"), Value(false));
    std::filesystem::create_directories(root / "sys/class/wwan/wwan0");
    EXPECT_EQ(runningSystemAnswer(dir, "contains-cellular-radio"), Value(true));
}

TEST(MobileUser, UnknownUserLeavesIdsZeroAndNoHome) {
    test::TempDir root;
    MobileUser::Facts noDatabase = MobileUser::lookUpUnder(root.path().string());
    EXPECT_EQ(noDatabase.uid, 0u);
    EXPECT_EQ(noDatabase.gid, 0u);
    EXPECT_EQ(noDatabase.homeDirectory, std::nullopt);

    test::writeText(root / "etc/passwd",
                    "root:x:0:0:root:/root:/bin/sh\nmobile2:x:7:8::/var/m:/bin/sh\n");
    MobileUser::Facts missing = MobileUser::lookUpUnder(root.path().string());
    EXPECT_EQ(missing.uid, 0u);
    EXPECT_EQ(missing.gid, 0u);
    EXPECT_EQ(missing.homeDirectory, std::nullopt);
}

// (The home directory roots every bundle test's paths.)
TEST(MobileUser, IdsComeFromTheDatabaseUnderThePlatformRoot) {
    EXPECT_EQ(MobileUser::uid(), ::getuid());
    EXPECT_EQ(MobileUser::gid(), ::getgid());
}

// Internal, carrier install, vendor from the three answers; only booleans and strings count, and
// the release type is read only when the build is not internal already.
TEST(BuildCapabilities, DecisionFollowsTheAnswers) {
    const std::tuple<const char*, plist::Dictionary, bool, bool, bool> cases[] = {
        {"Desense", {{"ReleaseType", Value("Desense")}}, true, false, false},
        {"Vendor", {{"ReleaseType", Value("Vendor")}}, false, false, true},
        {"case matters", {{"ReleaseType", Value("vendor")}}, false, false, false},
        {"internal wins", {{"InternalBuild", true}, {"ReleaseType", "Vendor"}}, true, false, false},
        {"carrier install", {{"CarrierInstallCapability", true}}, false, true, false},
        {"other types ignored",
         {{"InternalBuild", 1},
          {"CarrierInstallCapability", "true"},
          {"ReleaseType", plist::Array{"Vendor"}}},
         false,
         false,
         false},
    };
    for (const auto& [name, answers, internal, carrierInstall, vendor] : cases) {
        SCOPED_TRACE(name);
        BuildCapabilities::Facts facts = BuildCapabilities::decide(answers);
        EXPECT_EQ(facts.isInternalBuild, internal);
        EXPECT_EQ(facts.hasCarrierInstallCapability, carrierInstall);
        EXPECT_EQ(facts.isVendorBuild, vendor);
    }
}

TEST(BuildCapabilities, AccessorsReadTheDeviceTableOnce) {
    test::writeDeviceTable({{"CarrierInstallCapability", true}, {"ReleaseType", "Vendor"}});
    EXPECT_FALSE(BuildCapabilities::isInternalBuild());
    EXPECT_TRUE(BuildCapabilities::hasCarrierInstallCapability());
    EXPECT_TRUE(BuildCapabilities::isVendorBuild());
    test::writeDeviceTable({{"InternalBuild", true}});
    EXPECT_FALSE(BuildCapabilities::isInternalBuild());
}

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
    ScopedEnvironment home("HOME", "/nonexistent/tavrix-home");
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
        zone_.emplace("TZ", zone);
        ::tzset();
        return std::filesystem::exists(std::string("/usr/share/zoneinfo/") + zone);
    }
    void TearDown() override {
        zone_.reset();
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
    std::optional<ScopedEnvironment> zone_;
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
    // Short date and time (no seconds), in local time and the environment's time locale.
    const char* locale = std::getenv("LC_ALL");
    const std::optional<std::string> saved =
        locale ? std::optional<std::string>(locale) : std::nullopt;
    ::setenv("LC_ALL", "C", 1);
    EXPECT_EQ(TXUtility::prettyPrintDate(localDate(2026, 3, 7, 9, 5)), "03/07/26 09:05");
    // The same past 2038, where a 32-bit time_t ends (so the dates are written in UTC here).
    auto utc = [](const char* text) { return plist::Date{*plist::parseXmlDateText(text)}; };
    auto spring2040 = TXUtility::addToDate(utc("2040-03-10T17:00:00Z"), 1);  // noon EST
    ASSERT_TRUE(spring2040.has_value());
    EXPECT_EQ(*spring2040, utc("2040-03-11T16:00:00Z"));  // noon EDT
    EXPECT_EQ(TXUtility::prettyPrintDate(*spring2040), "03/11/40 12:00");
    saved ? ::setenv("LC_ALL", saved->c_str(), 1) : ::unsetenv("LC_ALL");
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
}  // namespace tavrix::device
