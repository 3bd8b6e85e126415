// Publishing asset catalogs: packing bundle directories into archives, listing them in a catalog
// property list and signing it, so that any static HTTP server can serve the output directory.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "publishing/CatalogSite.h"

namespace tavrix::tools {

struct BundleToPublish {
    std::string directory;
    // Empty or equal to the bundle's Info.plist "QZBundleVersion", which is always the one used.
    std::string version;
    std::vector<std::string> productTypes;
    std::string minimumOSVersion;
    std::string maximumOSVersion;
    // The share of devices that see it; nothing: all.
    std::optional<int> rolloutPercent;
};

struct PublishRequest {
    std::string outputDirectory;
    std::string assetType;
    // Start a new catalog instead of adding to the one in the output directory.
    bool fresh = false;
    std::vector<BundleToPublish> bundles;
    Completion completion;
};

// Packs every bundle into an archive named after its digest, adds it to the catalog (replacing an
// entry of the same version) and completes the catalog. Archives are the same bytes for the same
// files, and a file once written is never changed. Progress goes to stdout.
Result<> publishCatalog(const PublishRequest& request);

}  // namespace tavrix::tools
