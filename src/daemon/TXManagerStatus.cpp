#include "daemon/TXManagerStatus.h"

#include "bundle/BundleInfo.h"
#include "bundle/BundleLocations.h"
#include "bundle/BundleManager.h"
#include "daemon/TXManager.h"
#include "daemon/UpdateCheckScheduler.h"
#include "device/BehaviorPreferences.h"
#include "update/ActivityRecord.h"

namespace tavrix {
namespace {

void setText(plist::Dictionary& status, const char* key, const std::string& text) {
    if (!text.empty()) {
        status.insert_or_assign(key, plist::Value(text));
    }
}

plist::Dictionary describeLinkedBundle(const CarrierBundle& bundle) {
    plist::Dictionary linked;
    setText(linked, "Path", bundle.bundlePath);
    setText(linked, "Identifier", bundle.copyBundleIdentifier());
    setText(linked, "Version", bundle.bundleVersion);
    setText(linked, "OverlayType", overlayTypeName(bundle.overlayType));
    setText(linked, "CarrierFile", bundle.carrierFilePath);
    return linked;
}

}  // namespace

plist::Dictionary copyDaemonStatus(bool holdsInstanceLock) {
    plist::Dictionary status = copyActivityRecord();
    status.insert_or_assign(kStatusDaemonVersionKey, plist::Value(TAVRIX_VERSION));

    auto behaviorID = copyBehaviorPreference(kTavrixIDKey);
    if (behaviorID && behaviorID->isString()) {
        status.insert_or_assign(kStatusBehaviorIDKey, *behaviorID);
    }
    // Holding the lock, the first look does the start-up work, as any first call does.
    const BundleSupport support = holdsInstanceLock ? TXManager::sharedInstance().bundleSupport()
                                                    : TXManager::bundleSupport();
    status.insert_or_assign(kStatusSupportedKey, plist::Value(support == BundleSupport::Supported));
    setText(status, kStatusWhyNotSupportedKey, bundleSupportReason(support));

    setText(status, kStatusSystemBundleVersionKey,
            bundleInfoValueText(copyBundleVersionAtPath(systemBundleLocation())));
    setText(status, kStatusUserBundleVersionKey,
            bundleInfoValueText(copyBundleVersionAtPath(userBundleLocation())));

    if (!holdsInstanceLock) {
        status.insert_or_assign(kStatusWaitingForPreviousDaemonKey, plist::Value(true));
        return status;
    }
    const CarrierBundle linked = BundleManager::sharedInstance().currentBundle();
    if (!linked.bundlePath.empty()) {
        status.insert_or_assign(kStatusLinkedBundleKey, plist::Value(describeLinkedBundle(linked)));
    }
    if (auto next = UpdateCheckScheduler::sharedInstance().nextCheckTime()) {
        status.insert_or_assign(kStatusNextUpdateCheckKey, plist::Value(plist::Date{*next}));
    }
    return status;
}

}  // namespace tavrix
