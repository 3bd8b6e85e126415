// Placeholder until the bundle manager lands.
#include "bundle/BundleManager.h"

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
