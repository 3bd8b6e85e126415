#include "bundle/BundleManager.h"

namespace tavrix {

BundleManager& BundleManager::sharedInstance() {
    static BundleManager* manager = new BundleManager();
    return *manager;
}

// The payload unpacker and the reset flow are not part of the daemon yet; these entry points keep
// the façade's order of calls in place until they are.
void BundleManager::installBehaviorBundleData(const plist::Data&) {}

BundleChangeType BundleManager::resetBehaviorBundle(const std::string&) {
    return kBundleChangeTypeUnknown;
}

}  // namespace tavrix
