// The directory a publisher serves: the catalog and its signature, a catalog waiting for its
// signature, and the archives. Every new catalog takes the next serial and a new expiry and goes
// live here, so that the order of the writes and the removal of archives are decided once.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "base/Result.h"
#include "catalog/CatalogCrypto.h"
#include "plist/Value.h"
#include "publishing/CatalogKeys.h"

namespace tavrix::tools {

inline constexpr const char* kCatalogFileName = "catalog.plist";
// A catalog made without its signature, waiting for `sign`.
inline constexpr const char* kUnsignedCatalogFileName = "catalog.plist.unsigned";
inline constexpr const char* kArchivesDirectoryName = "archives";

// How a new catalog is completed: signed now, left for `sign` (under a named key), or published
// unsigned for devices set to AllowUnsigned.
struct Completion {
    enum class Mode { SignNow, Stage, Unsigned };
    Mode mode = Mode::SignNow;
    std::optional<CatalogSigner> signer;
    // The KeyID devices know the key by; empty when signing now: the key's default identifier.
    std::string keyIdentifier;
    // Nothing: one above the catalog it replaces.
    std::optional<std::int64_t> serial;
    int expiresInDays = 30;
};

// The catalog the site serves now; fails when there is none or it is damaged.
Result<plist::Dictionary> readServedCatalog(const std::string& site);

// Fails when a catalog waits for its signature in site, with the error to refuse a change with:
// the change would be made to a catalog that is about to be replaced.
Result<> refuseWhileStaged(const std::string& site);

// Gives catalog its serial, expiry and KeyID and signs it and puts it live, or stages it, as
// completion says. Going live, the signature is written before the catalog, each file replaced
// whole, and then archives that neither this catalog nor the one it replaced names are removed:
// a device that fetched the previous catalog can still download what it names. Prints one line
// saying what it did.
Result<> completeCatalog(const std::string& site, plist::Dictionary catalog,
                         const Completion& completion);

// Signs the staged catalog as it is and puts it live as completeCatalog does.
Result<> signStagedCatalog(const std::string& site, const CatalogSigner& signer);

}  // namespace tavrix::tools
