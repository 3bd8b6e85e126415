// The asset catalog service: which assets of a type a catalog lists, and downloading one into the
// local cache. Settings are described in AssetCatalogSettings.h, the catalog in
// AssetCatalogFormat.h.
//
// Downloads run one at a time on the service's worker thread. Progress reports reach the handler
// on the service's delivery thread, in order; reports made before a handler is set wait for it.
// After the last report (completed or failed) the handler is dropped, so a handler may capture
// its asset.
//
// The download runs in this process, so from its start until its last report has been handled
// (or the asset is dropped) it holds a service-manager transaction: the daemon does not leave for
// idleness in the middle of it. A purge holds one until its completion has run.
#pragma once

#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "bus/ServiceManager.h"
#include "catalog/AssetCatalogFormat.h"
#include "catalog/AssetCatalogSettings.h"
#include "catalog/AssetDownload.h"
#include "plist/Value.h"

namespace tavrix::catalog {

// The key of a progress report's current operation, a string with one of the values below.
inline constexpr const char* kAssetProgressOperationKey = "Operation";
inline constexpr const char* kAssetOperationStarted = "Started";
inline constexpr const char* kAssetOperationDownloading = "Downloading";
inline constexpr const char* kAssetOperationInstalling = "Installing";
// The last report of a download that succeeded: the asset's local URL is now set.
inline constexpr const char* kAssetOperationCompleted = "Completed";
// The last report of a download that failed; kAssetProgressErrorKey says why.
inline constexpr const char* kAssetOperationFailed = "Failed";

// Integers in Started and Downloading reports.
inline constexpr const char* kAssetProgressBytesWrittenKey = "BytesWritten";
inline constexpr const char* kAssetProgressTotalBytesKey = "TotalBytes";
// A string in Failed reports.
inline constexpr const char* kAssetProgressErrorKey = "Error";

class Asset : public std::enable_shared_from_this<Asset> {
  public:
    using ProgressHandler = std::function<void(const plist::Dictionary& progress)>;
    using PurgeCompletion = std::function<void(bool purged)>;

    // Assets come from AssetQuery; typeCacheDirectory is the asset type's directory in the cache.
    Asset(CatalogEntry entry, std::string typeCacheDirectory, AssetLimits limits);
    Asset(const Asset&) = delete;
    Asset& operator=(const Asset&) = delete;

    // The attributes the catalog gives for this asset, as it gives them.
    const plist::Dictionary& attributes() const { return entry_.attributes; }

    // Queues the download. No options are recognised yet; unknown ones are ignored. A call while
    // this asset's download is still running is logged and ignored.
    void beginDownload(const plist::Dictionary& options = {});

    // Sets the handler for this download's reports, including those already made.
    void setProgressHandler(ProgressHandler handler);

    // The directory holding this asset's latest completed download, or nothing while there is
    // none. Each download has a directory of its own.
    std::optional<std::string> localURL() const;

    // Removes the directories of this asset's downloads (after a download still queued or
    // running), never another asset's, then calls completion, when given, on the worker thread:
    // true when nothing of them is left.
    void purge(PurgeCompletion completion);

  private:
    void report(AssetProgress progress);
    void deliverReports();
    void runDownload();

    const CatalogEntry entry_;
    const std::string typeCacheDirectory_;
    const AssetLimits limits_;

    mutable std::mutex mutex_;
    // The directories of completed downloads, the latest last.
    std::vector<std::string> downloaded_;
    bool downloading_ = false;
    ProgressHandler handler_;
    std::deque<AssetProgress> undelivered_;
    // Open from beginDownload until the last report has been handled.
    std::optional<bus::ScopedServiceTransaction> unfinished_;
};

// How a query went, for a caller that tells "nothing newer" from "could not ask".
enum class QueryOutcome { NotRun, Answered, NoCatalogConfigured, FetchFailed, Refused };

// An asset the catalog lists that a staged rollout keeps from this device for now.
struct HeldBackAsset {
    plist::Dictionary attributes;
    int rolloutPercent = 0;
};

struct QueryResult {
    // The assets in the catalog's order, less those whose staged rollout leaves this device out;
    // nothing when the catalog could not be fetched or was refused.
    std::optional<std::vector<std::shared_ptr<Asset>>> assets;
    QueryOutcome outcome = QueryOutcome::NotRun;
    // One line: why the catalog gave no assets (empty when it answered).
    std::string reason;
    // What the answer left out for the rollout, so a check can tell "held back" from "current".
    std::vector<HeldBackAsset> heldBack;
};

// A query for the assets of one type. Without settings for the type it answers no assets and logs
// why once.
class AssetQuery {
  public:
    explicit AssetQuery(std::string assetType);

    // True: answer from the copy of the last catalog fetched, without asking the server.
    void setQueriesLocalInformationOnly(bool localOnly) { localOnly_ = localOnly; }

    // Runs the query on the calling thread (it blocks while the catalog is fetched). Assets the
    // rollout holds back are logged in one line, a refused catalog in one line with its reason.
    QueryResult runQuery() const;

    // Removes the downloads a process that ended left in this type's cache (see
    // removeAbandonedDownloads); for the launch, before any download can start.
    void removeAbandonedDownloads() const;

    // Whether directory lies in this type's download cache, where only the daemon writes.
    bool isInDownloadCache(const std::string& directory) const;

  private:
    std::string assetType_;
    bool localOnly_ = false;
};

}  // namespace tavrix::catalog
