#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "bundle/BundleComparison.h"
#include "bundle/BundleLinks.h"
#include "bundle/BundleManager.h"
#include "bundle/VersionCompare.h"
#include "plist/PropertyListFormat.h"

namespace tavrix {
namespace {

using plist::Value;

// --- The carrier file-name grammar ---

TEST(CarrierFileNameGrammar, ReadsKeyAndVersion) {
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
}

// The matched file wins only with another ID or a higher version (both decide bundles in the
// comparison test below); names that cannot be read are never newer.
TEST(CarrierFileNameGrammar, MatchedFileWinsOnlyWithAnotherIDOrAHigherVersion) {
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

// Bundles with links in the test's own device root.
class BundleDecision : public ::testing::Test {
  protected:
    std::string home() const { return (test::unitTestRoot() / "var/mobile").string(); }

    // A bundle directory with an Info dictionary and a carrier file, described by a record.
    CarrierBundle makeBundle(const std::string& name, const plist::Dictionary& info,
                             const std::string& carrierFileName = "behavior.plist",
                             OverlayType overlay = kNoOverlay) {
        std::string path = home() + "/Library/TavrixBundles/" + name;
        std::filesystem::create_directories(path);
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
        std::filesystem::create_directories(home() + "/Library/Preferences");
        EXPECT_TRUE(establishBundleLinks(bundle, home() + "/Library/Tavrix.bundle",
                                         home() + "/Library/Preferences/com.zandor.tavrix.plist"));
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
    std::filesystem::remove(current.carrierFilePath);
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
