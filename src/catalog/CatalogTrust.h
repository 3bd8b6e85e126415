// Whether a catalog may be believed: signed by a key the device trusts, not expired, and not older
// than one the device already took. Shared by the daemon's loader and the publishing tool's
// verify, so both judge a catalog the same way.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "catalog/AssetCatalogFormat.h"
#include "catalog/CatalogCrypto.h"
#include "catalog/CatalogRefusal.h"
#include "plist/Value.h"

namespace tavrix::catalog {

struct TrustedCatalogKey {
    std::string identifier;
    CatalogPublicKey publicKey{};
};

// The identifier of a key that was given none: the first 16 hex digits of its SHA-256, so that a
// key configured alone and the catalogs it signs agree on a name without anyone choosing one.
std::string defaultKeyIdentifier(const CatalogPublicKey& publicKey);

// date as "2026-11-23 14:00:00 UTC", for log lines and the tool's output.
std::string catalogDateText(plist::Date date);

// What a catalog says about its freshness, under its signature.
struct CatalogMetadata {
    std::int64_t serial = 0;
    plist::Date expires;
};

// The metadata of a parsed catalog; nothing, with a Malformed refusal, when Serial or Expires is
// missing or of the wrong type.
std::optional<CatalogMetadata> readCatalogMetadata(const plist::Value& catalog,
                                                   CatalogRefusal& refusal);

// The key a parsed catalog names as its signer, when it names one as a string. Read before the
// signature is checked, and used only to pick the key to check it with.
std::optional<std::string> catalogKeyID(const plist::Value& catalog);

// True when signature is the signature of bytes by the trusted key that keyID names.
bool verifyWithTrustedKey(std::string_view bytes, std::string_view signature,
                          const std::optional<std::string>& keyID,
                          const std::vector<TrustedCatalogKey>& keys, CatalogRefusal& refusal);

// True when the catalog has not expired at now and its serial is not below highestAccepted.
bool checkFreshness(const CatalogMetadata& metadata, plist::Date now,
                    std::optional<std::int64_t> highestAccepted, CatalogRefusal& refusal);

// The highest serial this device has accepted for assetType, kept under the daemon's state
// directory; nothing before the first.
std::optional<std::int64_t> readAcceptedSerial(std::string_view assetType);
// Records serial as the highest accepted for assetType. 0 or an errno.
int recordAcceptedSerial(std::string_view assetType, std::int64_t serial);

}  // namespace tavrix::catalog
