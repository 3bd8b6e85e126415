#include "catalog/CatalogLoader.h"

#include <cerrno>
#include <chrono>
#include <cstring>

#include "catalog/CatalogTrust.h"
#include "http/HttpTransfer.h"
#include "io/AtomicFile.h"
#include "plist/PropertyListFormat.h"
#include "util/Clock.h"
#include "util/FileSystemUtilities.h"
#include "util/Log.h"

namespace tavrix::catalog {
namespace {

constexpr const char* kLocalCopyName = "/catalog.plist";
// Generous: a wrong length is then refused as a bad signature, not as a failed fetch.
constexpr std::size_t kMaxSignatureBytes = 4096;

struct SignedCatalog {
    std::string bytes;
    // Empty when no key is configured.
    std::string signature;
};

bool isSigned(const AssetTypeSettings& settings) {
    return !settings.trustedKeys.empty();
}

// The catalog and its signature, and a second fetch of both, share one time budget: the whole
// load is what a waiting update check feels.
class FetchDeadline {
  public:
    explicit FetchDeadline(long seconds)
        : end_(std::chrono::steady_clock::now() + std::chrono::seconds(seconds)) {}
    long remainingMilliseconds() const {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
            end_ - std::chrono::steady_clock::now());
        return static_cast<long>(left.count());
    }

