// Placeholder until the payload unpacker lands.
#include "payload/PayloadUnpack.h"

#include "bundle/BundleManager.h"

namespace tavrix {
void BundleManager::installBehaviorBundleData(const plist::Data&) {}
}  // namespace tavrix
