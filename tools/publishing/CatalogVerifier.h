// Checking a published catalog the way a device does: its signature with trusted keys, its
// expiry and serial, and the size and digest of every archive it lists.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/Result.h"
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
    // A catalog that expires within this many days is good for now but needs a refresh.
    int warningDays = 7;
};

enum class Verdict { Good, Warning, Bad };

struct ArchiveCheck {
    std::string version;
    // As the catalog lists it, relative to the catalog when it is.
    std::string archive;
    std::uint64_t size = 0;
    std::string sha256;
    int rolloutPercent = 100;
    bool matches = false;
};

struct VerifyReport {
    Verdict verdict = Verdict::Good;
    std::optional<std::int64_t> serial;
    std::optional<double> expiresUnixTime;
    std::optional<std::string> keyID;
    // "verified", "not checked" or "refused".
    std::string signature;
    std::vector<ArchiveCheck> archives;
    // Each makes the catalog bad, or only calls for attention.
    std::vector<std::string> problems;
    std::vector<std::string> warnings;
};

VerifyReport verifyPublishedCatalog(const VerifyRequest& request);

// The report on stdout, as text or as one JSON object, and every problem and warning on stderr,
// one line each.
void printVerifyReport(const VerifyReport& report, bool json);

// Where the catalog of a source (URL or directory) is.
std::string catalogLocation(const std::string& source);
// The bytes at an http(s) URL or a file path, at most maxBytes.
Result<std::string> readPublished(const std::string& location, std::size_t maxBytes);

}  // namespace tavrix::tools
