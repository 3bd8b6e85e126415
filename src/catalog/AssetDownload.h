// One asset's download on the worker thread: stream the archive into the cache, check it against
// the catalog, extract it, and only then put it where its local URL points.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "base/Result.h"
#include "catalog/AssetCatalogFormat.h"
#include "catalog/AssetCatalogSettings.h"
#include "plist/Value.h"

namespace tavrix::catalog {

// Where one download of an asset lives in its type's cache directory. Every download gets names
// of its own (the archive's digest and a random suffix), so two downloads of the same asset that
// overlap never remove or replace each other's files. Staging names start with "." so that they
// never collide with an installed asset.
struct AssetCacheLocation {
    std::string directory;
    std::string archiveFile;
    std::string extractionDirectory;

    static AssetCacheLocation forDownload(const std::string& typeCacheDirectory,
                                          const CatalogEntry& entry);
};

// Removes the downloads a process that ended left in a type's cache directory: staged ones (before
// a download starts: downloads run one at a time) and, with completedToo, complete ones as well
// (at launch, once an interrupted install has been resumed, when none can be in use).
void removeAbandonedDownloads(const std::string& typeCacheDirectory, bool completedToo);

// One step of a download as the catalog passes it along; a progress handler receives it as the
// dictionary of the keys in AssetCatalog.h.
struct AssetProgress {
    AssetProgress() = default;
    explicit AssetProgress(const char* step, std::string why = {})
        : operation(step), error(std::move(why)) {}

    const char* operation = nullptr;  // one of the kAssetOperation names
    std::optional<std::uint64_t> bytesWritten;
    std::optional<std::uint64_t> totalBytes;
    std::string error;  // of a failed download

    bool isFinal() const;
    plist::Dictionary dictionary() const;
};

using AssetProgressReporter = std::function<void(AssetProgress progress)>;

// Downloads, verifies and extracts the entry's archive within limits, renames the extraction to
// location.directory when it is whole, and reports the intermediate steps. Either way the
// staged archive and any partial extraction are gone afterwards.
Result<> downloadAndInstallAsset(const CatalogEntry& entry, const AssetCacheLocation& location,
                                 const AssetLimits& limits, const AssetProgressReporter& report);

}  // namespace tavrix::catalog
