// Finds, downloads and installs newer behavior bundles from the asset catalog. Class members
// only; a download's state lives in its progress handler, and whether a check runs in the
// daemon root.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "catalog/AssetCatalog.h"
#include "plist/Value.h"

namespace tavrix {

struct PendingInstall;

inline constexpr const char* kAssetTypeTavrixBundles = "com.zandor.Grellas.TavrixBundles";
inline constexpr const char* kAssetAttributeVersion = catalog::kCatalogVersionAttribute;
inline constexpr const char* kAssetAttributeSupportedProductTypes = "SupportedProductTypes";
inline constexpr const char* kAssetAttributeMinimumOSVersion = "MinimumOSVersion";
inline constexpr const char* kAssetAttributeMaximumOSVersion = "MaximumOSVersion";

// Re-arm delays after a download: a day when it did not complete, 15 days after an install.
inline constexpr double kInstallRetryDelaySeconds = 86400;
inline constexpr double kInstallDoneDelaySeconds = 1296000;

class AssetHandler {
  public:
    AssetHandler() = delete;

    using AssetPtr = std::shared_ptr<catalog::Asset>;

    // Whether an update check is running, from its start until its download is installed and
    // purged. One per daemon root, made before the catalog service and so ending after it.
    struct CheckState {
        std::atomic<bool> running{false};
    };

    // Every asset of the bundle type the catalog lists (asking its server), or nothing when the
    // query failed; result, when given, says how the query went.
    static std::optional<std::vector<AssetPtr>> downloadAvailableAssets(
        catalog::QueryResult* result = nullptr);

    // The asset with the highest version strictly above the installed bundle's that fits this
    // device's OS version and product type; the first of equal versions wins. Null when none.
    static AssetPtr findTheBestAsset(catalog::QueryResult* result = nullptr);

    // Starts downloading the best asset; its completion installs it as the user bundle and redoes
    // the bundle match. True when a download was started. One check at a time: while one runs
    // (until its download is installed and purged) another answers false and starts nothing.
    // endCheck is called (on the catalog's thread) each time the download reports that the check
    // is over for now, with the delay until the next check.
    using EndCheck = std::function<void(double nextCheckSeconds)>;
    static bool downloadUpdateIfAvailable(EndCheck endCheck);

    // Completes an install that a crash cut short, from the download still in the cache, redoes
    // the match and purges the download. For the launch, before anything else changes the bundles.
    static void resumeInterruptedInstall();

  private:
    // Completes (or gives up) one recorded install, then purges its download and the record.
    static void resumePendingInstall(const PendingInstall& pending);

    // Marks an update check as running until finish() or its last owner goes.
    class RunningCheck {
      public:
        explicit RunningCheck(std::atomic<bool>& flag) : flag_(flag) {}
        ~RunningCheck() { finish(); }
        RunningCheck(const RunningCheck&) = delete;
        RunningCheck& operator=(const RunningCheck&) = delete;
        // Once only: a later check may have set the flag again by the time the last owner goes.
        void finish() {
            if (!finished_.exchange(true)) {
                flag_ = false;
            }
        }

      private:
        std::atomic<bool>& flag_;
        std::atomic<bool> finished_{false};
    };

    // What a download's progress handler does with one report (on the catalog's thread); running
    // marks the check as running for as long as it is held.
    static void handleDownloadProgress(const AssetPtr& asset, const plist::Dictionary& progress,
                                       const std::shared_ptr<RunningCheck>& running,
                                       const EndCheck& endCheck);
    // Copies the downloaded bundle over the user bundle directory and redoes the bundle match.
    // False when the install was refused before the old bundle was touched, or failed.
    static bool installDownloadedBundle(const std::string& source);
    // The copy itself; false when an entry could not be copied whole.
    static bool copyDownloadedBundle(const std::string& source, const std::string& destination);
};

}  // namespace tavrix
