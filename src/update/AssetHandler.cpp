#include "update/AssetHandler.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>

#include "bundle/BundleLocations.h"
#include "bundle/BundleManager.h"
#include "bundle/VersionCompare.h"
#include "device/BehaviorPreferences.h"
#include "device/MobileUser.h"
#include "device/TXUtility.h"
#include "payload/PayloadUnpack.h"
#include "update/ActivityRecord.h"
#include "update/PendingInstall.h"
#include "util/FileSystemHelper.h"
#include "util/FileSystemUtilities.h"
#include "util/Log.h"
#include "util/SharedInstance.h"
#include "util/SystemLog.h"

namespace tavrix {
namespace {

// Attribute values are compared as text; the catalog lists versions as strings.
std::string versionText(const plist::Value& value) {
    const std::string* text = value.asString();
    return text != nullptr ? *text : value.description();
}

std::optional<plist::Value> optionalText(const std::optional<std::string>& text) {
    return text ? std::optional<plist::Value>(*text) : std::nullopt;
}

bool listsProductType(const plist::Value& supported, const std::optional<std::string>& product) {
    const plist::Array* types = supported.asArray();
    if (types == nullptr || !product) {
        return false;
    }
    return std::any_of(types->begin(), types->end(), [&](const plist::Value& type) {
        return type.asString() != nullptr && *type.asString() == *product;
    });
}

// Whether the asset fits this device: its OS version within the bounds (inclusive) and its
// product type listed, when the asset says so. Logs why not, unless quiet.
bool fitsThisDevice(const plist::Dictionary& attributes, const plist::Value* productVersion,
                    const std::optional<std::string>& productType, bool quiet = false) {
    // An unknown OS version compares as the empty text (any minimum is above it) and is logged
    // as no value.
    const std::string current = productVersion != nullptr ? versionText(*productVersion) : "";
    if (auto minimum = attributes.find(kAssetAttributeMinimumOSVersion);
        minimum != attributes.end() &&
        compareVersionStrings(versionText(minimum->second), current) == 1) {
        if (!quiet) {
            logObjectFormat("Current product version %@ is lower than min %@", productVersion,
                            &minimum->second);
        }
        return false;
    }
    if (auto maximum = attributes.find(kAssetAttributeMaximumOSVersion);
        maximum != attributes.end() &&
        compareVersionStrings(versionText(maximum->second), current) == -1) {
        if (!quiet) {
            logObjectFormat("Current product version %@ is higher than max %@", productVersion,
                            &maximum->second);
        }
        return false;
    }
    auto supported = attributes.find(kAssetAttributeSupportedProductTypes);
    if (quiet) {
        return supported == attributes.end() || listsProductType(supported->second, productType);
    }
    if (supported == attributes.end()) {
        logCFormat(
            "Supported device classes attribute is not present, assuming all are supported\n");
    } else if (!listsProductType(supported->second, productType)) {
        logCFormat("Supported device classes are mentioned, but this product is not supported\n");
        return false;
    } else {
        logCFormat("This product is present is the supported devices\n");
    }
    return true;
}

std::string assetVersionText(const catalog::Asset& asset) {
    auto version = asset.attributes().find(kAssetAttributeVersion);
    return version != asset.attributes().end() ? versionText(version->second) : "(unknown)";
}

// The highest version above the installed one that fits this device and that the rollout kept
// from it, or null.
const catalog::HeldBackAsset* newestHeldBack(const catalog::QueryResult& query,
                                             const std::optional<std::string>& installed) {
    const catalog::HeldBackAsset* newest = nullptr;
    std::string newestVersion = installed.value_or("0.0");
    const std::optional<plist::Value> productVersion =
        optionalText(TXUtility::currentProductVersion());
    for (const catalog::HeldBackAsset& held : query.heldBack) {
        auto version = held.attributes.find(kAssetAttributeVersion);
        if (version != held.attributes.end() &&
            compareVersionStrings(versionText(version->second), newestVersion) == 1 &&
            fitsThisDevice(held.attributes, productVersion ? &*productVersion : nullptr,
                           TXUtility::currentProductType(), true)) {
            newest = &held;
            newestVersion = versionText(version->second);
        }
    }
    return newest;
}

// Why a check found nothing to download, in the words the status view shows.
void recordQueryWithoutCandidate(const catalog::QueryResult& query) {
    switch (query.outcome) {
        case catalog::QueryOutcome::NoCatalogConfigured:
            recordUpdateCheck(kCheckNoCatalog, "no catalog configured");
            return;
        case catalog::QueryOutcome::FetchFailed:
            recordUpdateCheck(kCheckFetchFailed, "catalog fetch failed: " + query.reason);
            return;
        case catalog::QueryOutcome::Refused:
            recordUpdateCheck(kCheckCatalogRefused, "catalog refused: " + query.reason);
            return;
        case catalog::QueryOutcome::Answered:
        case catalog::QueryOutcome::NotRun:
            break;
    }
    std::optional<std::string> installed = BundleManager::sharedInstance().copyBundleVersion();
    if (const catalog::HeldBackAsset* held = newestHeldBack(query, installed)) {
        recordUpdateCheck(kCheckHeldBack,
                          "held back by a staged rollout (" + std::to_string(held->rolloutPercent) +
                              " %): version " +
                              versionText(held->attributes.at(kAssetAttributeVersion)) +
                              " is not offered to this device yet");
        return;
    }
    recordUpdateCheck(kCheckUpToDate, installed
                                          ? "up to date (version " + *installed + " installed)"
                                          : "up to date (no newer bundle for this device)");
}

}  // namespace

std::optional<std::vector<AssetHandler::AssetPtr>> AssetHandler::downloadAvailableAssets(
    catalog::QueryResult* result) {
    catalog::AssetQuery query(kAssetTypeTavrixBundles);
    query.setQueriesLocalInformationOnly(false);
    logCFormat("Issuing query\n");
    catalog::QueryResult answer = query.runQuery();
    logCFormat("Query returned back with %d items\n",
               answer.assets ? static_cast<int>(answer.assets->size()) : 0);
    std::optional<std::vector<AssetPtr>> assets = answer.assets;
    if (result != nullptr) {
        *result = std::move(answer);
    }
    return assets;
}

AssetHandler::AssetPtr AssetHandler::findTheBestAsset(catalog::QueryResult* result) {
    std::optional<std::string> installed = BundleManager::sharedInstance().copyBundleVersion();
    if (!installed) {
        logObjectFormat("No bundle version available, initializing with 0.0");
    }
    plist::Value bestVersion(installed.value_or("0.0"));
    const std::optional<plist::Value> productVersion =
        optionalText(TXUtility::currentProductVersion());
    const auto productType = optionalText(TXUtility::currentProductType());
    logObjectFormat("Current version: %@\n", &bestVersion);
    logObjectFormat("Current Product version: %@\n", productVersion ? &*productVersion : nullptr);
    logObjectFormat("Product Type: %@\n", productType ? &*productType : nullptr);

    AssetPtr best;
    auto assets = downloadAvailableAssets(result);
    if (!assets) {
        return best;
    }
    for (std::size_t index = 0; index < assets->size(); ++index) {
        const AssetPtr& asset = (*assets)[index];
        const plist::Dictionary& attributes = asset->attributes();
        logCFormat("Index: %d\n", static_cast<int>(index));
        for (const auto& [key, value] : attributes) {
            const plist::Value keyValue(key);
            logObjectFormat("key: %@, value: %@", &keyValue, &value);
        }
        auto version = attributes.find(kAssetAttributeVersion);
        if (version == attributes.end()) {
            logObjectFormat("No asset version available");
            continue;
        }
        if (!fitsThisDevice(attributes, productVersion ? &*productVersion : nullptr,
                            TXUtility::currentProductType())) {
            continue;
        }
        if (compareVersionStrings(versionText(version->second), versionText(bestVersion)) == 1) {
            logObjectFormat("A higher version is available, downloading it");
            best = asset;
            bestVersion = version->second;
        } else {
            logObjectFormat("No higher update available");
        }
    }
    return best;
}

bool AssetHandler::downloadUpdateIfAvailable(EndCheck endCheck) {
    // Two checks would download into and purge the same cache directory, and install over each
    // other. Held until the check's download has been installed and purged.
    std::atomic<bool>& checkRunning = SharedInstance<CheckState>::current()
                                          .instance([] { return std::make_unique<CheckState>(); })
                                          .running;
    bool idle = false;
    if (!checkRunning.compare_exchange_strong(idle, true)) {
        logCFormat("An update check is already running, not starting another\n");
        return false;
    }
    auto running = std::make_shared<RunningCheck>(checkRunning);

    catalog::QueryResult query;
    AssetPtr asset = findTheBestAsset(&query);
    if (!asset) {
        logObjectFormat("Best candidate passed in is nil");
        recordQueryWithoutCandidate(query);
        return false;
    }
    for (const auto& [key, value] : asset->attributes()) {
        const plist::Value keyValue(key);
        logObjectFormat("Best Candidate: key: %@, value: %@", &keyValue, &value);
    }
    recordUpdateCheck(kCheckDownloading, "downloading version " + assetVersionText(*asset));
    asset->beginDownload();
    // The handler keeps the asset alive until the catalog drops it after the last report.
    asset->setProgressHandler([asset, running, endCheck](const plist::Dictionary& progress) {
        handleDownloadProgress(asset, progress, running, endCheck);
    });
    return true;
}

void AssetHandler::handleDownloadProgress(const AssetPtr& asset, const plist::Dictionary& progress,
                                          const std::shared_ptr<RunningCheck>& running,
                                          const EndCheck& endCheck) {
    auto operation = progress.find(catalog::kAssetProgressOperationKey);
    if (operation == progress.end()) {
        logObjectFormat("Operation is not available?");
        endCheck(kInstallRetryDelaySeconds);
        return;
    }
    logObjectFormat("Current operation: %@", &operation->second);
    const std::string* name = operation->second.asString();
    if (name == nullptr || *name != catalog::kAssetOperationCompleted) {
        // Every report but the last ends the check and re-arms it a day ahead; the last one
        // re-arms it again.
        if (name != nullptr && *name == catalog::kAssetOperationFailed) {
            auto error = progress.find(catalog::kAssetProgressErrorKey);
            const std::string* why = error != progress.end() ? error->second.asString() : nullptr;
            recordUpdateCheck(kCheckDownloadFailed,
                              "download failed: " + (why != nullptr ? *why : "no reason given"));
        }
        endCheck(kInstallRetryDelaySeconds);
        if (name != nullptr && *name == catalog::kAssetOperationFailed) {
            running->finish();
        }
        return;
    }
    std::optional<std::string> url = asset->localURL();
    if (!url) {
        logObjectFormat("Local URL is not available?");
        recordUpdateCheck(kCheckDownloadFailed, "download failed: the downloaded bundle is gone");
        endCheck(kInstallRetryDelaySeconds);
        running->finish();
        return;
    }
    std::optional<ScopedLogField> versionField;
    auto version = asset->attributes().find(kAssetAttributeVersion);
    if (version != asset->attributes().end()) {
        versionField.emplace("TAVRIX_BUNDLE_VERSION", versionText(version->second));
    }
    const plist::Value urlPath(*url);
    logObjectFormat("URL string: %@", &urlPath);
    const bool installed = installDownloadedBundle(*url);
    if (installed) {
        recordUpdateCheck(kCheckInstalled, "installed version " + assetVersionText(*asset));
    } else {
        recordUpdateCheck(kCheckInstallFailed,
                          "install failed: the bundle could not be copied into place (logged)");
    }
    // The check ends only once the download is gone, so that no other check downloads into the
    // directory being purged; the install is complete once its download is.
    asset->purge([running](bool) {
        removePendingInstall();
        logObjectFormat("Best candidate asset has been purged");
        running->finish();
    });
    // Fifteen days after any attempt, one that failed included: a failed install keeps the old
    // bundle, and a device out of room would otherwise fetch the bundle again every day.
    endCheck(kInstallDoneDelaySeconds);
}

bool AssetHandler::installDownloadedBundle(const std::string& source) {
    const std::string& destination = userBundleLocation();
    if (destination.empty()) {
        logCFormat("The mobile user's home directory is unknown, not installing the bundle\n");
        return false;
    }
    // The new bundle is copied while the old one still stands, so both must fit.
    const std::uint64_t needed = diskBytesOfTree(source);
    const char* home = device::MobileUser::homeDirectory();
    if (home == nullptr || !TXUtility::hasEnoughDiskSpaceAt(home, needed)) {
        logCFormat(LogPriority::Warning,
                   "Not enough free space to install %s (%llu bytes), keeping the bundle\n",
                   source.c_str(), static_cast<unsigned long long>(needed));
        return false;
    }
    if (!writePendingInstall({source, false})) {
        return false;
    }
    const bool copied = copyDownloadedBundle(source, destination);
    auto behaviorID = copyBehaviorPreference(kTavrixIDKey);
    if (!copied) {
        // The old bundle stands as it was.
    } else if (!behaviorID || !behaviorID->isString()) {
        logObjectFormat("Behavior ID is not set yet in the preferences, no action is being taken");
    } else {
        logCFormat("Behavior ID %s is already sent, redoing bundle match\n",
                   behaviorID->asString()->c_str());
        BundleManager::sharedInstance().resetBehaviorBundle(*behaviorID->asString());
    }
    // From here on a crash leaves only the purge to do: a purge cut short leaves part of the
    // download, which must never be installed. A record that cannot say so must not stay
    // saying "not installed".
    if (!writePendingInstall({source, true})) {
        removePendingInstall();
    }
    return copied;
}

bool AssetHandler::copyDownloadedBundle(const std::string& source, const std::string& destination) {
    // Copied beside the user bundle and put in its place only when whole: a copy that fails (a
    // disk that fills) leaves the old bundle as it was, and every file in the copy appears whole
    // or not at all.
    const Result<> copied =
        BundleManager::sharedInstance().replaceUserBundle([&](const std::string& staging) {
            FileSystemHelper files;
            logCFormat("Copying the directory %s to %s\n", source.c_str(), destination.c_str());
            std::vector<std::string> names;
            int error = files.createDirectory(staging, 0755, true);
            if (error == 0) {
                error = files.listDirectory(source, names, false);
            }
            if (error == 0) {
                logCFormat("There are %ld files in directory %s\n", static_cast<long>(names.size()),
                           source.c_str());
            }
            for (std::size_t index = 0; error == 0 && index < names.size(); ++index) {
                const std::string entry = source + "/" + names[index];
                logCFormat("Copying %s\n", entry.c_str());
                error = copyItemTree(entry, staging + "/" + names[index]);
            }
            if (error != 0) {
                return BundleFillOutcome{BundleFill::Refused, std::strerror(error)};
            }
            logCFormat("Removing the directory %s\n", destination.c_str());
            return BundleFillOutcome{};
        });
    if (!copied) {
        logCFormat(LogPriority::Warning, "Failed to install %s into %s: %s\n", source.c_str(),
                   destination.c_str(), copied.reason().c_str());
    }
    return copied.ok();
}

void AssetHandler::resumeInterruptedInstall() {
    std::optional<PendingInstall> pending = readPendingInstall();
    if (pending) {
        resumePendingInstall(*pending);
    }
    // Whatever else a killed process left in the cache is never installed now.
    catalog::AssetQuery(kAssetTypeTavrixBundles).removeAbandonedDownloads();
}

void AssetHandler::resumePendingInstall(const PendingInstall& pendingInstall) {
    const PendingInstall* pending = &pendingInstall;
    const std::string& asset = pending->assetDirectory;
    if (!catalog::AssetQuery(kAssetTypeTavrixBundles).isInDownloadCache(asset)) {
        // The record names something the catalog never downloaded: nothing to install or purge.
        logCFormat("Ignoring the install record: %s is not a download\n", asset.c_str());
        removePendingInstall();
        return;
    }
    if (!pending->installed && itemKind(asset) == ItemKind::Directory) {
        logCFormat("Completing the interrupted install of %s\n", asset.c_str());
        installDownloadedBundle(asset);
    } else if (!pending->installed) {
        logCFormat(LogPriority::Warning,
                   "The interrupted install of %s cannot be completed: the download is gone\n",
                   asset.c_str());
    }
    const int purged = removeItemTree(asset);
    removePendingInstall();
    if (purged != 0 && purged != ENOENT) {
        logCFormat(LogPriority::Warning,
                   "Could not purge the download %s of the interrupted install (error %d)\n",
                   asset.c_str(), purged);
    } else {
        logCFormat("Purged the download %s of the interrupted install\n", asset.c_str());
    }
}

}  // namespace tavrix
