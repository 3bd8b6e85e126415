#include "bundle/BundleManager.h"

#include <cstdio>
#include <optional>

#include "bundle/BundleComparison.h"
#include "bundle/BundleInfo.h"
#include "bundle/BundleLinks.h"
#include "bundle/BundleLocations.h"
#include "bundle/InterruptedChanges.h"
#include "bundle/OverlayContext.h"
#include "bundle/OverriddenCarrierFile.h"
#include "bundle/OverrideGeneration.h"
#include "bundle/VersionCompare.h"
#include "bus/NotificationCenter.h"
#include "device/HomeDirectories.h"
#include "device/MobileUser.h"
#include "device/PreferencesStore.h"
#include "io/Paths.h"
#include "util/Log.h"
#include "util/SharedInstance.h"
#include "util/SystemLog.h"

namespace tavrix {
namespace {

constexpr const char* kBundleLinkFormat = "%s/Library/Tavrix.bundle";
constexpr const char* kPreferencesLinkFormat = "%s/Library/Preferences/com.zandor.tavrix.plist";
constexpr const char* kBehaviorPreferencesDomain = "com.zandor.tavrix";
constexpr const char* kBundleChangedNotification = "kTVXBehaviorBundleChangedNotification";
constexpr std::size_t kPathBufferSize = 1024;

// The home directory formatted into format, cut at kPathBufferSize - 1 bytes; empty without a
// home, so that no link is ever made relative to the working directory.
std::string homeLinkPath(const char* home, const char* format) {
    if (home == nullptr) {
        return {};
    }
    char buffer[kPathBufferSize];
    std::snprintf(buffer, sizeof buffer, format, home);
    return buffer;
}

bool hasBaseCarrierFile(const std::string& bundle) {
    return io::kindOfPath(bundle + "/" + kBaseCarrierFileName) == io::PathKind::RegularFile;
}

// The path a chosen bundle location converts to; nothing when it does not fit a path buffer.
std::optional<std::string> fileSystemPathOf(const std::string& location) {
    if (location.size() >= kPathBufferSize) {
        return std::nullopt;
    }
    return location;
}

}  // namespace

BundleManager::BundleManager() {
    const char* home = device::MobileUser::homeDirectory();
    bundleLinkPath_ = homeLinkPath(home, kBundleLinkFormat);
    preferencesLinkPath_ = homeLinkPath(home, kPreferencesLinkFormat);

    removeLeftoversOfInterruptedChanges(bundleLinkPath_, preferencesLinkPath_);

    // The link itself, not its target: a dangling link still describes the last linked state.
    // Only links the daemon made describe it; another user's are replaced at the next reset.
    if (!isDaemonLink(bundleLinkPath_)) {
        return;
    }
    currentBundle_.initFromLinks(bundleLinkPath_, preferencesLinkPath_);
    currentBundle_.carrierFilePath =
        isDaemonLink(preferencesLinkPath_) ? readLinkTarget(preferencesLinkPath_) : std::string();
    currentBundle_.overlayType |=
        overlayTypeOfCarrierFileName(baseNameOfPath(currentBundle_.carrierFilePath));
    logCFormat("Is carrier bundle's plist file overridden: %s\n",
               overlayTypeName(currentBundle_.overlayType));
    logCFormat("Carrier bundle state on BundleManager initialization\n");
    if (linksDisagree(currentBundle_, overriddenFilesDirectory())) {
        // A crash between the two link changes (or a link lost since) leaves a pair that the
        // comparison, which looks at file names only, could take for the intended one.
        logCFormat(
            "The bundle link (%s) and the carrier file link (%s) disagree, linking again "
            "at the next reset\n",
            currentBundle_.bundlePath.c_str(), currentBundle_.carrierFilePath.c_str());
        linksDisagree_ = true;
    }
}

BundleManager& BundleManager::sharedInstance() {
    initializeBundleLocations();
    return SharedInstance<BundleManager>::current().instance(
        [] { return std::unique_ptr<BundleManager>(new BundleManager()); });
}

bool BundleManager::findBundle(CarrierBundle& out) const {
    const std::string& systemLocation = systemBundleLocation();
    const std::string& userLocation = userBundleLocation();

    std::optional<plist::Value> systemVersion;
    if (systemLocation.empty()) {
        logCFormat(LogPriority::Warning, "Failed to create QZ URL for system bundle directory\n");
    } else {
        systemVersion = copyBundleVersionAtURL(systemLocation);
    }

    const std::string* chosen = nullptr;
    if (userLocation.empty()) {
        logCFormat(LogPriority::Warning, "Failed to create QZ URL for user bundle directory\n");
        if (systemVersion) {
            chosen = &systemLocation;
        }
    } else {
        // Only a bundle the daemon installed counts: one in directories nobody else can change.
        std::optional<plist::Value> userVersion;
        if (device::openMobileHomeDirectory(userLocation, false)) {
            userVersion = copyBundleVersionAtURL(userLocation);
        }
        const bool systemHasBase = systemVersion && hasBaseCarrierFile(systemLocation);
        const bool userHasBase = userVersion && hasBaseCarrierFile(userLocation);
        if (systemVersion && userVersion && systemHasBase != userHasBase) {
            // A bundle without its base carrier file could only be linked to a missing file.
            chosen = systemHasBase ? &systemLocation : &userLocation;
            logCFormat("Bundle %s has no base carrier file, not choosing it\n",
                       (systemHasBase ? userLocation : systemLocation).c_str());
        } else if (systemVersion && userVersion) {
            // The user bundle wins unless the system one is strictly newer.
            bool systemNewer = compareVersionStrings(bundleInfoValueText(systemVersion),
                                                     bundleInfoValueText(userVersion)) == 1;
            chosen = systemNewer ? &systemLocation : &userLocation;
        } else if (systemVersion) {
            chosen = &systemLocation;
        } else if (userVersion) {
            chosen = &userLocation;
        }
    }

    if (chosen == nullptr) {
        logCFormat(LogPriority::Warning, "Could not find either of the bundle locations\n");
        return false;
    }
    std::optional<std::string> path = fileSystemPathOf(*chosen);
    if (!path) {
        return false;
    }
    logCFormat("Found bundle %s\n", path->c_str());
    out.resetWithPath(*path);
    return true;
}

CarrierBundle BundleManager::currentBundle() const {
    std::lock_guard lock(operationLock_);
    return currentBundle_;
}

std::optional<std::string> BundleManager::copyBundleVersion() const {
    // The update check asks from its own thread while a reset may be replacing the record.
    std::lock_guard lock(operationLock_);
    if (currentBundle_.bundleVersion.empty()) {
        return std::nullopt;
    }
    return currentBundle_.bundleVersion;
}

BundleChangeType BundleManager::resetBehaviorBundle(const std::optional<std::string>& behaviorID) {
    std::lock_guard lock(operationLock_);
    behaviorID_ = behaviorID;
    return runBundleResetLocked();
}

BundleChangeType BundleManager::runBundleReset() {
    std::lock_guard lock(operationLock_);
    return runBundleResetLocked();
}

BundleChangeType BundleManager::runBundleResetLocked() {
    BundleChangeType result = kBundleChangeTypeNoChange;
    if (!behaviorID_) {
        logCFormat("There is no tavrix ID provided\n");
        logCFormat("Carrier Bundle Match Result: %s\n", changeTypeName(result));
        return result;
    }
    const ScopedLogField idField("TAVRIX_BEHAVIOR_ID", *behaviorID_);
    logCFormat("\n");
    logCFormat(
        "=========================== Potentially Resetting Behavior Bundle "
        "===========================\n");
    logCFormat("\n");
    logCFormat("Behavior ID provided: %s", behaviorID_->c_str());

    CarrierBundle matched;
    OverrideResult deviceResult = makeDeviceOverlayDecision(matched, behaviorID_);
    logCFormat("Device overlay decision: %s\n", overrideResultName(deviceResult));
    logCFormat("Is the matching bundle found: %s\n", matched.bundleName().empty() ? "No" : "Yes");

    OverrideResult behaviorResult = applyMultimodeOverlay(matched, behaviorID_);
    logCFormat("Device overlay decision: %s\n", overrideResultName(behaviorResult));
    logCFormat("Dump state for the bundle after multimode overlay\n");
    std::optional<ScopedLogField> versionField;
    if (!matched.bundleVersion.empty()) {
        versionField.emplace("TAVRIX_BUNDLE_VERSION", matched.bundleVersion);
    }

    result = compareBundles(currentBundle_, matched);
    if (linksDisagree_ && result == kBundleChangeTypeNoChange) {
        // The comparison looks at file names only; the pair on disk is not the one it names.
        result = kBundleChangeTypeUpdate;
    }
    if (result != kBundleChangeTypeNoChange) {
        logCFormat("Bundle Compare decision %s\n", changeTypeName(result));
        currentBundle_ = matched;
        linksDisagree_ = false;
        if (!establishBundleLinks(currentBundle_, bundleLinkPath_, preferencesLinkPath_)) {
            // The links on disk may now be half replaced: whatever the record says, link again.
            linksDisagree_ = true;
            logCFormat(LogPriority::Warning, "Could not link bundle file!\n");
            return kBundleChangeTypeNoChange;
        }
        // Nothing is pending here: this drops the cached reading, so that the settings are read
        // again through the new link.
        (void)device::PreferencesStore::shared().synchronize(kBehaviorPreferencesDomain,
                                                             device::MobileUser::name());
        bus::postNotification(kBundleChangedNotification);
        pruneOverriddenFilesOfRemovedBundles(currentBundle_.carrierFilePath);
    }
    logCFormat("Carrier Bundle Match Result: %s\n", changeTypeName(result));
    return result;
}

void findBaseBundle(OverlayContext& context, OverlayType overlayType) {
    context = OverlayContext{};
    context.overlayType = overlayType;
    if (!BundleManager::sharedInstance().findBundle(context.bundle)) {
        logCFormat(LogPriority::Warning, "Failed to find a bundle\n");
        return;
    }
    logCFormat("Found the base bundle successfully with name %s\n",
               context.bundle.bundleName().c_str());
    context.bundle.carrierFilePath = context.bundle.bundlePath + "/" + kBaseCarrierFileName;
}

}  // namespace tavrix
