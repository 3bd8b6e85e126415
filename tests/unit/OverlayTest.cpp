#include <gtest/gtest.h>

#include <filesystem>
#include <optional>
#include <set>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "TestDoubles.h"
#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "bundle/BundleLinks.h"
#include "bundle/CarrierFileLoader.h"
#include "bundle/OverlayConfiguration.h"
#include "bundle/OverrideGeneration.h"
#include "device/PlatformRoot.h"
#include "plist/PropertyListFormat.h"
#include "plist/Value.h"

namespace tavrix {
namespace {

namespace fs = std::filesystem;
using plist::Array;
using plist::Dictionary;
using plist::Value;

// A device in the test's own root (model T12AP) with one system bundle (version 1.0) whose base
// carrier file lists behavior overrides for "ABC".
class OverrideGenerationTest : public testing::Test {
  protected:
    void SetUp() override {
        test::writeDeviceTable({{"DeviceClass", "Phone"}, {"HWModelStr", "T12AP"}});
    }
    static std::string home() { return test::unitTestRoot().string() + "/var/mobile"; }
    static std::string bundle() {
        return device::resolvePath("/System/Library/TavrixBundles/Phone/Default.bundle");
    }
    static std::string baseFile() { return bundle() + "/behavior.plist"; }

    static Dictionary baseCarrier() {
        const Dictionary abc{{"Name", "Abc"}, {"_Exclude", Array{"Dropped"}}};
        return Dictionary{
            {"Name", "Base"},
            {"Dropped", true},
            {"Model", "generic"},
            {"BehaviorOverrides",
             Dictionary{{"abc-group", Dictionary{{"SupportedBehaviorIDs", Array{"ABC"}},
                                                 {"OverrideConfiguration", abc}}}}}};
    }

    // The device decision leaves the base bundle in the record, as the reset flow would have it.
    CarrierBundle baseBundle() {
        CarrierBundle record;
        makeDeviceOverlayDecision(record, std::nullopt);
        return record;
    }
};

// Without a device file for the model, the device decision leaves the base bundle in the record;
// without a listed ID, so does the behavior overlay. Without a readable base there is no carrier
// info.
TEST_F(OverrideGenerationTest, WithoutAMatchTheRecordKeepsTheBaseFile) {
    // No bundle at all: the empty carrier path cannot be loaded.
    CarrierBundle record;
    EXPECT_EQ(makeDeviceOverlayDecision(record, std::nullopt), kCarrierInfoNotPresent);
    EXPECT_TRUE(record.bundlePath.empty());
    // A base carrier file that holds no dictionary.
    test::writeBundle(bundle(), "1.0");
    ASSERT_TRUE(plist::writeFile(baseFile(), Value(Array{"ABC"})));
    record = baseBundle();
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("abc")), kCarrierInfoNotPresent);
    EXPECT_EQ(record.carrierFilePath, baseFile());

    test::writeBundle(bundle(), "1.0", baseCarrier());
    record.carrierFilePath = "/stale";
    EXPECT_EQ(makeDeviceOverlayDecision(record, std::nullopt), kNoMatchForOverlay);
    EXPECT_EQ(record.bundlePath, bundle());
    EXPECT_EQ(record.carrierFilePath, baseFile());

    EXPECT_EQ(applyMultimodeOverlay(record, std::string("xyz")), kNoMatchForOverlay);
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("")), kOverrideNotRequired);
    EXPECT_EQ(applyMultimodeOverlay(record, std::nullopt), kOverrideNotRequired);

    test::writeBundle(bundle(), "1.0", Dictionary{{"Name", "Base"}});
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("abc")), kOverrideNotRequired);
    EXPECT_EQ(record.carrierFilePath, baseFile());
    EXPECT_EQ(record.overlayType, kNoOverlay);
    EXPECT_FALSE(fs::exists(home() + "/Library/TavrixBundles/Overlay"));
}

