// What the asset catalog's queries and assets share for the life of the daemon root: the settings
// file, the worker that downloads, and the thread that delivers progress reports.
#pragma once

#include <atomic>
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
    // Created on first use.
    static AssetCatalogService& shared();

    // Stops the download and delivery threads, letting what is queued run; a download under way
    // ends at its next piece of data (or its low-speed limit), as a failed one.
    void stop();
    bool stopping() const { return stopping_.load(); }
    ~AssetCatalogService();
    AssetCatalogService(const AssetCatalogService&) = delete;
    AssetCatalogService& operator=(const AssetCatalogService&) = delete;

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
    std::atomic<bool> stopping_{false};
    SerialQueue worker_;
    SerialQueue delivery_;
};

}  // namespace tavrix::catalog