  private:
    std::chrono::steady_clock::time_point end_;
};

std::optional<SignedCatalog> fetchFromServer(const AssetTypeSettings& settings,
                                             const FetchDeadline& deadline,
                                             CatalogRefusal& refusal) {
    SignedCatalog catalog;
    const AssetLimits& limits = settings.limits;
    Result<std::string> bytes =
        http::fetchHttpBody(settings.catalogURL, kMaxCatalogBytes,
                            limits.catalogTransfer(deadline.remainingMilliseconds()));
    if (!bytes) {
        refusal = {CatalogRefusalKind::FetchFailed, "cannot fetch it: " + bytes.reason()};
        return std::nullopt;
    }
    catalog.bytes = std::move(*bytes);
    if (isSigned(settings)) {
        std::string signatureURL = settings.catalogURL + kCatalogSignatureSuffix;
        Result<std::string> signature =
            http::fetchHttpBody(signatureURL, kMaxSignatureBytes,
                                limits.catalogTransfer(deadline.remainingMilliseconds()));
        if (!signature) {
            refusal = {CatalogRefusalKind::MissingSignature,
                       "cannot fetch its signature " + signatureURL + ": " + signature.reason()};
            return std::nullopt;
        }
        catalog.signature = std::move(*signature);
    }
    return catalog;
}

// Keeps the verified pair for local queries. Failing to keep it costs only those queries.
void keepLocalCopy(const AssetTypeSettings& settings, const SignedCatalog& catalog) {
    std::string path = settings.cacheDirectory + kLocalCopyName;
    std::string signaturePath = path + kCatalogSignatureSuffix;
    int error = createDirectoryAt(settings.cacheDirectory, 0755, true);
    if (error == 0 && isSigned(settings)) {
        error = io::replaceFileAtomically(signaturePath, catalog.signature, 0644);
    }
    if (error == 0) {
        error = io::replaceFileAtomically(path, catalog.bytes, 0644);
    }
    if (error == 0 && !isSigned(settings)) {
        removeItemTree(signaturePath);  // a stale signature would only mislead
    }
    if (error != 0) {
        logCFormat(LogPriority::Warning,
                   "Asset catalog: cannot keep a local copy of the catalog in %s: %s",
                   settings.cacheDirectory.c_str(), std::strerror(error));
    }
}

// Records the serial of a catalog taken from the server. Failing to costs only the rollback
// protection of that one step, so the catalog is still used.
void recordSerial(const AssetTypeSettings& settings, std::int64_t serial,
                  std::optional<std::int64_t> highestAccepted) {
    if (highestAccepted && serial <= *highestAccepted) {
        return;
    }
    if (int error = recordAcceptedSerial(settings.assetType, serial); error != 0) {
        logCFormat(LogPriority::Warning, "Asset catalog: cannot record serial %lld of %s: %s",
                   static_cast<long long>(serial), settings.assetType.c_str(),
                   std::strerror(error));
    }
}

std::optional<std::vector<CatalogEntry>> loadOnce(const AssetTypeSettings& settings, bool localOnly,
                                                  const FetchDeadline& deadline,
                                                  CatalogRefusal& refusal) {
    if (!isSigned(settings) && !settings.allowUnsigned) {
        refusal = {CatalogRefusalKind::UnsignedNotAllowed, "no trusted key is configured for " +
                                                               settings.assetType +
                                                               " and AllowUnsigned is not set"};
        return std::nullopt;
    }
    std::optional<SignedCatalog> catalog;
    if (localOnly) {
        std::string path = settings.cacheDirectory + kLocalCopyName;
        Result<std::string> bytes = plist::readFileBytes(path);
        if (!bytes) {
            return std::vector<CatalogEntry>();
        }
        catalog = SignedCatalog{std::move(*bytes), {}};
        if (isSigned(settings)) {
            catalog->signature =
                plist::readFileBytes(path + kCatalogSignatureSuffix).value_or(std::string());
        }
    } else {
        catalog = fetchFromServer(settings, deadline, refusal);
        if (!catalog) {
            return std::nullopt;
        }
    }
    Result<plist::Value> parsed = parseCatalog(catalog->bytes);
    if (!parsed) {
        refusal = {CatalogRefusalKind::Malformed, parsed.reason()};
        return std::nullopt;
    }
    if (isSigned(settings)) {
        if (!verifyWithTrustedKey(catalog->bytes, catalog->signature, catalogKeyID(*parsed),
                                  settings.trustedKeys, refusal)) {
            return std::nullopt;
        }
    } else {
        logCFormat(
            "Asset catalog: taking the catalog %s unverified: AllowUnsigned is set, which "
            "is for development only",
            settings.catalogURL.c_str());
    }
    std::optional<CatalogMetadata> metadata = readCatalogMetadata(*parsed, refusal);
    if (!metadata) {
        return std::nullopt;
    }
    std::optional<std::int64_t> highestAccepted = readAcceptedSerial(settings.assetType);
    if (!checkFreshness(*metadata, plist::Date{Clock::absoluteTimeNow()}, highestAccepted,
                        refusal)) {
        return std::nullopt;
    }
    Result<std::vector<CatalogEntry>> entries =
        readCatalogEntries(*parsed, settings.catalogURL, settings.assetType);
    if (!entries) {
        refusal = {CatalogRefusalKind::Malformed, entries.reason()};
        return std::nullopt;
    }
    if (!localOnly) {
        recordSerial(settings, metadata->serial, highestAccepted);
        keepLocalCopy(settings, *catalog);
    }
    return std::move(*entries);
}

}  // namespace

std::optional<std::vector<CatalogEntry>> loadCatalogEntries(const AssetTypeSettings& settings,
                                                            bool localOnly,
                                                            CatalogRefusal& refusal) {
    const FetchDeadline deadline(settings.limits.catalogTimeoutSeconds);
    std::optional<std::vector<CatalogEntry>> entries =
        loadOnce(settings, localOnly, deadline, refusal);
    // A publisher replaces the signature just before the catalog, so a fetch that falls between
    // the two sees a pair that does not match; fetching again settles it, within what is left of
    // the same budget.
    if (!entries && !localOnly && refusal.kind() == CatalogRefusalKind::BadSignature &&
        deadline.remainingMilliseconds() > 0) {
        entries = loadOnce(settings, localOnly, deadline, refusal);
    }
    return entries;
}

}  // namespace tavrix::catalog
