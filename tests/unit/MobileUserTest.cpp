#include <gtest/gtest.h>
#include <unistd.h>

#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "device/BuildCapabilities.h"
#include "device/MobileUser.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::device {
namespace {

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

TEST(MobileUser, AccessorsComeFromTheDatabaseUnderThePlatformRoot) {
    EXPECT_EQ(MobileUser::name(), "mobile");
    ASSERT_NE(MobileUser::homeDirectory(), nullptr);
    EXPECT_EQ(std::string(MobileUser::homeDirectory()),
              (test::unitTestRoot() / "var/mobile").string());
    EXPECT_EQ(MobileUser::uid(), ::getuid());
    EXPECT_EQ(MobileUser::gid(), ::getgid());
}

struct DecisionCase {
    const char* description;
    plist::Dictionary answers;
    bool internal, carrierInstall, vendor;
    friend void PrintTo(const DecisionCase& c, std::ostream* out) { *out << c.description; }
};

class BuildCapabilitiesDecision : public testing::TestWithParam<DecisionCase> {};

TEST_P(BuildCapabilitiesDecision, FollowsTheAnswers) {
    const DecisionCase& c = GetParam();
    BuildCapabilities::Facts facts = BuildCapabilities::decide(c.answers);
    EXPECT_EQ(facts.isInternalBuild, c.internal) << c.description;
    EXPECT_EQ(facts.hasCarrierInstallCapability, c.carrierInstall) << c.description;
    EXPECT_EQ(facts.isVendorBuild, c.vendor) << c.description;
}

using plist::Value;
INSTANTIATE_TEST_SUITE_P(
    BuildCapabilitiesTable, BuildCapabilitiesDecision,
    testing::Values(
        DecisionCase{"NothingAnswered", {}, false, false, false},
        DecisionCase{"Desense", {{"ReleaseType", Value("Desense")}}, true, false, false},
        DecisionCase{"Vendor", {{"ReleaseType", Value("Vendor")}}, false, false, true},
        DecisionCase{"CaseMatters", {{"ReleaseType", Value("vendor")}}, false, false, false},
        DecisionCase{"InternalWinsOverVendor",
                     {{"InternalBuild", Value(true)}, {"ReleaseType", Value("Vendor")}},
                     true,
                     false,
                     false},
        DecisionCase{"InternalFalseStillReadsReleaseType",
                     {{"InternalBuild", Value(false)}, {"ReleaseType", Value("Vendor")}},
                     false,
                     false,
                     true},
        DecisionCase{"CarrierInstall",
                     {{"CarrierInstallCapability", Value(true)}, {"ReleaseType", Value("User")}},
                     false,
                     true,
                     false},
        DecisionCase{"OtherTypesIgnored",
                     {{"InternalBuild", Value(1)},
                      {"CarrierInstallCapability", Value("true")},
                      {"ReleaseType", Value(plist::Array{Value("Vendor")})}},
                     false,
                     false,
                     false}),
    [](const testing::TestParamInfo<DecisionCase>& info) {
        return std::string(info.param.description);
    });

TEST(BuildCapabilities, AccessorsReadTheDeviceTableOnce) {
    std::string table = (test::unitTestRoot() / "etc/tavrix/DeviceInfo.plist").string();
    std::filesystem::create_directories(test::unitTestRoot() / "etc/tavrix");
    ASSERT_TRUE(plist::writeFile(table, plist::Dictionary{{"CarrierInstallCapability", Value(true)},
                                                          {"ReleaseType", Value("Vendor")}}));
    EXPECT_FALSE(BuildCapabilities::isInternalBuild());
    EXPECT_TRUE(BuildCapabilities::hasCarrierInstallCapability());
    EXPECT_TRUE(BuildCapabilities::isVendorBuild());
    ASSERT_TRUE(plist::writeFile(table, plist::Dictionary{{"InternalBuild", Value(true)}}));
    EXPECT_FALSE(BuildCapabilities::isInternalBuild());
    std::filesystem::remove(table);
}

}  // namespace
}  // namespace tavrix::device