// The device overlay file is found by the model as a whole '_' field of its name. (The behavior
// overlay built on it shows on the real daemon.)
TEST_F(OverrideGenerationTest, DeviceOverlayIsFoundByTheModelAsAWholeField) {
    test::writeBundle(bundle(), "1.0", baseCarrier());
    ASSERT_TRUE(plist::writeFile(bundle() + "/overrides_T12.plist", Value(Dictionary{})));
    ASSERT_TRUE(plist::writeFile(bundle() + "/overrides_T12AP.txt", Value(Dictionary{})));
    ASSERT_TRUE(plist::writeFile(bundle() + "/overrides_X1_T12AP.plist",
                                 Value(Dictionary{{"Model", "T12AP"}})));

    CarrierBundle record;
    EXPECT_EQ(makeDeviceOverlayDecision(record, std::string("ignored")), kOverrideBundleSuccess);
    const std::string deviceFile =
        home() + "/Library/TavrixBundles/Overlay/device+behavior+Default.bundle+T12AP+1.0.plist";
    EXPECT_EQ(record.carrierFilePath, deviceFile);
    EXPECT_EQ(record.overlayType, kDeviceOverlay);
    EXPECT_EQ(plist::readFile(deviceFile)->find("Model")->description(), "T12AP");
}

// The hardware model is read once per process: an unknown one needs a test of its own.
TEST_F(OverrideGenerationTest, AnUnknownModelNeedsNoOverride) {
    test::writeDeviceTable({{"DeviceClass", "Phone"}});
    test::writeBundle(bundle(), "1.0", baseCarrier());
    CarrierBundle record;
    EXPECT_EQ(makeDeviceOverlayDecision(record, std::nullopt), kOverrideNotRequired);
    EXPECT_EQ(record.carrierFilePath, baseFile());
}

// Behavior IDs are chosen by others: whatever they hold, each gets a file of its own inside the
// overlay directory, and one that no file name can hold leaves the record alone.
TEST_F(OverrideGenerationTest, EveryBehaviorIDGetsItsOwnFileInsideTheOverlayDirectory) {
    const std::string escaping = "x/../../../escape";
    const std::string lookalike = "x%2f..%2f..%2f..%2fescape";
    const std::string withFields = "a+b\n<0>";
    const std::string tooLong(300, 'l');
    Dictionary carrier = baseCarrier();
    carrier.insert_or_assign(
        "BehaviorOverrides",
        Dictionary{{"g", Dictionary{{"SupportedBehaviorIDs",
                                     Array{"abc", escaping, lookalike, withFields, tooLong}},
                                    {"OverrideConfiguration", Dictionary{{"Name", "X"}}}}}});
    test::writeBundle(bundle(), "1.0", carrier);

    std::set<std::string> files;
    for (const std::string& id : {escaping, lookalike, withFields}) {
        CarrierBundle record = baseBundle();
        ASSERT_EQ(applyMultimodeOverlay(record, id), kOverrideBundleSuccess) << id;
        EXPECT_EQ(dirNameOfPath(record.carrierFilePath), home() + "/Library/TavrixBundles/Overlay");
        files.insert(record.carrierFilePath);
    }
    EXPECT_EQ(files.size(), 3u);
    EXPECT_FALSE(fs::exists(home() + "/Library/escape+1.0.plist"));

    CarrierBundle record = baseBundle();
    EXPECT_EQ(applyMultimodeOverlay(record, tooLong), kOverrideBundleFailure);
    EXPECT_EQ(record.carrierFilePath, baseFile());
    // Neither a version that names directories nor an empty bundle name (one file for every ID)
    // makes a path.
    record = baseBundle();
    record.bundleVersion = "1/../../../escape";
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("abc")), kOverrideBundleFailure);
    record = baseBundle();
    record.bundlePath.clear();
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("abc")), kOverrideBundleFailure);
    EXPECT_EQ(record.carrierFilePath, baseFile());
    EXPECT_FALSE(fs::exists(home() + "/Library/escape.plist"));

    // A file where the Overlay directory belongs.
    fs::remove_all(home() + "/Library/TavrixBundles/Overlay");
    test::writeText(home() + "/Library/TavrixBundles/Overlay", "in the way");
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("abc")), kOverrideBundleFailure);
    EXPECT_EQ(record.carrierFilePath, baseFile());
    EXPECT_EQ(record.overlayType, kNoOverlay);

    // A link where the Overlay directory or a generated file belongs is not the daemon's: it is
    // replaced by the daemon's own, and nothing is read or written where it points.
    const std::string overlay = home() + "/Library/TavrixBundles/Overlay";
    const std::string elsewhere = test::unitTestRoot().string() + "/elsewhere";
    fs::remove(overlay);
    fs::create_directories(elsewhere);
    fs::create_symlink(elsewhere, overlay);
    record = baseBundle();
    ASSERT_EQ(applyMultimodeOverlay(record, std::string("abc")), kOverrideBundleSuccess);
    EXPECT_FALSE(fs::is_symlink(overlay));
    EXPECT_TRUE(fs::is_empty(elsewhere));
    test::writeText(elsewhere + "/planted.plist", "<plist/>");
    fs::remove(record.carrierFilePath);
    fs::create_symlink(elsewhere + "/planted.plist", record.carrierFilePath);
    CarrierBundle again = baseBundle();
    ASSERT_EQ(applyMultimodeOverlay(again, std::string("abc")), kOverrideBundleSuccess);
    EXPECT_FALSE(fs::is_symlink(again.carrierFilePath));
    EXPECT_EQ(test::readText(elsewhere + "/planted.plist"), "<plist/>");
}

