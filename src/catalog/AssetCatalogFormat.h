// The catalog a publisher serves for one asset type, shared by the daemon's reader and the
// publishing tool. A catalog is a property list:
//
//   AssetType          string, the asset type it lists (a catalog of another type is refused)
//   Serial             integer from 1, higher with every publication: devices refuse to go back
//   Expires            date after which devices refuse the catalog, so a frozen view shows
//   KeyID              string, the identifier of the key that signed it
//   Assets             array of dictionaries:
//       Attributes     dictionary, handed to callers as it is
//       ArchiveURL     string, the gzip-compressed tar of the asset, relative to the catalog's URL
//                      or absolute (http or https)
//       ArchiveSize    integer, the archive's length in bytes
//       ArchiveSHA256  string, the archive's SHA-256 in hex
//       RolloutPercent optional integer 0-100: the share of devices that see the asset (all)
//
// Its detached Ed25519 signature (64 raw bytes) is served at the catalog's URL + ".sig".
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Result.h"
#include "plist/Value.h"

namespace tavrix::catalog {

inline constexpr const char* kCatalogAssetTypeKey = "AssetType";
inline constexpr const char* kCatalogAssetsKey = "Assets";
inline constexpr const char* kCatalogAttributesKey = "Attributes";
inline constexpr const char* kCatalogArchiveURLKey = "ArchiveURL";
inline constexpr const char* kCatalogArchiveSizeKey = "ArchiveSize";
inline constexpr const char* kCatalogArchiveSHA256Key = "ArchiveSHA256";
inline constexpr const char* kCatalogSerialKey = "Serial";
inline constexpr const char* kCatalogExpiresKey = "Expires";
inline constexpr const char* kCatalogKeyIDKey = "KeyID";
inline constexpr const char* kCatalogRolloutPercentKey = "RolloutPercent";
// The attribute that names an asset's version (rollouts are bucketed by it).
inline constexpr const char* kCatalogVersionAttribute = "Version";
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
    int rolloutPercent = 100;
};

// The catalog's bytes as a property-list dictionary.
Result<plist::Value> parseCatalog(std::string_view bytes);

// The entries of a parsed catalog. A catalog that lists another asset type or has no Assets array
// is refused. Malformed entries are skipped, each with a log line.
Result<std::vector<CatalogEntry>> readCatalogEntries(const plist::Value& catalog,
                                                     const std::string& catalogURL,
                                                     std::string_view assetType);

}  // namespace tavrix::catalog
