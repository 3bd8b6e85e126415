#include <gtest/gtest.h>
#include <unistd.h>

#include <tuple>

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

// (The home directory roots every bundle test's paths.)
TEST(MobileUser, IdsComeFromTheDatabaseUnderThePlatformRoot) {
    EXPECT_EQ(MobileUser::uid(), ::getuid());
    EXPECT_EQ(MobileUser::gid(), ::getgid());
}

using plist::Value;

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

}  // namespace
}  // namespace tavrix::device
