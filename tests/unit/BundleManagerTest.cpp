#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "bundle/BundleLinks.h"
#include "bundle/BundleLocations.h"
#include "bundle/BundleManager.h"
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
    void SetUp() override {
        // Posting must never reach a bus outside the test.
        ::setenv("DBUS_SYSTEM_BUS_ADDRESS", ("unix:path=" + root() + "/no-bus").c_str(), 1);
        ::unsetenv("DBUS_STARTER_ADDRESS");
    }

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
    struct Case {
        const char* name;
        Value system;
        std::optional<Value> user;
        bool userUsable;
        bool userChosen;
    };
    const Case cases[] = {
        {"system newer", Value("1.10"), Value("1.9"), true, false},
        {"tie", Value("2.0"), Value("2.0"), true, true},
        {"a version that is no string counts by its text", Value("2"), Value(3), true, true},
        {"no base carrier file", Value("9"), Value("10"), false, false},
        {"no version", Value("9"), std::nullopt, true, false},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        test::writeBundle(systemBundle(), c.system);
        test::writeBundle(userBundle(), c.user, {}, {}, plist::Format::Binary);
        if (!c.userUsable) {
            fs::remove(userBundle() + "/behavior.plist");
        }
        CarrierBundle found;
        ASSERT_TRUE(manager.findBundle(found));
        EXPECT_EQ(found.bundlePath, c.userChosen ? userBundle() : systemBundle());
        EXPECT_EQ(found.bundleRealPath, fs::canonical(found.bundlePath).string());
        EXPECT_EQ(found.bundleVersion, (c.userChosen ? *c.user : c.system).description());
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
    fs::create_directories(home() + "/Library/Preferences");
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

    EXPECT_EQ(manager.resetBehaviorBundle("ab12"), kBundleChangeTypeUpdate);
    EXPECT_EQ(readLinkTarget(preferencesLink()), userBundle() + "/behavior.plist");
    EXPECT_FALSE(fs::exists(overlays + "id+behavior+Default.bundle+ab12+7.plist"));
    EXPECT_TRUE(fs::exists(overlays + "id+behavior+Default.bundle+ab12+9.plist"));
    EXPECT_EQ(manager.resetBehaviorBundle("ab12"), kBundleChangeTypeNoChange);
}

TEST_F(BundleManagerStartUp, WithoutAnIDTheResetRunsNothing) {
    BundleManager& manager = BundleManager::sharedInstance();
    EXPECT_EQ(manager.resetBehaviorBundle(std::nullopt), kBundleChangeTypeNoChange);
    EXPECT_FALSE(fs::exists(fs::symlink_status(bundleLink())));
}

}  // namespace
}  // namespace tavrix
