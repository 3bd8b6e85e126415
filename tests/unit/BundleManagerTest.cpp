#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <optional>
#include <string>
#include <tuple>
#include <vector>

#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "bundle/BundleComparison.h"
#include "bundle/BundleLinks.h"
#include "bundle/BundleLocations.h"
#include "bundle/BundleManager.h"
#include "bundle/VersionCompare.h"
#include "device/PlatformRoot.h"
#include "plist/PropertyListFormat.h"

namespace tavrix {
namespace {

namespace fs = std::filesystem;
using plist::Value;

// A device in the test's own root: a device class, the mobile user's home, the two bundle
// locations and the two links.
class BundleDevice : public ::testing::Test {
  protected:
    static std::string root() { return test::unitTestRoot().string(); }
    static std::string home() { return root() + "/var/mobile"; }
    static std::string systemBundle() {
        return device::resolvePath("/System/Library/TavrixBundles/Tablet/Default.bundle");
    }
    static std::string userBundle() { return home() + "/Library/TavrixBundles/Default.bundle"; }
    static std::string bundleLink() { return home() + "/Library/Tavrix.bundle"; }
    static std::string preferencesLink() {
        return home() + "/Library/Preferences/com.zandor.tavrix.plist";
    }

    static void writeDeviceTable() {
        test::writeDeviceTable({{"DeviceClass", "Tablet"},
                                {"HWModelStr", "T12AP"},
                                {"contains-cellular-radio", false}});
        fs::create_directories(home() + "/Library/Preferences");
    }
};

// --- Locations and the choice of bundle ---

using BundleLocationsTest = BundleDevice;

// The newer of the two bundles by version, the user one on a tie; a bundle without a readable
// version or without its base carrier file is no candidate.
TEST_F(BundleLocationsTest, FindBundleTakesTheNewerAndTheUserOneOnATie) {
    writeDeviceTable();
    BundleManager& manager = BundleManager::sharedInstance();
    const std::tuple<const char*, Value, std::optional<Value>, bool, bool> cases[] = {
        {"system newer", Value("1.10"), Value("1.9"), true, false},
        {"tie", Value("2.0"), Value("2.0"), true, true},
        {"a version that is no string counts by its text", Value("2"), Value(3), true, true},
        {"no base carrier file", Value("9"), Value("10"), false, false},
        {"no version", Value("9"), std::nullopt, true, false},
    };
    for (const auto& [name, system, user, userUsable, userChosen] : cases) {
        SCOPED_TRACE(name);
        test::writeBundle(systemBundle(), system);
        test::writeBundle(userBundle(), user, {}, {}, plist::Format::Binary);
        if (!userUsable) {
            fs::remove(userBundle() + "/behavior.plist");
        }
        CarrierBundle found;
        ASSERT_TRUE(manager.findBundle(found));
        EXPECT_EQ(found.bundlePath, userChosen ? userBundle() : systemBundle());
        EXPECT_EQ(found.bundleRealPath, fs::canonical(found.bundlePath).string());
        EXPECT_EQ(found.bundleVersion, (userChosen ? *user : system).description());
        EXPECT_EQ(found.carrierFilePath, "");
    }
    test::writeText(userBundle() + "/Info.plist", "<plist><dict><key>QZBundle");
    CarrierBundle found;
    ASSERT_TRUE(manager.findBundle(found));
    EXPECT_EQ(found.bundlePath, systemBundle());
    fs::remove_all(systemBundle());
    EXPECT_FALSE(manager.findBundle(found));
}

TEST_F(BundleLocationsTest, WithoutAHomeNothingIsLinkedOrInstalledAnywhere) {
    // No "mobile" user and no device table: the user location and both link paths are empty.
    test::writeText(root() + "/etc/passwd", "root:x:0:0:root:/root:/bin/sh\n");
    const std::string system = device::resolvePath("/System/Library/TavrixBundles//Default.bundle");
    test::writeBundle(system, Value("5"));

    BundleManager& manager = BundleManager::sharedInstance();
    EXPECT_EQ(userBundleLocation(), "");
    EXPECT_EQ(manager.bundleLinkPath(), "");
    EXPECT_EQ(manager.preferencesLinkPath(), "");

    CarrierBundle found;
    ASSERT_TRUE(manager.findBundle(found));
    EXPECT_EQ(found.bundlePath, system);

    const fs::path workingDirectory = fs::current_path();
    EXPECT_EQ(manager.resetBehaviorBundle("ab12"), kBundleChangeTypeNoChange);
    EXPECT_FALSE(fs::exists(fs::symlink_status(workingDirectory / "Library")));
    EXPECT_FALSE(fs::exists(fs::symlink_status(workingDirectory / "(null)")));
}

// --- Links ---

using BundleLinksTest = BundleDevice;

// Each link is read back after it is made: the version is read again from the linked bundle,
// and a link text longer than the 1023 bytes read back never verifies.
TEST_F(BundleLinksTest, LinksAreReadBackAndTheVersionRereadFromThem) {
    test::writeBundle(userBundle(), Value("10"));
    fs::create_directories(home() + "/Library/Preferences");
    CarrierBundle bundle;
    bundle.bundlePath = userBundle();
    bundle.carrierFilePath = userBundle() + "/behavior.plist";
    bundle.bundleVersion = "stale";
    ASSERT_TRUE(establishBundleLinks(bundle, bundleLink(), preferencesLink()));
    EXPECT_EQ(bundle.bundleVersion, "10");
    EXPECT_EQ(bundle.bundleLinkPath, bundleLink());
    EXPECT_EQ(bundle.preferencesLinkPath, preferencesLink());

    const std::string longTarget = "/" + std::string(1100, 'x');
    bundle.bundlePath = longTarget;
    EXPECT_FALSE(establishBundleLinks(bundle, bundleLink(), preferencesLink()));
    // A preferences link that does not verify fails and leaves the version empty.
    bundle.bundlePath = userBundle();
    bundle.carrierFilePath = longTarget;
    EXPECT_FALSE(establishBundleLinks(bundle, bundleLink(), preferencesLink()));
    EXPECT_EQ(bundle.bundleVersion, "");
    EXPECT_EQ(readLinkTarget(bundleLink()), userBundle());
}

// --- Start-up and the reset flow ---

using BundleManagerStartUp = BundleDevice;

TEST_F(BundleManagerStartUp, ReadsDanglingLinksAsTheyAre) {
    writeDeviceTable();
    const std::string carrierFile =
        userBundle() + "/Overlay/device+id+behavior+Default.bundle+T12AP+ab12+1.plist";
    fs::create_symlink(home() + "/gone.bundle", bundleLink());
    fs::create_symlink(carrierFile, preferencesLink());

    BundleManager& manager = BundleManager::sharedInstance();
    const CarrierBundle& current = manager.currentBundle();
    EXPECT_EQ(current.bundlePath, home() + "/gone.bundle");
    EXPECT_EQ(current.bundleRealPath, "");
    EXPECT_EQ(current.bundleVersion, "");
    EXPECT_EQ(current.bundleLinkPath, bundleLink());
    EXPECT_EQ(current.preferencesLinkPath, preferencesLink());
    EXPECT_EQ(current.carrierFilePath, carrierFile);
    EXPECT_EQ(current.overlayType, kDeviceBehaviorOverlay);
    EXPECT_EQ(manager.copyBundleVersion(), std::nullopt);
}

// Links left by a crash between the two link changes (the bundle link already on the new bundle,
// the carrier file link still in the old one) must not read as the intended state, although the
// carrier file names are equal; a pair that agrees needs nothing. Leftovers of the interrupted
// change go at start-up, generated files of versions no longer installed after the relink.
TEST_F(BundleManagerStartUp, LinksThatDisagreeAreLinkedAgainAndLeftoversRemoved) {
    writeDeviceTable();
    test::writeBundle(systemBundle(), Value("9"));
    test::writeBundle(userBundle(), Value("10"));
    fs::create_symlink(userBundle(), bundleLink());
    fs::create_symlink(systemBundle() + "/behavior.plist", preferencesLink());
    const std::string overlays = home() + "/Library/TavrixBundles/Overlay/";
    test::writeText(overlays + "id+behavior+Default.bundle+ab12+7.plist", "<plist/>");
    test::writeText(overlays + "id+behavior+Default.bundle+ab12+9.plist", "<plist/>");
    test::writeText(overlays + ".tavrix-write-Ab12Cd", "half");
    fs::create_symlink(userBundle(), home() + "/Library/.tavrix-write-Xy12Ab");
    test::writeText(root() + "/tmp/behaviorbundle_zipped.tgz", "staged");
    test::writeText(home() + "/Library/TavrixBundles/.Default.bundle.incoming/Info.plist", "x");
    // Temporaries are left alone while they may still be being written.
    const timespec aMinuteAgo[2] = {{::time(nullptr) - 60, 0}, {::time(nullptr) - 60, 0}};
    for (const std::string& temporary :
         {overlays + ".tavrix-write-Ab12Cd", home() + "/Library/.tavrix-write-Xy12Ab"}) {
        ASSERT_EQ(::utimensat(AT_FDCWD, temporary.c_str(), aMinuteAgo, AT_SYMLINK_NOFOLLOW), 0);
    }

    BundleManager& manager = BundleManager::sharedInstance();
    for (const std::string& leftover :
         {overlays + ".tavrix-write-Ab12Cd", home() + "/Library/.tavrix-write-Xy12Ab",
          root() + "/tmp/behaviorbundle_zipped.tgz",
          home() + "/Library/TavrixBundles/.Default.bundle.incoming"}) {
        EXPECT_FALSE(fs::exists(fs::symlink_status(leftover))) << leftover;
    }

    // Without an ID the reset runs nothing, not even the relink.
    EXPECT_EQ(manager.resetBehaviorBundle(std::nullopt), kBundleChangeTypeNoChange);
    EXPECT_EQ(manager.resetBehaviorBundle("ab12"), kBundleChangeTypeUpdate);
    EXPECT_EQ(readLinkTarget(preferencesLink()), userBundle() + "/behavior.plist");
    EXPECT_FALSE(fs::exists(overlays + "id+behavior+Default.bundle+ab12+7.plist"));
    EXPECT_TRUE(fs::exists(overlays + "id+behavior+Default.bundle+ab12+9.plist"));
    EXPECT_EQ(manager.resetBehaviorBundle("ab12"), kBundleChangeTypeNoChange);
}

// --- The carrier file-name grammar ---

TEST(CarrierFileNameGrammar, ReadsKeyAndVersionAndOrdersNames) {
    const std::vector<std::tuple<std::string, std::string, std::string>> cases = {
        {"id+behavior+Default.bundle+ab12+7.plist", "ab12", "7"},
        {"device+behavior+Default.bundle+T12AP+2.10.plist", "T12AP", "2.10"},
        // The optional extra identifier makes five pieces; the key is still the third.
        {"device+id+behavior+Default.bundle+T12AP+ab12+3.plist", "T12AP", "3"},
        // Only the first ".plist" ends the version.
        {"id+behavior+Default.bundle+ab12+5.plist.plist", "ab12", "5"},
        {"id+behavior+Default.bundle+7.plist", "", "7"},
        {"id+behavior+Default.bundle+ab12+x+y+7.plist", "", "7"},
        // A prefix counts only at the start, and case-sensitively.
        {"x+id+behavior+B+k+1.plist", "", ""},
        {"ID+behavior+B+k+1.plist", "", ""},
        {"", "", ""},
        {"id+behavior+x+y+z", "y", ""},
        {"device+behavior.plist", "", ""},
        {"id+behavior+Default.bundle+ab12+.plist", "ab12", ""},
    };
    for (const auto& [name, behaviorID, version] : cases) {
        SCOPED_TRACE(name);
        EXPECT_EQ(behaviorIDFromCarrierFileName(name), behaviorID);
        EXPECT_EQ(versionFromCarrierFileName(name), version);
    }

    // The matched file wins only with another ID or a higher version (both decide bundles in the
    // comparison test below); names that cannot be read are never newer.
    const std::string current = "id+behavior+Default.bundle+ab12+1.9.plist";
    EXPECT_TRUE(compareCarrierFileNames(current, "id+behavior+Default.bundle+ab12+1.10.plist"));
    const std::pair<std::string, std::string> notNewer[] = {
        {current, "id+behavior+Default.bundle+ab12+1.8.plist"},
        {current, current},
        {"behavior.plist", current},
        {current, "id+behavior+a+b.plist"},
        {"id+behavior+Default.bundle+ab12+2", current},
        {current, "id+behavior+Default.bundle+ab12+.plist"},
    };
    for (const auto& [a, b] : notNewer) {
        EXPECT_FALSE(compareCarrierFileNames(a, b)) << a << " vs " << b;
    }
}

// --- Change types and versions ---

TEST(OverlayTransition, FollowsTheBitsThatChange) {
    constexpr BundleChangeType N = kBundleChangeTypeNoChange;
    constexpr BundleChangeType U = kBundleChangeTypeUpdate;
    constexpr BundleChangeType S = kBundleChangeTypeOverrideSwitch;
    const BundleChangeType expected[4][4] = {
        {N, U, S, U},
        {U, N, U, S},
        {S, U, N, U},
        {U, S, U, N},
    };
    for (OverlayType current = 0; current < 4; ++current) {
        for (OverlayType matched = 0; matched < 4; ++matched) {
            EXPECT_EQ(changeTypeForOverlayTransition(current, matched), expected[current][matched])
                << current << " -> " << matched;
        }
    }
    EXPECT_EQ(changeTypeForOverlayTransition(4, 0), kBundleChangeTypeUnknown);
    EXPECT_EQ(changeTypeForOverlayTransition(1, 4), kBundleChangeTypeUnknown);
}

TEST(VersionOrder, DigitRunsCompareAsNumbersAndTheRestLiterally) {
    const std::tuple<const char*, const char*, int> cases[] = {
        {"9", "10", -1},
        {"1.9", "1.10", -1},
        {"", "", 0},
        {"1.0", "1.0.1", -1},
        {"a", "A", 1},          // case-sensitive: 'A' sorts first
        {"v1", "1", 1},         // a letter against a digit compares literally
        {"1.01", "1.1", 0},     // leading zeros do not change a number's value
        {"1.01a", "1.1b", -1},  // and the comparison goes on after it
        // Far beyond 64 bits.
        {"99999999999999999999999999", "100000000000000000000000000", -1},
        {"1.000000000000000000000000000002", "1.2", 0},
        {"123456789012345678901234567891", "123456789012345678901234567890", 1},
    };
    for (const auto& [a, b, expected] : cases) {
        SCOPED_TRACE(std::string(a) + " vs " + b);
        EXPECT_EQ(compareVersionStrings(a, b), expected);
        EXPECT_EQ(compareVersionStrings(b, a), -expected);
    }
}

// --- Comparing the linked bundle with a matched one ---

class BundleDecision : public BundleDevice {
  protected:
    // A bundle directory with an Info dictionary and a carrier file, described by a record.
    CarrierBundle makeBundle(const std::string& name, const plist::Dictionary& info,
                             const std::string& carrierFileName = "behavior.plist",
                             OverlayType overlay = kNoOverlay) {
        std::string path = home() + "/Library/TavrixBundles/" + name;
        fs::create_directories(path);
        EXPECT_TRUE(plist::writeFile(path + "/Info.plist", Value(info)));
        EXPECT_TRUE(plist::writeFile(path + "/" + carrierFileName,
                                     Value(plist::Dictionary{{"Name", Value(name)}})));
        CarrierBundle bundle;
        bundle.resetWithPath(path);
        bundle.carrierFilePath = path + "/" + carrierFileName;
        bundle.overlayType = overlay;
        return bundle;
    }

