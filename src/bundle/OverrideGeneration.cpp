// Placeholder until overlay generation lands: the base bundle, no overlay.
#include "bundle/OverrideGeneration.h"

#include "bundle/OverlayContext.h"

namespace tavrix {

OverrideResult makeDeviceOverlayDecision(CarrierBundle& bundle,
                                         const std::optional<std::string>&) {
    OverlayContext context;
    findBaseBundle(context, kDeviceOverlay);
    bundle = context.bundle;
    return kOverrideNotRequired;
}

OverrideResult applyMultimodeOverlay(CarrierBundle&, const std::optional<std::string>&) {
    return kOverrideNotRequired;
}

}  // namespace tavrix
