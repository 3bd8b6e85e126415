#include <gtest/gtest.h>

#include <string>
#include <tuple>
#include <vector>

#include "bundle/OverlayConfiguration.h"
#include "plist/Value.h"
#include "util/SystemLog.h"

namespace tavrix {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;

Value group(Array ids, Dictionary configuration) {
    return Dictionary{{"SupportedBehaviorIDs", std::move(ids)},
                      {"OverrideConfiguration", std::move(configuration)}};
}

// The map with each shared configuration resolved, for comparison.
std::optional<Dictionary> resolvedOverrides(const Value& base) {
    std::optional<BehaviorOverrideMap> map = copyBehaviorOverrides(base);
    if (!map) {
        return std::nullopt;
    }
    Dictionary resolved;
    for (const auto& [id, configuration] : *map) {
        resolved.emplace(id, *configuration);
    }
    return resolved;
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
    });
    std::optional<Dictionary> map = resolvedOverrides(base);
    ASSERT_TRUE(map);
    // Letters outside ASCII are lowered like the stored ID; non-string IDs are rendered as text.
    EXPECT_EQ(*map, (Dictionary{{"abc", first},
                                {"mixed-\xC3\xA9t\xC3\xA9", first},
                                {"shared", second},
                                {"42", second},
                                {"true", second}}));
    EXPECT_TRUE(sink.messages().empty());
}

TEST_F(OverlayConfigurationTest, MalformedGroupsAreSkipped) {
    Dictionary good{{"Name", "Good"}};
    Value base = baseWith({
        {"1", "not a group"},
        {"2", Dictionary{{"OverrideConfiguration", good}}},
        {"3", Dictionary{{"SupportedBehaviorIDs", "abc"}, {"OverrideConfiguration", good}}},
        {"4", Dictionary{{"SupportedBehaviorIDs", Array{"abc"}}}},
        {"5", Dictionary{{"SupportedBehaviorIDs", Array{"abc"}}, {"OverrideConfiguration", 1}}},
        {"6", group({"ok"}, good)},
    });
    std::optional<Dictionary> map = resolvedOverrides(base);
    ASSERT_TRUE(map);
    EXPECT_EQ(*map, (Dictionary{{"ok", good}}));
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

}  // namespace
}  // namespace tavrix
