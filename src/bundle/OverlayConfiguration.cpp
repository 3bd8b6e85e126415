#include "bundle/OverlayConfiguration.h"

#include <cstddef>
#include <utility>

#include "plist/PropertyListBounds.h"
#include "util/Log.h"
#include "util/TextCase.h"

namespace tavrix {
namespace {

// Property lists read from files nest at most this deep; a deeper merge (only possible with
// values built in memory) takes the overlay's value whole instead of recursing further.
constexpr std::size_t kMaxMergeDepth = plist::kMaxPropertyListDepth;

// Carrier files list IDs as strings; any other value is rendered as text.
std::string behaviorIDText(const plist::Value& id) {
    const std::string* text = id.asString();
    return text != nullptr ? *text : id.description();
}

void addGroup(BehaviorOverrideMap& map, const plist::Value& group) {
    if (!group.isDictionary()) {
        logCFormat(LogPriority::Warning,
                   "Failed to get the config dictionary in Allowed Multimode SIMs section\n");
        return;
    }
    const plist::Value* ids = group.find(kSupportedBehaviorIDsKey);
    if (ids == nullptr || ids->asArray() == nullptr) {
        logCFormat("No Supported Behavior IDs found in the config dictionary\n");
        return;
    }
    const plist::Value* configuration = group.find(kOverrideConfigurationKey);
    if (configuration == nullptr || !configuration->isDictionary()) {
        logCFormat("No Override Configuration found in the config dictionary\n");
        return;
    }
    if (ids->asArray()->empty()) {
        return;
    }
    auto shared = std::make_shared<const plist::Dictionary>(*configuration->asDictionary());
    for (const plist::Value& id : *ids->asArray()) {
        // Lower-cased the way the stored behavior ID is, so that IDs outside ASCII match too.
        map.insert_or_assign(lowercaseText(behaviorIDText(id)), shared);
    }
}

plist::Dictionary mergeAtDepth(const plist::Dictionary& base, const plist::Dictionary& overlay,
                               std::size_t depth) {
    // Base entries the overlay replaces are never copied.
    plist::Dictionary result;
    for (const auto& [key, value] : base) {
        if (!overlay.contains(key)) {
            result.emplace_hint(result.end(), key, value);
        }
    }
    for (const auto& [key, overlayValue] : overlay) {
        auto existing = base.find(key);
        const plist::Dictionary* overlayDictionary = overlayValue.asDictionary();
        if (existing == base.end() || overlayDictionary == nullptr || depth >= kMaxMergeDepth) {
            result.insert_or_assign(key, overlayValue);
            continue;
        }
        // A base value that is no dictionary counts as an empty one, so the overlay's own
        // "_Exclude" still applies at this level.
        static const plist::Dictionary kEmpty;
        const plist::Dictionary* baseDictionary = existing->second.asDictionary();
        result.insert_or_assign(key,
                                mergeAtDepth(baseDictionary != nullptr ? *baseDictionary : kEmpty,
                                             *overlayDictionary, depth + 1));
    }
    auto exclude = overlay.find(kExcludeKey);
    // An "_Exclude" that is no array stays as an ordinary entry.
    if (exclude != overlay.end() && exclude->second.asArray() != nullptr) {
        for (const plist::Value& name : *exclude->second.asArray()) {
            if (const std::string* key = name.asString()) {
                result.erase(*key);
            }
        }
        result.erase(kExcludeKey);
    }
    return result;
}

}  // namespace

std::optional<BehaviorOverrideMap> copyBehaviorOverrides(const plist::Value& base) {
    const plist::Value* overrides = base.find(kBehaviorOverridesKey);
    if (overrides == nullptr || !overrides->isDictionary()) {
        logCFormat("There are no behavior overrides in the base bundle\n");
        return std::nullopt;
    }
    BehaviorOverrideMap map;
    for (const auto& [groupName, group] : *overrides->asDictionary()) {
        addGroup(map, group);
    }
    return map;
}

BehaviorOverlayConfiguration::BehaviorOverlayConfiguration(std::string_view behaviorID,
                                                           plist::Value baseDictionary)
    : baseDictionary_(std::move(baseDictionary)) {
    std::optional<BehaviorOverrideMap> map = copyBehaviorOverrides(baseDictionary_);
    if (!map) {
        logCFormat("There is no merged allowed Behavior overlay configuration\n");
        return;
    }
    overlayKey_ = std::string(behaviorID);
    auto match = map->find(behaviorID);
    if (match != map->end()) {
        overrideConfiguration_ = match->second;
    }
}

plist::Dictionary mergeDictionaries(const plist::Dictionary& base,
                                    const plist::Dictionary& overlay) {
    return mergeAtDepth(base, overlay, 0);
}

plist::Dictionary removeBehaviorOverrides(const plist::Dictionary& dictionary) {
    plist::Dictionary copy = dictionary;
    copy.erase(kBehaviorOverridesKey);
    return copy;
}

}  // namespace tavrix
