#include "platform/CatalogLoader.h"

#include <cerrno>
#include <chrono>
#include <cstring>

#include "payload/FileSystemUtilities.h"
#include "platform/AtomicFile.h"
#include "platform/HttpTransfer.h"
#include "plist/PropertyListFormat.h"
#include "util/Log.h"

namespace tavrix::platform {
namespace {

constexpr const char* kLocalCopyName = "/catalog.plist";

struct SignedCatalog {
    std::string bytes;
    // Empty when no key is configured.
    std::string signature;
};

bool verify(const AssetTypeSettings& settings, const SignedCatalog& catalog, std::string& whyNot) {
    if (!settings.publicKey) {
        return true;
    }
    if (!verifyCatalogSignature(catalog.bytes, catalog.signature, *settings.publicKey)) {
        whyNot = "its signature does not verify with the configured key";
        return false;
    }
    return true;
}

// The catalog and its signature share one time budget: the whole fetch is what a waiting update
// check feels.
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
                                             std::string& whyNot) {
    std::string error;
    SignedCatalog catalog;
    const AssetLimits& limits = settings.limits;
    FetchDeadline deadline(limits.catalogTimeoutSeconds);
    std::optional<std::string> bytes =
        fetchHttpBody(settings.catalogURL, kMaxCatalogBytes,
                      limits.catalogTransfer(deadline.remainingMilliseconds()), error);
    if (!bytes) {
        whyNot = "cannot fetch it: " + error;
        return std::nullopt;
    }
    catalog.bytes = std::move(*bytes);
    if (settings.publicKey) {
        std::string signatureURL = settings.catalogURL + kCatalogSignatureSuffix;
        std::optional<std::string> signature =
            fetchHttpBody(signatureURL, kCatalogSignatureBytes,
                          limits.catalogTransfer(deadline.remainingMilliseconds()), error);
        if (!signature) {
            whyNot = "cannot fetch its signature " + signatureURL + ": " + error;
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
    int error = payload::createDirectoryAt(settings.cacheDirectory, 0755, true);
    if (error == 0) {
        error = replaceFileAtomically(path, catalog.bytes, 0644);
    }
    if (error == 0 && settings.publicKey) {
        error = replaceFileAtomically(signaturePath, catalog.signature, 0644);
    }
    if (error == 0 && !settings.publicKey) {
        payload::removeItemTree(signaturePath);  // a stale signature would only mislead
    }
    if (error != 0) {
        logCFormat("Asset catalog: cannot keep a local copy of the catalog in %s: %s",
                   settings.cacheDirectory.c_str(), std::strerror(error));
    }
}

}  // namespace

std::optional<std::vector<CatalogEntry>> loadCatalogEntries(const AssetTypeSettings& settings,
                                                            bool localOnly, std::string& whyNot) {
    std::optional<SignedCatalog> catalog;
    if (localOnly) {
        std::string path = settings.cacheDirectory + kLocalCopyName;
        std::optional<std::string> bytes = plist::readFileBytes(path);
        if (!bytes) {
            return std::vector<CatalogEntry>();
        }
        catalog = SignedCatalog{std::move(*bytes), {}};
        if (settings.publicKey) {
            catalog->signature =
                plist::readFileBytes(path + kCatalogSignatureSuffix).value_or(std::string());
        }
    } else {
        catalog = fetchFromServer(settings, whyNot);
        if (!catalog) {
            return std::nullopt;
        }
    }
    if (!verify(settings, *catalog, whyNot)) {
        return std::nullopt;
    }
    std::optional<std::vector<CatalogEntry>> entries =
        readCatalogEntries(catalog->bytes, settings.catalogURL, settings.assetType, whyNot);
    if (entries && !localOnly) {
        keepLocalCopy(settings, *catalog);
    }
    return entries;
}

}  // namespace tavrix::platform