Value group(Array ids, Dictionary configuration) {
    return Dictionary{{"SupportedBehaviorIDs", std::move(ids)},
                      {"OverrideConfiguration", std::move(configuration)}};
}

Value baseWith(Dictionary overrides) {
    return Dictionary{{"CarrierName", "Base"}, {"BehaviorOverrides", std::move(overrides)}};
}

class OverlayConfigurationTest : public testing::Test {
  protected:
    CapturingLogSink sink;
    ScopedLogSink guard{sink};
};

// ---- the override map ----

TEST_F(OverlayConfigurationTest, MapsEveryListedIDLowercasedToItsGroupsConfiguration) {
    Dictionary first{{"Name", "First"}};
    Dictionary second{{"Name", "Second"}};
    Value base = baseWith({
        {"a-group", group({"ABC", "MiXeD-\xC3\x89t\xC3\xA9", "shared"}, first)},
        // Enumerated after "a-group": its "shared" wins.
        {"b-group", group({"shared", 42, true}, second)},
        {"c-empty", group({}, second)},
        // Malformed groups are skipped.
        {"m1", "not a group"},
        {"m2", Dictionary{{"OverrideConfiguration", first}}},
        {"m3", Dictionary{{"SupportedBehaviorIDs", "abc"}, {"OverrideConfiguration", first}}},
        {"m4", Dictionary{{"SupportedBehaviorIDs", Array{"abc"}}}},
        {"m5", Dictionary{{"SupportedBehaviorIDs", Array{"abc"}}, {"OverrideConfiguration", 1}}},
    });
    std::optional<BehaviorOverrideMap> map = copyBehaviorOverrides(base);
    ASSERT_TRUE(map);
    // Each shared configuration resolved, for comparison.
    Dictionary resolved;
    for (const auto& [id, configuration] : *map) {
        resolved.emplace(id, *configuration);
    }
    // Letters outside ASCII are lowered like the stored ID; non-string IDs are rendered as text.
    EXPECT_EQ(resolved, (Dictionary{{"abc", first},
                                    {"mixed-\xC3\xA9t\xC3\xA9", first},
                                    {"shared", second},
                                    {"42", second},
                                    {"true", second}}));
    EXPECT_EQ(sink.messages().size(), 5u) << "one line for each malformed group only";
}

// The ID is looked up as given (IDs reach this point lowercased already); without a usable
// section there is no key, while a section without groups sets the key and matches nothing.
TEST_F(OverlayConfigurationTest, TheBehaviorIDIsLookedUpAsGiven) {
    Dictionary configuration{{"Name", "Abc"}};
    Value base = baseWith({{"g", group({"ABC"}, configuration)}});
    const std::tuple<std::string, Value, std::string, std::optional<Dictionary>> cases[] = {
        {"abc", base, "abc", configuration},
        {"ABC", base, "ABC", std::nullopt},
        {"", base, "", std::nullopt},
        {"abc", baseWith({}), "abc", std::nullopt},
        {"abc", Value(Dictionary{{"CarrierName", "Base"}}), "", std::nullopt},
        {"abc", Value(Dictionary{{"BehaviorOverrides", Array{}}}), "", std::nullopt},
        {"abc", Value("text"), "", std::nullopt},
    };
    for (const auto& [id, carrier, key, found] : cases) {
        SCOPED_TRACE(id + " in " + carrier.description());
        BehaviorOverlayConfiguration overlay(id, carrier);
        EXPECT_EQ(overlay.overlayKey(), key);
        EXPECT_EQ(overlay.overrideConfiguration() ? std::optional(*overlay.overrideConfiguration())
                                                  : std::nullopt,
                  found);
        EXPECT_EQ(overlay.baseDictionary(), carrier);
    }
}

// ---- merging ----

struct MergeCase {
    const char* name;
    Dictionary base;
    Dictionary overlay;
    Dictionary expected;
};

