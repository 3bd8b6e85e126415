// The catalog a publisher serves for one asset type, shared by the daemon's reader and the
// publishing tool. A catalog is a property list:
//
//   AssetType          string, the asset type it lists (a catalog of another type is refused)
//   Assets             array of dictionaries:
//       Attributes     dictionary, handed to callers as it is
//       ArchiveURL     string, the gzip-compressed tar of the asset, relative to the catalog's URL
//                      or absolute (http or https)
//       ArchiveSize    integer, the archive's length in bytes
//       ArchiveSHA256  string, the archive's SHA-256 in hex
//
// Its detached Ed25519 signature (64 raw bytes) is served at the catalog's URL + ".sig".
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "plist/Value.h"

namespace tavrix::platform {

inline constexpr const char* kCatalogAssetTypeKey = "AssetType";
inline constexpr const char* kCatalogAssetsKey = "Assets";
inline constexpr const char* kCatalogAttributesKey = "Attributes";
inline constexpr const char* kCatalogArchiveURLKey = "ArchiveURL";
inline constexpr const char* kCatalogArchiveSizeKey = "ArchiveSize";
inline constexpr const char* kCatalogArchiveSHA256Key = "ArchiveSHA256";
inline constexpr const char* kCatalogSignatureSuffix = ".sig";

// Bounds on what a server may make the daemon hold or store.
inline constexpr std::size_t kMaxCatalogBytes = 8u << 20;
inline constexpr std::uint64_t kMaxArchiveBytes = 1ull << 30;

// One asset as the catalog lists it, its archive URL resolved and its digest in lower case.
struct CatalogEntry {
    plist::Dictionary attributes;
    std::string archiveURL;
    std::uint64_t archiveSize = 0;
    std::string archiveSHA256;
};

// The entries of a catalog's bytes. A catalog that is not a property list, lists another asset
// type or has no Assets array is refused: nothing, with whyNot saying why. Malformed entries are
// skipped, each with a log line.
std::optional<std::vector<CatalogEntry>> readCatalogEntries(std::string_view bytes,
                                                            const std::string& catalogURL,
                                                            std::string_view assetType,
                                                            std::string& whyNot);

}  // namespace tavrix::platform
