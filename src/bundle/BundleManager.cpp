// Placeholder until the bundle manager lands.
#include "bundle/BundleManager.h"
#include "bundle/OverlayContext.h"

namespace tavrix {

BundleManager::BundleManager() = default;

BundleManager& BundleManager::sharedInstance() {
    static BundleManager* manager = new BundleManager();
    return *manager;
}

BundleChangeType BundleManager::resetBehaviorBundle(const std::optional<std::string>&) {
    return kBundleChangeTypeUnknown;
}

}  // namespace tavrix

namespace tavrix {
void findBaseBundle(OverlayContext& context, OverlayType overlayType) {
    context = OverlayContext{};
    context.overlayType = overlayType;
}
}  // namespace tavrix