    CarrierBundle linked(CarrierBundle bundle) {
        fs::create_directories(home() + "/Library/Preferences");
        EXPECT_TRUE(establishBundleLinks(bundle, bundleLink(), preferencesLink()));
        return bundle;
    }

    static plist::Dictionary info(std::optional<Value> identifier, std::optional<Value> version) {
        plist::Dictionary info;
        if (identifier) {
            info.emplace("QZBundleIdentifier", *identifier);
        }
        if (version) {
            info.emplace("QZBundleVersion", *version);
        }
        return info;
    }

    BundleChangeType compare(const CarrierBundle& current, const CarrierBundle& matched) {
        return BundleManager::sharedInstance().compareBundles(current, matched);
    }

    const plist::Dictionary info_ = info(Value("com.zandor.default"), Value("1.9"));
};

// Links that dangle or were re-pointed, and identifiers that are missing, no string or different
// byte for byte: each is a carrier change. (No links at all is the real daemon's first set.)
TEST_F(BundleDecision, AnythingButTheSameLinkedBundleIsACarrierChange) {
    CarrierBundle matched = makeBundle("Default.bundle", info_);
    CarrierBundle current = linked(matched);
    fs::remove(current.carrierFilePath);
    EXPECT_EQ(compare(current, matched), kBundleChangeTypeUpdate);
    current = linked(makeBundle("Default.bundle", info_));
    linked(makeBundle("Other.bundle", info_));
    EXPECT_EQ(compare(current, matched), kBundleChangeTypeUpdate);

    current = linked(makeBundle("Default.bundle", info_));
    for (const std::optional<Value>& identifier : {std::optional<Value>(), std::optional<Value>(7),
                                                   std::optional<Value>("com.zandor.Default")}) {
        SCOPED_TRACE(describe(identifier ? &*identifier : nullptr));
        EXPECT_EQ(compare(current, makeBundle("Other.bundle", info(identifier, Value("1.9")))),
                  kBundleChangeTypeUpdate);
    }
}

// (A newer bundle, the same one again and an overlay switch show on the real daemon.)
TEST_F(BundleDecision, VersionsCarrierFilesAndOverlayTypesDecide) {
    CarrierBundle current = linked(makeBundle("Default.bundle", info_));
    ASSERT_EQ(current.bundleVersion, "1.9");
    // An older matched bundle with the same carrier file is no change; the overlay types decide.
    CarrierBundle older =
        makeBundle("Older.bundle", info(Value("com.zandor.default"), Value("1.8")));
    EXPECT_EQ(compare(current, older), kBundleChangeTypeNoChange);
    older.overlayType = kBehaviorOverlay;
    EXPECT_EQ(compare(current, older), kBundleChangeTypeOverrideSwitch);

    // An older bundle whose carrier file carries another behavior ID still replaces the current;
    // without a version on one side the carrier file names decide alone.
    CarrierBundle overlaid = linked(makeBundle(
        "Default.bundle", info_, "id+behavior+Default.bundle+ab12+1.plist", kBehaviorOverlay));
    EXPECT_EQ(compare(overlaid,
                      makeBundle("Older.bundle", info(Value("com.zandor.default"), Value("1.8")),
                                 "id+behavior+Default.bundle+cd34+1.plist", kBehaviorOverlay)),
              kBundleChangeTypeUpdate);
    EXPECT_EQ(
        compare(overlaid,
                makeBundle("Unversioned.bundle", info(Value("com.zandor.default"), std::nullopt),
                           "id+behavior+Default.bundle+ab12+2.plist", kBehaviorOverlay)),
        kBundleChangeTypeUpdate);
}

}  // namespace
}  // namespace tavrix
