// The overlay section of a base carrier dictionary ("BehaviorOverrides"): which override
// configuration applies to a behavior ID, and the merge rule that lays an overlay dictionary onto
// a base dictionary, with "_Exclude" deleting keys. Values are copied, so no input ever changes.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "plist/Value.h"

namespace tavrix {

inline constexpr const char* kBehaviorOverridesKey = "BehaviorOverrides";
inline constexpr const char* kSupportedBehaviorIDsKey = "SupportedBehaviorIDs";
inline constexpr const char* kOverrideConfigurationKey = "OverrideConfiguration";
inline constexpr const char* kExcludeKey = "_Exclude";

// One group's "OverrideConfiguration", shared by every behavior ID the group lists: a carrier
// file may list thousands of IDs for one large configuration.
using SharedOverrideConfiguration = std::shared_ptr<const plist::Dictionary>;
using BehaviorOverrideMap = std::map<std::string, SharedOverrideConfiguration, std::less<>>;

// Every listed behavior ID (lower-cased like the stored ID) mapped to its group's
// "OverrideConfiguration"; a later group wins for an ID listed twice. Nothing when base has no
// "BehaviorOverrides" dictionary. Malformed groups are logged and skipped.
std::optional<BehaviorOverrideMap> copyBehaviorOverrides(const plist::Value& base);

// The override configuration of one behavior ID in one base carrier dictionary.
class BehaviorOverlayConfiguration {
  public:
    BehaviorOverlayConfiguration(std::string_view behaviorID, plist::Value baseDictionary);

    const plist::Value& baseDictionary() const { return baseDictionary_; }
    // The configuration listed for the behavior ID (letter case counts), or null.
    const plist::Dictionary* overrideConfiguration() const { return overrideConfiguration_.get(); }
    // The behavior ID when the base has an overlay section, else empty.
    const std::string& overlayKey() const { return overlayKey_; }

  private:
    plist::Value baseDictionary_;
    SharedOverrideConfiguration overrideConfiguration_;
    std::string overlayKey_;
};

// base with overlay laid onto it: overlay values replace base values, except that a dictionary
// onto a dictionary merges recursively; then the keys an "_Exclude" array names are removed
// together with "_Exclude" itself.
plist::Dictionary mergeDictionaries(const plist::Dictionary& base,
                                    const plist::Dictionary& overlay);

// A copy of dictionary without its "BehaviorOverrides" entry.
plist::Dictionary removeBehaviorOverrides(const plist::Dictionary& dictionary);

}  // namespace tavrix
