// The two overlay determinations of the reset flow: the device overlay (an "overrides_" file of
// the base bundle naming this device's hardware model) and the behavior overlay (the
// "BehaviorOverrides" section of the base carrier file, matched against the behavior ID). Each
// writes the overridden carrier file once under the user bundles' "Overlay/" directory and points
// the bundle record at it.
#pragma once

#include <optional>
#include <string>

#include "bundle/CarrierBundle.h"

namespace tavrix {

// Finds the base bundle and applies its device overlay when it has one for this hardware model.
// bundle is replaced by the base bundle (and its overridden carrier file, when one applies). The
// behavior ID is not used.
OverrideResult makeDeviceOverlayDecision(CarrierBundle& bundle,
                                         const std::optional<std::string>& behaviorID);

// Applies the behavior overlay for behaviorID on top of bundle's carrier file, updating
// carrierFilePath and overlayType when it does.
OverrideResult applyMultimodeOverlay(CarrierBundle& bundle,
                                     const std::optional<std::string>& behaviorID);

}  // namespace tavrix
