// The asset catalog's settings: which catalog serves each asset type, the key its catalogs are
// signed with, and where downloaded assets are kept. Read from
// <root>/etc/tavrix/AssetCatalog.plist:
//
//   CacheDirectory   string, absolute path under the root (default /var/cache/tavrixservicesd)
//   AssetTypes       dictionary: asset type -> dictionary of
//       CatalogURL   string, http or https URL of the catalog property list
//       PublicKey    optional Ed25519 public key: data of 32 bytes, or a string of their base64
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/CatalogCrypto.h"
#include "plist/Value.h"

namespace tavrix::platform {

inline constexpr const char* kAssetCatalogSettingsPath = "/etc/tavrix/AssetCatalog.plist";
inline constexpr const char* kDefaultAssetCacheDirectory = "/var/cache/tavrixservicesd";

inline constexpr const char* kSettingsCacheDirectoryKey = "CacheDirectory";
inline constexpr const char* kSettingsAssetTypesKey = "AssetTypes";
inline constexpr const char* kSettingsCatalogURLKey = "CatalogURL";
inline constexpr const char* kSettingsPublicKeyKey = "PublicKey";

struct AssetTypeSettings {
    std::string assetType;
    std::string catalogURL;
    // Without a key, catalogs are taken unsigned (archives are still checked against them).
    std::optional<CatalogPublicKey> publicKey;
    // This type's own directory in the cache, resolved under the platform root.
    std::string cacheDirectory;
};

// The settings for assetType from the settings file's value, or nothing with whyNot saying what
// is missing or malformed. A malformed key refuses the type rather than dropping verification.
std::optional<AssetTypeSettings> parseAssetTypeSettings(const plist::Value& settings,
                                                        std::string_view assetType,
                                                        std::string& whyNot);

}  // namespace tavrix::platform
