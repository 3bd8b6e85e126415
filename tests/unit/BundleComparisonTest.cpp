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
#include "util/SystemLog.h"
#include "plist/PropertyListFormat.h"

namespace tavrix {
namespace {

using plist::Value;

class CapturedLog : public ::testing::Test {
  protected:
    std::vector<std::string> lines() const { return sink_.messages(); }
    bool logged(const std::string& line) const { return sink_.contains(line); }

    CapturingLogSink sink_;
    ScopedLogSink scope_{sink_};
};

// --- The carrier file-name grammar ---

using CarrierFileNameGrammar = CapturedLog;

TEST_F(CarrierFileNameGrammar, ReadsKeyAndVersionOrSaysWhyNot) {
    const std::string kTokens = "Not enough tokens to extract behavior ID\n";
    struct Case {
        std::string name;
        std::string behaviorID;
        std::string version;
        std::vector<std::string> messages;
    };
    const std::vector<Case> cases = {
        {"id+behavior+Default.bundle+ab12+7.plist", "ab12", "7", {}},
        {"device+behavior+Default.bundle+T12AP+2.10.plist", "T12AP", "2.10", {}},
        // The optional extra identifier makes five pieces; the key is still the third.
        {"device+id+behavior+Default.bundle+T12AP+ab12+3.plist", "T12AP", "3", {}},
        // Only the first ".plist" ends the version.
        {"id+behavior+Default.bundle+ab12+5.plist.plist", "ab12", "5", {}},
        {"id+behavior+Default.bundle+7.plist", "", "7", {kTokens}},
        {"id+behavior+Default.bundle+ab12+x+y+7.plist", "", "7", {kTokens}},
        // A prefix counts only at the start, and case-sensitively.
        {"x+id+behavior+B+k+1.plist",
         "",
         "",
         {"There is no overlay for the carrier file: "
          "x+id+behavior+B+k+1.plist\n"}},
        {"ID+behavior+B+k+1.plist",
         "",
         "",
         {"There is no overlay for the carrier file: "
          "ID+behavior+B+k+1.plist\n"}},
        {"", "", "", {"Carrier file name is empty?\n", "Carrier file name is empty?\n"}},
        {"id+behavior+x+y+z",
         "y",
         "",
         {"plist extension is not present in the carrier file name\n"}},
        {"device+behavior.plist", "", "", {kTokens, "_ is missing from the carrier file\n"}},
        {"id+behavior+Default.bundle+ab12+.plist",
         "ab12",
         "",
         {"_ is the last character in the string, cannot get the version\n"}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        sink_.clear();
        EXPECT_EQ(behaviorIDFromCarrierFileName(c.name), c.behaviorID);
        EXPECT_EQ(versionFromCarrierFileName(c.name), c.version);
        EXPECT_EQ(lines(), c.messages);
    }
}

TEST_F(CarrierFileNameGrammar, MatchedFileWinsOnlyWithAnotherIDOrAHigherVersion) {
    const std::string current = "id+behavior+Default.bundle+ab12+1.9.plist";
    const std::string otherID = "id+behavior+Default.bundle+cd34+1.0.plist";
    EXPECT_TRUE(compareCarrierFileNames(current, otherID));
    EXPECT_EQ(lines(), std::vector<std::string>{"Behavior ID's: current - ab12 (" + current +
                                                "), matched - cd34 (" + otherID + ")\n"});

    sink_.clear();
    EXPECT_TRUE(compareCarrierFileNames(current, "id+behavior+Default.bundle+ab12+1.10.plist"));
    EXPECT_TRUE(logged("Versions in the plist files (1.9, 1.10)\n"));
    EXPECT_EQ(lines().back(), "New version is higher\n");

    EXPECT_FALSE(compareCarrierFileNames(current, "id+behavior+Default.bundle+ab12+1.8.plist"));
    EXPECT_FALSE(compareCarrierFileNames(current, current));

    // Names that cannot be read are never newer.
    EXPECT_FALSE(compareCarrierFileNames("behavior.plist", current));
    EXPECT_TRUE(logged("Current carrier file does not have behavior ID: behavior.plist\n"));
    EXPECT_FALSE(compareCarrierFileNames(current, "id+behavior+a+b.plist"));
    EXPECT_TRUE(logged("Matched carrier file does not have behavior ID: id+behavior+a+b.plist\n"));
    EXPECT_FALSE(compareCarrierFileNames("id+behavior+Default.bundle+ab12+2", current));
    EXPECT_TRUE(
        logged("Current carrier file does not have version: "
               "id+behavior+Default.bundle+ab12+2\n"));
    EXPECT_FALSE(compareCarrierFileNames(current, "id+behavior+Default.bundle+ab12+.plist"));
    EXPECT_TRUE(
        logged("Matched carrier file does not have version: "
               "id+behavior+Default.bundle+ab12+.plist\n"));
}

// --- Change types and versions ---

TEST_F(CapturedLog, OverlayTransitionFollowsTheBitsThatChange) {
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
    EXPECT_TRUE(lines().empty());

    EXPECT_EQ(changeTypeForOverlayTransition(4, 0), kBundleChangeTypeUnknown);
    EXPECT_EQ(changeTypeForOverlayTransition(1, 4), kBundleChangeTypeUnknown);
    EXPECT_EQ(lines(), (std::vector<std::string>{
                           "The overlay types provided are invalid: current 4, new one 0\n",
                           "The overlay types provided are invalid: current 1, new one 4\n"}));
}

TEST(VersionOrder, DigitRunsCompareAsNumbersAndTheRestLiterally) {
    struct Case {
        const char* a;
        const char* b;
        int expected;
    };
    const std::vector<Case> cases = {
        {"9", "10", -1},
        {"1.9", "1.10", -1},
        {"2.10", "2.9", 1},
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
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.a) + " vs " + c.b);
        EXPECT_EQ(compareVersionStrings(c.a, c.b), c.expected);
        EXPECT_EQ(compareVersionStrings(c.b, c.a), -c.expected);
    }
}

// --- Comparing the linked bundle with a matched one ---

// Bundles with links in the test's own device root.
class BundleDecision : public CapturedLog {
  protected:
    std::string home() const { return (test::unitTestRoot() / "var/mobile").string(); }
    std::string bundleLink() const { return home() + "/Library/Tavrix.bundle"; }
    std::string preferencesLink() const {
        return home() + "/Library/Preferences/com.zandor.tavrix.plist";
    }

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
        EXPECT_TRUE(establishBundleLinks(bundle, bundleLink(), preferencesLink()));
        return bundle;
    }

