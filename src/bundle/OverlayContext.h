// What one overlay determination works on: the overlay type it makes, the base carrier
// dictionary, the bundle record it updates, the overlay key and the overridden file-name prefix.
#pragma once

#include <optional>
#include <string>

#include "bundle/CarrierBundle.h"
#include "plist/Value.h"

namespace tavrix {

struct OverlayContext {
    OverlayType overlayType = kNoOverlay;
    std::optional<plist::Value> carrierDictionary;
    CarrierBundle bundle;
    std::string overlayKey;
    std::string overriddenFilePrefix;
};

// Empties the context, sets its overlay type, and points its bundle at the base bundle chosen by
// BundleManager::findBundle with carrierFilePath = bundlePath + "/behavior.plist" (logged). When
// no bundle is found the context's bundle stays empty.
void findBaseBundle(OverlayContext& context, OverlayType overlayType);

}  // namespace tavrix
