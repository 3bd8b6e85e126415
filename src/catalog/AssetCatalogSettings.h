// The asset catalog's settings: which catalog serves each asset type, the keys its catalogs may be
// signed with, and where downloaded assets are kept. Read from
// <root>/etc/tavrix/AssetCatalog.plist:
//
//   CacheDirectory   string, absolute path under the root (default /var/cache/tavrixservicesd)
//   AssetTypes       dictionary: asset type -> dictionary of
//       CatalogURL     string, http or https URL of the catalog property list
//       TrustedKeys    dictionary: key identifier -> Ed25519 public key (data of 32 bytes, or a
//                      string of their base64). Several keys let a publisher rotate: sign with
//                      the new one once devices trust it, then remove the old one here.
//       PublicKey      the older form of a single trusted key, named by defaultKeyIdentifier
//       AllowUnsigned  boolean, for development only: without any trusted key, take catalogs
//                      unsigned instead of refusing them
//   and optional integers bounding what catalogs and archives may cost (AssetLimits below).
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Result.h"
#include "catalog/CatalogTrust.h"
#include "http/HttpTransfer.h"
#include "plist/Value.h"

namespace tavrix::catalog {

inline constexpr const char* kAssetCatalogSettingsPath = "/etc/tavrix/AssetCatalog.plist";
inline constexpr const char* kDefaultAssetCacheDirectory = "/var/cache/tavrixservicesd";

inline constexpr const char* kSettingsCacheDirectoryKey = "CacheDirectory";
inline constexpr const char* kSettingsAssetTypesKey = "AssetTypes";
inline constexpr const char* kSettingsCatalogURLKey = "CatalogURL";
inline constexpr const char* kSettingsPublicKeyKey = "PublicKey";
inline constexpr const char* kSettingsTrustedKeysKey = "TrustedKeys";
inline constexpr const char* kSettingsAllowUnsignedKey = "AllowUnsigned";

inline constexpr const char* kSettingsMaxExpandedBytesKey = "MaxExpandedBytes";
inline constexpr const char* kSettingsMaxArchiveEntriesKey = "MaxArchiveEntries";
inline constexpr const char* kSettingsFreeSpaceReserveKey = "FreeSpaceReserveBytes";
inline constexpr const char* kSettingsConnectTimeoutKey = "ConnectTimeoutSeconds";
inline constexpr const char* kSettingsLowSpeedBytesKey = "LowSpeedBytesPerSecond";
inline constexpr const char* kSettingsLowSpeedSecondsKey = "LowSpeedSeconds";
inline constexpr const char* kSettingsCatalogTimeoutKey = "CatalogTimeoutSeconds";
inline constexpr const char* kSettingsArchiveTimeoutKey = "ArchiveTimeoutSeconds";

// What one catalog fetch and one archive may cost. The defaults fit real bundles (a few
// megabytes, a few hundred files) with wide margins. The catalog's time covers its signature too
// and is short because a client's update check waits for it on the daemon's main thread.
struct AssetLimits {
    std::uint64_t maxExpandedBytes = 256ull << 20;
    std::uint64_t maxArchiveEntries = 20000;
    // Kept free on the cache's file system, beyond the room for the installer's copy.
    std::uint64_t freeSpaceReserveBytes = 64ull << 20;
    long connectTimeoutSeconds = 10;
    long lowSpeedBytesPerSecond = 1024;
    long lowSpeedSeconds = 30;
    long catalogTimeoutSeconds = 5;
    long archiveTimeoutSeconds = 1800;

    http::HttpTransferLimits archiveTransfer() const;
    // For what is left of the catalog's time; never below one millisecond, which curl would
    // take as no limit.
    http::HttpTransferLimits catalogTransfer(long remainingMilliseconds) const;
};

struct AssetTypeSettings {
    std::string assetType;
    std::string catalogURL;
    // A catalog must verify with one of these; with none, every catalog is refused unless
    // allowUnsigned (archives are still checked against an unsigned catalog).
    std::vector<TrustedCatalogKey> trustedKeys;
    bool allowUnsigned = false;
    // This type's own directory in the cache, resolved under the platform root.
    std::string cacheDirectory;
    AssetLimits limits;
};

// The settings for assetType from the settings file's value; a failure says what is missing or
// malformed. A malformed key refuses the type rather than dropping verification, and
// a malformed limit rather than dropping the limit.
Result<AssetTypeSettings> parseAssetTypeSettings(const plist::Value& settings,
                                                 std::string_view assetType);

}  // namespace tavrix::catalog
