// What the asset catalog's queries and assets share for the life of the process: the settings
// file, the worker that downloads, and the thread that delivers progress reports.
#pragma once

#include <chrono>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "catalog/AssetCatalogSettings.h"
#include "plist/CachedPropertyListFile.h"
#include "util/SerialQueue.h"

namespace tavrix::catalog {

class AssetCatalogService {
  public:
    // Created on first use and never destroyed.
    static AssetCatalogService& shared();

    // Stops the download and delivery threads, if the service was ever created, letting what is
    // queued run. False when either was still busy after patience.
    static bool shutdownIfStarted(std::chrono::milliseconds patience);

    // Downloads and purges, one at a time.
    SerialQueue& workerQueue() { return worker_; }
    // Progress handlers run here, so a slow handler never holds up a download.
    SerialQueue& deliveryQueue() { return delivery_; }

    enum class Problems { Logged, Unsaid };
    // The current settings for assetType, or nothing. Why there are none is logged once, and again
    // only when the reason changes, unless the caller is only tidying up (Unsaid).
    std::optional<AssetTypeSettings> settingsFor(std::string_view assetType,
                                                 Problems problems = Problems::Logged);

  private:
    AssetCatalogService();
    void noteSettingsProblem(std::string_view assetType, const std::string& reason);

    plist::CachedPropertyListFile settingsFile_;
    std::mutex mutex_;
    std::map<std::string, std::string, std::less<>> loggedProblems_;
    SerialQueue worker_;
    SerialQueue delivery_;
};

}  // namespace tavrix::catalog
