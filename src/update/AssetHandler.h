// Finds, downloads and installs newer behavior bundles from the asset catalog. Class members
// only; a download's state lives in its progress handler.
#pragma once

#include <memory>
#include <optional>
#include <vector>

#include "platform/AssetCatalog.h"
#include "plist/Value.h"

namespace tavrix {

inline constexpr const char* kAssetTypeTavrixBundles = "com.zandor.Grellas.TavrixBundles";
inline constexpr const char* kAssetAttributeVersion = "Version";
inline constexpr const char* kAssetAttributeSupportedProductTypes = "SupportedProductTypes";
inline constexpr const char* kAssetAttributeMinimumOSVersion = "MinimumOSVersion";
inline constexpr const char* kAssetAttributeMaximumOSVersion = "MaximumOSVersion";

// Re-arm delays after a download: a day when it did not complete, 15 days after an install.
inline constexpr double kInstallRetryDelaySeconds = 86400;
inline constexpr double kInstallDoneDelaySeconds = 1296000;

class AssetHandler {
  public:
    AssetHandler() = delete;

    using AssetPtr = std::shared_ptr<platform::Asset>;

    // Every asset of the bundle type the catalog lists (asking its server), or nothing when the
    // query failed.
    static std::optional<std::vector<AssetPtr>> downloadAvailableAssets();

    // The asset with the highest version strictly above the installed bundle's that fits this
    // device's OS version and product type; the first of equal versions wins. Null when none.
    static AssetPtr findTheBestAsset();

    // Starts downloading the best asset; its completion installs it as the user bundle and redoes
    // the bundle match. True when a download was started.
    static bool downloadUpdateIfAvailable();

    // What a download's progress handler does with one report (on the catalog's thread).
    static void handleDownloadProgress(const AssetPtr& asset, const plist::Dictionary& progress);

  private:
    // Copies the downloaded bundle over the user bundle directory and redoes the bundle match.
    static void installDownloadedBundle(const std::string& source);
};

}  // namespace tavrix
