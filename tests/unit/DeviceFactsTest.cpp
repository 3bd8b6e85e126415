#include <gtest/gtest.h>

#include <filesystem>

#include "TestDoubles.h"
#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "device/DeviceInfoService.h"
#include "device/MobileUser.h"
#include "device/RunningSystemFacts.h"
#include "device/TXUtility.h"
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

// Keys the table lacks, or all of them while it is unusable, come from the running system. (Answers
// by type, several at once and from a changed table show through the device facts.)
TEST_F(DeviceInfoTable, UnusableTableIsLoggedOncePerVersionAndAnswersNothing) {
    test::writeText((test::unitTestRoot() / "etc/os-release").string(),
                    "NAME=\"Test OS\"\nVERSION_ID=\"4.2\"\nBUILD_ID=21A100\n");
    writeTableBytes("<?xml version=\"1.0\"?><plist><dict><key>DeviceClass</key>");
    EXPECT_EQ(copyDeviceStringAnswer("DeviceClass"), std::nullopt);
    EXPECT_EQ(copyDeviceStringAnswer("BuildVersion"), "21A100");
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
    test::writeDeviceTable(
        plist::Dictionary{{"DeviceClass", Value("Phone")}, {"BuildVersion", Value("TableBuild")}});
    EXPECT_EQ(copyDeviceStringAnswer("DeviceClass"), "Phone");
    EXPECT_EQ(copyDeviceStringAnswer("BuildVersion"), "TableBuild");
    EXPECT_EQ(copyDeviceStringAnswer("ProductVersion"), "4.2");
    std::filesystem::remove(tablePath());
    EXPECT_EQ(copyDeviceStringAnswer("DeviceClass"), std::nullopt);
    EXPECT_TRUE(sink.messages().empty());
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

TEST(TXUtilityFacts, StringFactsComeFromTheTableAndAreKeptForTheProcess) {
    test::writeDeviceTable({{"DeviceClass", Value("Tablet")},
                            {"ProductType", Value("Tab1,2")},
                            {"ProductVersion", Value("3.1")},
                            {"HWModelStr", Value("T12AP")}});
    EXPECT_EQ(TXUtility::currentProductCategory(), "Tablet");
    EXPECT_EQ(TXUtility::currentProductType(), "Tab1,2");
    EXPECT_EQ(TXUtility::currentProductVersion(), "3.1");
    EXPECT_EQ(TXUtility::currentHardwareModel(), "T12AP");

    test::writeDeviceTable({{"DeviceClass", Value("Phone")}});
    EXPECT_EQ(TXUtility::currentProductCategory(), "Tablet");
}

// The radio follows the table as it is now; only a boolean counts.
TEST(TXUtilityFacts, RadioCapabilityFollowsTheTable) {
    test::writeDeviceTable({{"contains-cellular-radio", Value(true)}});
    EXPECT_TRUE(TXUtility::hasCellularRadio());
    test::writeDeviceTable({{"contains-cellular-radio", Value("yes")}});
    EXPECT_FALSE(TXUtility::hasCellularRadio());
}

}  // namespace
}  // namespace tavrix::device