    BundleChangeType compare(const CarrierBundle& current, const CarrierBundle& matched) {
        BundleManager& manager = BundleManager::sharedInstance();
        sink_.clear();
        return manager.compareBundles(current, matched);
    }

    const plist::Dictionary info_ = {{"QZBundleIdentifier", Value("com.zandor.default")},
                                     {"QZBundleVersion", Value("1.9")}};
};

TEST_F(BundleDecision, WithoutLinksEveryMatchIsACarrierChange) {
    CarrierBundle matched = makeBundle("Default.bundle", info_);
    EXPECT_EQ(compare(CarrierBundle{}, matched), kBundleChangeTypeUpdate);

    // Links whose carrier file has gone count as missing too (else this would be no change).
    CarrierBundle current = linked(matched);
    std::filesystem::remove(current.carrierFilePath);
    EXPECT_EQ(compare(current, matched), kBundleChangeTypeUpdate);

    // So do links that were re-pointed elsewhere behind the record's back.
    current = linked(makeBundle("Default.bundle", info_));
    CarrierBundle other = makeBundle("Other.bundle", info_);
    linked(other);
    EXPECT_EQ(compare(current, matched), kBundleChangeTypeUpdate);
}

TEST_F(BundleDecision, MissingOrDifferentIdentifiersAreACarrierChange) {
    CarrierBundle current = linked(makeBundle("Default.bundle", info_));

    CarrierBundle anonymous = makeBundle("Anonymous.bundle", {{"QZBundleVersion", Value("1.9")}});
    EXPECT_EQ(compare(current, anonymous), kBundleChangeTypeUpdate);
    EXPECT_EQ(lines().back(), "No Bundle ID. Carrier Change\n");

    // An identifier that is no string counts as none.
    CarrierBundle numbered = makeBundle(
        "Numbered.bundle", {{"QZBundleIdentifier", Value(7)}, {"QZBundleVersion", Value("1.9")}});
    EXPECT_EQ(compare(current, numbered), kBundleChangeTypeUpdate);
    EXPECT_EQ(lines().back(), "No Bundle ID. Carrier Change\n");

    // Identifiers compare byte for byte.
    CarrierBundle other = makeBundle(
        "Other.bundle",
        {{"QZBundleIdentifier", Value("com.zandor.Default")}, {"QZBundleVersion", Value("1.9")}});
    EXPECT_EQ(compare(current, other), kBundleChangeTypeUpdate);
    EXPECT_EQ(lines().back(), "Different Bundle IDs??\n");
}

