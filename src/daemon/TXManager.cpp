#include "daemon/TXManager.h"

#include "bundle/BundleManager.h"
#include "daemon/UpdateCheckScheduler.h"
#include "device/BehaviorPreferences.h"
#include "device/MobileUser.h"
#include "device/PreferencesStore.h"
#include "device/TXUtility.h"
#include "update/ActivityRecord.h"
#include "update/AssetHandler.h"
#include "util/Log.h"
#include "util/SharedInstance.h"
#include "util/TextCase.h"

namespace tavrix {
namespace {

constexpr const char* kBehaviorSettingsDomain = "com.zandor.tavrix";

}  // namespace

TXManager& TXManager::sharedInstance() {
    return SharedInstance<TXManager>::current().instance([] {
        std::unique_ptr<TXManager> created(new TXManager());
        // An install cut short by a crash first, so that the match below sees the bundle it was
        // installing.
        AssetHandler::resumeInterruptedInstall();
        // Re-applies a behavior set before this launch of the daemon.
        auto stored = copyBehaviorPreference(kTavrixIDKey);
        if (stored && stored->isString()) {
            logCFormat("Behavior ID %s is already sent, redoing bundle match\n",
                       stored->asString()->c_str());
            BundleManager::sharedInstance().resetBehaviorBundle(*stored->asString());
        }
        return created;
    });
}

bool TXManager::exists() {
    return SharedInstance<TXManager>::current().ifMade() != nullptr;
}

bool TXManager::setTavrixID(const std::string& tavrixID, const std::optional<plist::Data>& bundle,
                            PayloadOutcome* payload) {
    // Every refusal tells a caller that asked why the bundle was not extracted.
    auto refuse = [payload](std::string reason) {
        if (payload != nullptr) {
            *payload = {false, "not accepted: " + std::move(reason)};
        }
        return false;
    };
    if (TXUtility::hasCellularRadio()) {
        logObjectFormat("Device has cellular radio, not accepting tavrix ID");
        return refuse("the device has a cellular radio");
    }
    if (tavrixID.size() > kMaxBehaviorIDBytes) {
        logCFormat("Behavior ID of %zu bytes is longer than the %zu allowed, not accepting it\n",
                   tavrixID.size(), kMaxBehaviorIDBytes);
        return refuse("the behavior ID is longer than " + std::to_string(kMaxBehaviorIDBytes) +
                      " bytes");
    }
    std::string lowered = lowercaseText(tavrixID);
    // An ID that is not on disk would be lost at the next launch: the client is told, and
    // nothing is installed for it.
    if (!setBehaviorPreference(kTavrixIDKey, plist::Value(lowered))) {
        logCFormat(LogPriority::Warning, "Could not store the behavior ID, not accepting it\n");
        return refuse("the behavior ID could not be stored");
    }
    if (!bundle) {
        // Before the bundle manager is first taken: its start-up lines follow this one.
        logObjectFormat("No bundle data given");
    }
    // An update installed between the two steps is matched by one of the two resets: each
    // matches what is on disk then, for the ID stored above.
    BundleManager& bundles = BundleManager::sharedInstance();
    if (bundle) {
        const Result<> installed = bundles.installBehaviorBundleData(*bundle);
        const bool extracted = installed.ok();
        std::string reason = extracted ? "extracted " + std::to_string(bundle->size()) +
                                             " bytes into the user bundle"
                                       : installed.reason();
        recordPayload(extracted, reason);
        if (payload != nullptr) {
            *payload = {extracted, std::move(reason)};
        }
    }
    bundles.resetBehaviorBundle(lowered);
    UpdateCheckScheduler::sharedInstance().startTimer();
    return true;
}

const char* bundleSupportReason(BundleSupport support) {
    switch (support) {
        case BundleSupport::Supported:
            return "";
        case BundleSupport::CellularRadio:
            return "the device has a cellular radio";
        case BundleSupport::NotEnabled:
            return "bundle support is not enabled (no EnableSupport preference)";
        case BundleSupport::Disabled:
            return "bundle support is set to false (EnableSupport)";
        case BundleSupport::NoBehaviorID:
            return "no behavior ID has been set";
    }
    return "";
}

BundleSupport TXManager::bundleSupport() {
    if (TXUtility::hasCellularRadio()) {
        return BundleSupport::CellularRadio;
    }
    auto enableSupport = copyBehaviorPreference(kEnableSupportKey);
    if (!enableSupport) {
        return BundleSupport::NotEnabled;
    }
    // Only the false boolean disables; any other value counts as enabled.
    const bool* flag = enableSupport->asBoolean();
    if (flag != nullptr && !*flag) {
        return BundleSupport::Disabled;
    }
    return copyBehaviorPreference(kTavrixIDKey).has_value() ? BundleSupport::Supported
                                                            : BundleSupport::NoBehaviorID;
}

bool TXManager::isTavrixBundleSupported() {
    switch (bundleSupport()) {
        case BundleSupport::CellularRadio:
            logObjectFormat(
                "Is behavior bundle supported: Device has cellular radio, no tavrix bundle");
            return false;
        case BundleSupport::NotEnabled:
            logObjectFormat("Behavior bundle support is not present");
            return false;
        case BundleSupport::Disabled:
            logObjectFormat("Behavior bundle support has been set to false");
            return false;
        case BundleSupport::NoBehaviorID:
            return false;
        case BundleSupport::Supported:
            break;
    }
    return true;
}

std::optional<plist::Value> TXManager::copyTavrixValue(const std::string& key) {
    if (!isTavrixBundleSupported()) {
        logObjectFormat("Copy behavior setting: Device has cellular radio, no tavrix bundle");
        return std::nullopt;
    }
    return device::PreferencesStore::shared().copyValue(key, kBehaviorSettingsDomain,
                                                        device::MobileUser::name());
}

bool TXManager::checkForTavrixBundleUpdate() {
    if (!isTavrixBundleSupported()) {
        logObjectFormat("No behavior ID, not checking for OTA update");
        recordUpdateCheck(kCheckNotSupported,
                          std::string("not checked: ") + bundleSupportReason(bundleSupport()));
        return false;
    }
    return AssetHandler::downloadUpdateIfAvailable([](double nextCheckSeconds) {
        UpdateCheckScheduler::sharedInstance().rescheduleAndEndCheck(nextCheckSeconds);
    });
}

}  // namespace tavrix
