// Publishing asset catalogs: packing bundle directories into archives, listing them in a catalog
// property list and signing it, so that any static HTTP server can serve the output directory.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "catalog/CatalogCrypto.h"

namespace tavrix::tools {

inline constexpr const char* kCatalogFileName = "catalog.plist";
inline constexpr const char* kArchivesDirectoryName = "archives";

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
    // Nothing: the catalog is published unsigned.
    std::optional<catalog::CatalogSecretKey> secretKey;
    // The identifier devices know the key by; empty: its default identifier.
    std::string keyIdentifier;
    // Nothing: one more than the catalog it replaces.
    std::optional<std::int64_t> serial;
    // Devices refuse the catalog this many days after publication.
    int expiresInDays = 30;
    // Start a new catalog instead of adding to the one in the output directory.
    bool fresh = false;
    std::vector<BundleToPublish> bundles;
};

// Packs every bundle, adds it to the catalog (replacing an entry of the same archive name) and
// writes and signs the catalog with the serial after the one it replaces (also with fresh) and
// its expiry. Archives are the same bytes for the same files. Progress goes to stdout. Nothing
// on success, else the error.
std::optional<std::string> publishCatalog(const PublishRequest& request);

// Makes an Ed25519 key pair: the secret key as 64 raw bytes (mode 0600, never over an existing
// file) and the public key as base64 text. The public key's base64 on success, else nothing with
// error set.
std::optional<std::string> generateKeyPair(const std::string& secretKeyPath,
                                           const std::string& publicKeyPath, std::string& error);

// The default identifier of the public half of secretKey.
std::string keyIdentifierOf(const catalog::CatalogSecretKey& secretKey);

// The secret key in the file keygen wrote, or nothing with error set.
std::optional<catalog::CatalogSecretKey> readSecretKey(const std::string& path, std::string& error);

}  // namespace tavrix::tools
