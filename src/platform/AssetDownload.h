// One asset's download on the worker thread: stream the archive into the cache, check it against
// the catalog, extract it, and only then put it where its local URL points.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include "platform/AssetCatalogFormat.h"
#include "plist/Value.h"

namespace tavrix::platform {

// Where an asset lives in its type's cache directory. Staging names start with "." so that they
// never collide with an installed asset (named by its archive's digest).
struct AssetCacheLocation {
    std::string directory;
    std::string archiveFile;
    std::string extractionDirectory;

    static AssetCacheLocation forEntry(const std::string& typeCacheDirectory,
                                       const CatalogEntry& entry);
};

using AssetProgressReporter = std::function<void(plist::Dictionary progress)>;

// Downloads, verifies and extracts the entry's archive into location.directory, replacing what
// was there, and reports the intermediate steps. Nothing on success, else why it failed. Either
// way the staged archive and any partial extraction are gone afterwards; a download, check or
// extraction that fails leaves an earlier installed copy as it was.
std::optional<std::string> downloadAndInstallAsset(const CatalogEntry& entry,
                                                   const AssetCacheLocation& location,
                                                   const AssetProgressReporter& report);

}  // namespace tavrix::platform
