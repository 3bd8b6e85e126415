#include "catalog/AssetCatalog.h"

#include <cerrno>
#include <cstring>

#include "catalog/AssetCatalogService.h"
#include "catalog/AssetDownload.h"
#include "catalog/CatalogLoader.h"
#include "catalog/CatalogRollout.h"
#include "device/DeviceInfoService.h"
#include "io/Paths.h"
#include "util/FileSystemUtilities.h"
#include "util/Log.h"

namespace tavrix::catalog {
namespace {

constexpr const char* kSerialNumberKey = "SerialNumber";

}  // namespace

Asset::Asset(CatalogEntry entry, std::string typeCacheDirectory, AssetLimits limits)
    : entry_(std::move(entry)),
      typeCacheDirectory_(std::move(typeCacheDirectory)),
      limits_(limits) {}

void Asset::beginDownload(const plist::Dictionary& /*options*/) {
    {
        std::lock_guard lock(mutex_);
        if (downloading_) {
            logCFormat("Asset catalog: the download of %s is already running",
                       entry_.archiveURL.c_str());
            return;
        }
        downloading_ = true;
        if (!unfinished_) {
            unfinished_.emplace();
        }
    }
    // The task holds the asset until its download is over.
    auto self = shared_from_this();
    if (!AssetCatalogService::shared().workerQueue().dispatchAsync(
            [self] { self->runDownload(); })) {
        std::lock_guard lock(mutex_);
        downloading_ = false;
        unfinished_.reset();
    }
}

void Asset::runDownload() {
    logCFormat("Asset catalog: downloading %s", entry_.archiveURL.c_str());
    AssetCacheLocation location = AssetCacheLocation::forDownload(typeCacheDirectory_, entry_);
    Result<> installed = downloadAndInstallAsset(
        entry_, location, limits_, [this](AssetProgress progress) { report(std::move(progress)); });
    AssetProgress last;
    if (!installed) {
        logCFormat(LogPriority::Warning, "Asset catalog: download of %s failed: %s",
                   entry_.archiveURL.c_str(), installed.reason().c_str());
        last = AssetProgress(kAssetOperationFailed, installed.reason());
    } else {
        logCFormat("Asset catalog: installed %s in %s", entry_.archiveURL.c_str(),
                   location.directory.c_str());
        last = AssetProgress(kAssetOperationCompleted);
    }
    {
        std::lock_guard lock(mutex_);
        downloading_ = false;
        if (installed) {
            downloaded_.push_back(location.directory);
        }
    }
    report(std::move(last));
}

void Asset::report(AssetProgress progress) {
    {
        std::lock_guard lock(mutex_);
        undelivered_.push_back(std::move(progress));
    }
    auto self = shared_from_this();
    AssetCatalogService::shared().deliveryQueue().dispatchAsync([self] { self->deliverReports(); });
}

void Asset::setProgressHandler(ProgressHandler handler) {
    {
        std::lock_guard lock(mutex_);
        handler_ = std::move(handler);
    }
    auto self = shared_from_this();
    AssetCatalogService::shared().deliveryQueue().dispatchAsync([self] { self->deliverReports(); });
}

// Runs only on the delivery queue, so reports reach the handler one at a time and in order.
void Asset::deliverReports() {
    for (;;) {
        ProgressHandler handler;
        AssetProgress progress;
        bool last = false;
        {
            std::lock_guard lock(mutex_);
            if (!handler_ || undelivered_.empty()) {
                return;
            }
            handler = handler_;
            progress = std::move(undelivered_.front());
            undelivered_.pop_front();
            last = progress.isFinal();
            if (last) {
                // The handler usually captures this asset; dropping it breaks that cycle.
                handler_ = nullptr;
            }
        }
        handler(progress.dictionary());
        if (last) {
            // The handler has installed what was downloaded: the process may leave now.
            std::lock_guard lock(mutex_);
            if (!downloading_) {
                unfinished_.reset();
            }
        }
    }
}

std::optional<std::string> Asset::localURL() const {
    std::string directory;
    {
        std::lock_guard lock(mutex_);
        if (downloaded_.empty()) {
            return std::nullopt;
        }
        directory = downloaded_.back();
    }
    if (io::kindOfPath(directory) != io::PathKind::Directory) {
        return std::nullopt;
    }
    return directory;
}

void Asset::purge(PurgeCompletion completion) {
    auto self = shared_from_this();
    auto unfinished = std::make_shared<bus::ScopedServiceTransaction>();
    AssetCatalogService::shared().workerQueue().dispatchAsync(
        [self, unfinished, completion = std::move(completion)] {
            std::vector<std::string> directories;
            {
                std::lock_guard lock(self->mutex_);
                directories.swap(self->downloaded_);
            }
            bool purged = true;
            for (const std::string& directory : directories) {
                int error = removeItemTree(directory);
                if (error != 0 && error != ENOENT) {
                    purged = false;
                    logCFormat(LogPriority::Warning, "Asset catalog: cannot purge %s: %s",
                               directory.c_str(), std::strerror(error));
                }
            }
            if (completion) {
                completion(purged);
            }
        });
}

AssetQuery::AssetQuery(std::string assetType) : assetType_(std::move(assetType)) {}

QueryResult AssetQuery::runQuery() const {
    std::optional<AssetTypeSettings> settings =
        AssetCatalogService::shared().settingsFor(assetType_);
    if (!settings) {
        return {std::vector<std::shared_ptr<Asset>>(),
                QueryOutcome::NoCatalogConfigured,
                "no catalog configured",
                {}};
    }
    CatalogRefusal refusal;
    std::optional<std::vector<CatalogEntry>> entries =
        loadCatalogEntries(*settings, localOnly_, refusal);
    if (!entries) {
        logCFormat(LogPriority::Warning, "Asset catalog: refusing the catalog %s: %s",
                   settings->catalogURL.c_str(), refusal.what().c_str());
        const bool fetchFailed = refusal.kind() == CatalogRefusalKind::FetchFailed;
        return {std::nullopt,
                fetchFailed ? QueryOutcome::FetchFailed : QueryOutcome::Refused,
                refusal.what(),
                {}};
    }
    QueryResult result{std::vector<std::shared_ptr<Asset>>(), QueryOutcome::Answered, {}, {}};
    std::string heldBack;
    std::string serialNumber;
    bool serialNumberRead = false;
    for (CatalogEntry& entry : *entries) {
        if (entry.rolloutPercent < 100) {
            if (!serialNumberRead) {
                serialNumber =
                    device::copyDeviceStringAnswer(kSerialNumberKey).value_or(std::string());
                serialNumberRead = true;
            }
            auto version = entry.attributes.find(kCatalogVersionAttribute);
            std::string versionText =
                version != entry.attributes.end() && version->second.asString() != nullptr
                    ? *version->second.asString()
                    : std::string();
            if (!takesPartInRollout(serialNumber, versionText, entry.rolloutPercent)) {
                heldBack += (heldBack.empty() ? "" : ", ") + versionText + " (" +
                            std::to_string(entry.rolloutPercent) + "%)";
                result.heldBack.push_back({std::move(entry.attributes), entry.rolloutPercent});
                continue;
            }
        }
        result.assets->push_back(
            std::make_shared<Asset>(std::move(entry), settings->cacheDirectory, settings->limits));
    }
    if (!heldBack.empty()) {
        logCFormat("Asset catalog: this device is outside the rollout of %s", heldBack.c_str());
    }
    return result;
}

void AssetQuery::removeAbandonedDownloads() const {
    // Tidying up says nothing: a device without catalog settings has no cache to tidy.
    std::optional<AssetTypeSettings> settings = AssetCatalogService::shared().settingsFor(
        assetType_, AssetCatalogService::Problems::Unsaid);
    if (settings) {
        catalog::removeAbandonedDownloads(settings->cacheDirectory, /*completedToo=*/true);
    }
}

bool AssetQuery::isInDownloadCache(const std::string& directory) const {
    std::optional<AssetTypeSettings> settings =
        AssetCatalogService::shared().settingsFor(assetType_);
    if (!settings || settings->cacheDirectory.empty() ||
        !directory.starts_with(settings->cacheDirectory + "/")) {
        return false;
    }
    return directory.find("/../") == std::string::npos && !directory.ends_with("/..");
}

}  // namespace tavrix::catalog