TEST(MergeDictionariesTest, FollowsTheMergeRulesAndLeavesInputsAlone) {
    const std::vector<MergeCase> cases = {
        {"nested dictionaries merge",
         {{"a", 1}, {"d", Dictionary{{"x", 1}, {"y", 2}}}},
         {{"a", 2}, {"d", Dictionary{{"y", 3}, {"z", 4}}}},
         {{"a", 2}, {"d", Dictionary{{"x", 1}, {"y", 3}, {"z", 4}}}}},
        {"arrays replace whole", {{"a", Array{1, 2}}}, {{"a", Array{3}}}, {{"a", Array{3}}}},
        {"scalars replace containers and back",
         {{"a", Dictionary{{"x", 1}}}, {"b", "text"}},
         {{"a", false}, {"b", Array{}}},
         {{"a", false}, {"b", Array{}}}},
        {"exclusion removes base and new keys",
         {{"a", 1}, {"b", 2}},
         {{"c", 3}, {"_Exclude", Array{"a", "c", "missing", 7}}},
         {{"b", 2}}},
        {"an _Exclude that is no array stays",
         {{"a", 1}},
         {{"_Exclude", "a"}},
         {{"a", 1}, {"_Exclude", "a"}}},
        {"nested _Exclude acts only on an existing dictionary",
         {{"kept", Dictionary{{"x", 1}, {"y", 2}}}},
         {{"kept", Dictionary{{"_Exclude", Array{"x"}}}},
          {"new", Dictionary{{"x", 1}, {"_Exclude", Array{"x"}}}}},
         {{"kept", Dictionary{{"y", 2}}}, {"new", Dictionary{{"x", 1}, {"_Exclude", Array{"x"}}}}}},
        {"a dictionary onto a non-dictionary merges onto nothing",
         {{"d", 5}},
         {{"d", Dictionary{{"x", 1}, {"y", 2}, {"_Exclude", Array{"y"}}}}},
         {{"d", Dictionary{{"x", 1}}}}},
        {"empty overlay", {{"a", 1}}, {}, {{"a", 1}}},
    };
    for (const MergeCase& c : cases) {
        Dictionary base = c.base;
        Dictionary overlay = c.overlay;
        EXPECT_EQ(mergeDictionaries(base, overlay), c.expected) << c.name;
        EXPECT_EQ(base, c.base) << c.name;
        EXPECT_EQ(overlay, c.overlay) << c.name;
    }
}

// Dictionaries load from any path (either format: the reader's own test); other content yields
// nothing silently, and only a file that cannot be read is logged, at error priority.
TEST(CarrierFileLoaderTest, LocalFilesLoadOnlyWhenTheyHoldADictionary) {
    test::TempDir dir;
    CapturingLogSink sink;
    ScopedLogSink guard(sink);
    const Value carrier(
        Dictionary{{"CarrierName", "Zed"}, {"Nested", Dictionary{{"List", Array{1, 2, 3}}}}});
    // Spaces, '%', '+' and non-ASCII bytes must survive the trip through a file URL.
    for (const std::string name :
         {"behavior.plist", "dir with space/a%20b+c.plist", "d\xC3\xA9j\xC3\xA0/x#y?.plist"}) {
        test::writeText(dir / name, *plist::serialize(carrier, plist::Format::Binary));
        EXPECT_EQ(copyDictionaryFromFile(dir / name), carrier) << name;
    }
    for (const std::string& content :
         {*plist::serialize(plist::Value(plist::Array{"a", "b"})),
          *plist::serialize(plist::Value("text"), plist::Format::Binary), std::string(),
          std::string("<plist><dict><key>cut")}) {
        test::writeText(dir / "carrier.plist", content);
        EXPECT_FALSE(copyDictionaryFromFile(dir / "carrier.plist")) << content;
    }
    EXPECT_TRUE(sink.messages().empty());

    EXPECT_FALSE(copyDictionaryFromFile(dir / "missing.plist"));
    EXPECT_FALSE(copyDictionaryFromFile(dir.path().string()));  // a directory
    EXPECT_FALSE(copyDictionaryFromFile(""));
    EXPECT_EQ(sink.messages(),
              (std::vector<std::string>{"Failed to load the file\n", "Failed to load the file\n",
                                        "Failed to get the URL for the file \n"}));
    EXPECT_EQ(sink.priorities(), (std::vector<int>{LOG_ERR, LOG_ERR, LOG_ERR}));
}

}  // namespace
}  // namespace tavrix
