#include "catalog/AssetCatalogService.h"

#include "device/PlatformRoot.h"
#include "util/Log.h"
#include "util/SharedInstance.h"

namespace tavrix::catalog {

AssetCatalogService& AssetCatalogService::shared() {
    return SharedInstance<AssetCatalogService>::current().instance(
        [] { return std::unique_ptr<AssetCatalogService>(new AssetCatalogService()); });
}

void AssetCatalogService::stop() {
    stopping_.store(true);
    // Downloads first: they queue the reports that the delivery thread hands out.
    worker_.shutdown();
    delivery_.shutdown();
}

AssetCatalogService::~AssetCatalogService() {
    stop();
}

AssetCatalogService::AssetCatalogService()
    : settingsFile_(device::resolvePath(kAssetCatalogSettingsPath)),
      worker_("com.zandor.tavrixservicesd.AssetDownloads"),
      delivery_("com.zandor.tavrixservicesd.AssetProgress") {}

std::optional<AssetTypeSettings> AssetCatalogService::settingsFor(std::string_view assetType,
                                                                  Problems problems) {
    plist::CachedPropertyListFile::Snapshot snapshot = settingsFile_.read();
    std::string reason;
    std::optional<AssetTypeSettings> settings;
    if (snapshot.state == plist::CachedPropertyListFile::State::Missing) {
        reason = "there is no settings file";
    } else if (snapshot.state == plist::CachedPropertyListFile::State::Damaged) {
        reason = "the settings file is not a property list: " + snapshot.refusal.reason;
    } else {
        Result<AssetTypeSettings> parsed = parseAssetTypeSettings(*snapshot.value, assetType);
        if (parsed) {
            settings = std::move(*parsed);
        } else {
            reason = parsed.reason();
        }
    }
    if (problems == Problems::Logged) {
        noteSettingsProblem(assetType, reason);
    }
    return settings;
}

void AssetCatalogService::noteSettingsProblem(std::string_view assetType,
                                              const std::string& reason) {
    std::lock_guard lock(mutex_);
    auto known = loggedProblems_.find(assetType);
    if (known != loggedProblems_.end() && known->second == reason) {
        return;
    }
    loggedProblems_[std::string(assetType)] = reason;
    if (!reason.empty()) {
        logCFormat("Asset catalog: no assets of type %s: %s (%s)", std::string(assetType).c_str(),
                   reason.c_str(), settingsFile_.path().c_str());
    }
}

}  // namespace tavrix::catalog
