// Checking a published catalog the way a device does: its signature with trusted keys, its
// expiry and serial, and the size and digest of every archive it lists.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "catalog/CatalogTrust.h"

namespace tavrix::tools {

struct VerifyRequest {
    // An http(s) URL of the catalog, or the directory publish wrote.
    std::string source;
    std::string assetType;
    std::vector<catalog::TrustedCatalogKey> keys;
    // Without keys, check everything but the signature.
    bool allowUnsigned = false;
    // The serial a device already holds: a lower one is a rollback.
    std::optional<std::int64_t> minimumSerial;
};

// Prints what it finds to stdout, each problem on a line of its own. True when there is none.
bool verifyPublishedCatalog(const VerifyRequest& request);

// The public key in the file keygen wrote, named identifier (its default identifier when empty),
// or nothing with error set.
std::optional<catalog::TrustedCatalogKey> readPublicKey(const std::string& path,
                                                        const std::string& identifier,
                                                        std::string& error);

}  // namespace tavrix::tools
