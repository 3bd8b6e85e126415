// Feeds arbitrary property lists to the overlay configuration: the override map, the lookup for a
// few behavior IDs, and merges both ways. A top-level array of two dictionaries is merged as base
// and overlay; any other input is merged with its own override configurations.
#include <cstddef>
#include <cstdint>
#include <string_view>
#include <vector>

#include "FuzzSupport.h"
#include "bundle/OverlayConfiguration.h"
#include "plist/PropertyListFormat.h"

namespace {

using tavrix::fuzz::require;
using tavrix::plist::Dictionary;
using tavrix::plist::Value;

// Equality in which a real that is not a number equals itself (by its description), so that
// copies compare equal.
bool identical(const Value& a, const Value& b) {
    return a == b || a.description() == b.description();
}

// The merge rules that hold whatever the input: overlay entries win unless excluded, an
// "_Exclude" array removes its names and itself, and neither input changes.
void mergeAndCheck(const Dictionary& base, const Dictionary& overlay) {
    const Dictionary baseBefore = base;
    const Dictionary overlayBefore = overlay;
    Dictionary merged = tavrix::mergeDictionaries(base, overlay);
    require(identical(Value(base), Value(baseBefore)) &&
            identical(Value(overlay), Value(overlayBefore)));

    std::vector<std::string_view> excluded;
    auto entry = overlay.find(tavrix::kExcludeKey);
    const Value* exclude = entry != overlay.end() ? &entry->second : nullptr;
    if (exclude != nullptr && exclude->asArray() != nullptr) {
        require(!merged.contains(tavrix::kExcludeKey));
        for (const Value& name : *exclude->asArray()) {
            if (const std::string* key = name.asString()) {
                require(!merged.contains(*key));
                excluded.push_back(*key);
            }
        }
    }
    for (const auto& [key, value] : overlay) {
        bool isExcluded = key == tavrix::kExcludeKey && exclude->asArray() != nullptr;
        for (std::string_view name : excluded) {
            isExcluded = isExcluded || name == key;
        }
        if (isExcluded) {
            continue;
        }
        require(merged.contains(key));
        if (!value.isDictionary() || !base.contains(key)) {
            require(identical(merged.at(key), value));
        }
    }
    for (const auto& [key, value] : base) {
        if (!overlay.contains(key) && merged.contains(key)) {
            require(identical(merged.at(key), value));
        }
    }
    require(!tavrix::removeBehaviorOverrides(merged).contains(tavrix::kBehaviorOverridesKey));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    tavrix::fuzz::silenceTheLog();
    auto value = tavrix::plist::parse(std::string_view(reinterpret_cast<const char*>(data), size));
    if (!value) {
        return 0;
    }
    const auto* pair = value->asArray();
    if (pair != nullptr && pair->size() == 2 && (*pair)[0].isDictionary() &&
        (*pair)[1].isDictionary()) {
        mergeAndCheck(*(*pair)[0].asDictionary(), *(*pair)[1].asDictionary());
        mergeAndCheck(*(*pair)[1].asDictionary(), *(*pair)[0].asDictionary());
        return 0;
    }

    auto map = tavrix::copyBehaviorOverrides(*value);
    for (const char* id : {"abc", "", "ABC", "42"}) {
        tavrix::BehaviorOverlayConfiguration configuration(id, *value);
        require(configuration.overlayKey().empty() == (!map || *id == '\0'));
        require(!configuration.overrideConfiguration() || map->contains(id));
    }
    if (!value->isDictionary()) {
        return 0;
    }
    const Dictionary& base = *value->asDictionary();
    mergeAndCheck(base, Dictionary{});
    require(identical(Value(tavrix::mergeDictionaries(base, Dictionary{})), Value(base)));
    if (map) {
        // Many IDs may share one configuration; a few are enough.
        std::size_t merges = 0;
        for (const auto& [id, configuration] : *map) {
            if (++merges > 4) {
                break;
            }
            mergeAndCheck(base, *configuration);
            mergeAndCheck(*configuration, base);
        }
    }
    return 0;
}