TEST_F(BundleDecision, NewerVersionsAndCarrierFilesAreUpdates) {
    CarrierBundle current = linked(makeBundle("Default.bundle", info_));
    ASSERT_EQ(current.bundleVersion, "1.9");

    plist::Dictionary newerInfo = info_;
    newerInfo.insert_or_assign("QZBundleVersion", Value("1.10"));
    CarrierBundle newer = makeBundle("Newer.bundle", newerInfo);
    EXPECT_EQ(compare(current, newer), kBundleChangeTypeUpdate);
    EXPECT_EQ(lines(),
              (std::vector<std::string>{
                  "Links exist: Bundle links present: 1, Bundle links match: 1, Bundle "
                  "preferences link present: 1\n",
                  "Bundle versions: 1.9, 1.10\n", "Newer Bundle Version. Bundle Update\n"}));

    // An older bundle whose carrier file carries another behavior ID still replaces the current.
    CarrierBundle overlaid = linked(makeBundle(
        "Default.bundle", info_, "id+behavior+Default.bundle+ab12+1.plist", kBehaviorOverlay));
    plist::Dictionary olderInfo = info_;
    olderInfo.insert_or_assign("QZBundleVersion", Value("1.8"));
    CarrierBundle older = makeBundle("Older.bundle", olderInfo,
                                     "id+behavior+Default.bundle+cd34+1.plist", kBehaviorOverlay);
    EXPECT_EQ(compare(overlaid, older), kBundleChangeTypeUpdate);
    EXPECT_TRUE(logged("Carrier path file names (" + overlaid.carrierFilePath + ", " +
                       older.carrierFilePath + ") are not matching, checking further\n"));

    // Without a version on one side the carrier file names decide alone.
    CarrierBundle unversioned =
        makeBundle("Unversioned.bundle", {{"QZBundleIdentifier", Value("com.zandor.default")}},
                   "id+behavior+Default.bundle+ab12+2.plist", kBehaviorOverlay);
    EXPECT_EQ(compare(overlaid, unversioned), kBundleChangeTypeUpdate);
    EXPECT_TRUE(
        logged("Both the versions are not non-empty, cannot compare, existing 1.9, "
               "candidate \n"));
    EXPECT_TRUE(logged("New version is higher\n"));
}

TEST_F(BundleDecision, SameBundleAndCarrierFileLeavesTheOverlayTypesToDecide) {
    CarrierBundle current = linked(makeBundle("Default.bundle", info_));
    CarrierBundle same = makeBundle("Default.bundle", info_);
    EXPECT_EQ(compare(current, same), kBundleChangeTypeNoChange);
    EXPECT_EQ(lines().back(),
              "Same bundles, but carrier file comparison result: kBundleChangeTypeNoChange\n");

    same.overlayType = kBehaviorOverlay;
    EXPECT_EQ(compare(current, same), kBundleChangeTypeOverrideSwitch);
    EXPECT_EQ(
        lines().back(),
        "Same bundles, but carrier file comparison result: kBundleChangeTypeOverrideSwitch\n");

    // An older matched bundle with the same carrier file is no change either.
    plist::Dictionary olderInfo = info_;
    olderInfo.insert_or_assign("QZBundleVersion", Value("1.8"));
    CarrierBundle older = makeBundle("Older.bundle", olderInfo);
    EXPECT_EQ(compare(current, older), kBundleChangeTypeNoChange);
}

}  // namespace
}  // namespace tavrix
