#include "CatalogVerifier.h"

#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>

#include "CatalogPublisher.h"
#include "catalog/AssetCatalogFormat.h"
#include "http/HttpTransfer.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::tools {
namespace {

namespace fs = std::filesystem;

// Archives of a catalog read from a directory resolve against this base, and are then read from
// the directory; archives listed with an absolute URL are fetched.
constexpr std::string_view kDirectoryBase = "http://published.invalid/";
constexpr std::size_t kMaxSignatureBytes = 4096;
const http::HttpTransferLimits kTransferLimits{15, 1024, 30, 0};

bool isURL(const std::string& source) {
    return source.starts_with("http://") || source.starts_with("https://");
}

std::optional<std::string> readSource(const std::string& location, std::size_t maxBytes,
                                      std::string& error) {
    if (isURL(location)) {
        return http::fetchHttpBody(location, maxBytes, kTransferLimits, error);
    }
    std::optional<std::string> bytes = plist::readFileBytes(location);
    if (!bytes) {
        error = "cannot read " + location;
    }
    return bytes;
}

// The size and SHA-256 of an archive, or nothing with error set. Reading stops past the size
// listed, as a device's download does.
std::optional<std::pair<std::uint64_t, std::string>> measureArchive(
    const std::string& directory, const catalog::CatalogEntry& entry, std::string& error) {
    if (entry.archiveURL.starts_with(kDirectoryBase)) {
        std::string path =
            (fs::path(directory) / entry.archiveURL.substr(kDirectoryBase.size())).string();
        std::error_code code;
        std::uintmax_t size = fs::file_size(path, code);
        std::optional<std::string> digest = catalog::sha256HexOfFile(path);
        if (code || !digest) {
            error = "cannot read " + path;
            return std::nullopt;
        }
        return std::make_pair(static_cast<std::uint64_t>(size), *digest);
    }
    catalog::Sha256Digest digest;
    std::uint64_t size = 0;
    bool fetched = http::transferHttpBody(
        entry.archiveURL,
        [&](std::string_view bytes, std::string& refusal) {
            size += bytes.size();
            if (size > entry.archiveSize) {
                refusal =
                    "it is longer than the " + std::to_string(entry.archiveSize) + " bytes listed";
                return false;
            }
            digest.update(bytes);
            return true;
        },
        kTransferLimits, error);
    if (!fetched) {
        return std::nullopt;
    }
    return std::make_pair(size, digest.finishHex());
}

bool problem(const std::string& text) {
    std::printf("PROBLEM: %s\n", text.c_str());
    return false;
}

}  // namespace

bool verifyPublishedCatalog(const VerifyRequest& request) {
    bool remote = isURL(request.source);
    std::string catalogLocation =
        remote ? request.source : (fs::path(request.source) / kCatalogFileName).string();
    std::string error;
    std::optional<std::string> bytes =
        readSource(catalogLocation, catalog::kMaxCatalogBytes, error);
    if (!bytes) {
        return problem("fetch failed: " + error);
    }
    std::optional<plist::Value> catalog = catalog::parseCatalog(*bytes, error);
    if (!catalog) {
        return problem("malformed: " + error);
    }
    catalog::CatalogRefusal refusal;
    bool good = true;
    if (!request.keys.empty()) {
        std::string signature = readSource(catalogLocation + catalog::kCatalogSignatureSuffix,
                                           kMaxSignatureBytes, error)
                                    .value_or(std::string());
        std::optional<std::string> keyID = catalog::catalogKeyID(*catalog);
        if (catalog::verifyWithTrustedKey(*bytes, signature, keyID, request.keys, refusal)) {
            std::printf("signature: verified with the key %s\n", keyID->c_str());
        } else {
            good = problem(refusal.what());
        }
    } else {
        std::printf("signature: not checked (--allow-unsigned)\n");
    }
    std::optional<catalog::CatalogMetadata> metadata =
        catalog::readCatalogMetadata(*catalog, refusal);
    if (!metadata) {
        return problem(refusal.what());
    }
    std::printf("serial: %lld\nexpires: %s\n", static_cast<long long>(metadata->serial),
                catalog::catalogDateText(metadata->expires).c_str());
    plist::Date now = plist::Date::fromUnixTime(static_cast<double>(std::time(nullptr)));
    if (!catalog::checkFreshness(*metadata, now, request.minimumSerial, refusal)) {
        good = problem(refusal.what());
    }
    std::string base = remote ? request.source : std::string(kDirectoryBase) + kCatalogFileName;
    std::optional<std::vector<catalog::CatalogEntry>> entries =
        catalog::readCatalogEntries(*catalog, base, request.assetType, error);
    if (!entries) {
        return problem("malformed: " + error);
    }
    // Devices skip malformed entries; a publisher wants to hear of them.
    std::size_t listed = catalog->find(catalog::kCatalogAssetsKey)->asArray()->size();
    if (entries->size() != listed) {
        good = problem(std::to_string(listed - entries->size()) + " of " + std::to_string(listed) +
                       " entries are malformed and skipped by devices");
    }
    for (const catalog::CatalogEntry& entry : *entries) {
        std::string name = entry.archiveURL.starts_with(kDirectoryBase)
                               ? entry.archiveURL.substr(kDirectoryBase.size())
                               : entry.archiveURL;
        auto measured = measureArchive(request.source, entry, error);
        if (!measured) {
            good = problem(name + ": " + error);
        } else if (measured->first != entry.archiveSize) {
            good = problem(name + ": " + std::to_string(measured->first) + " bytes, listed as " +
                           std::to_string(entry.archiveSize));
        } else if (measured->second != entry.archiveSHA256) {
            good = problem(name + ": SHA-256 " + measured->second + ", listed as " +
                           entry.archiveSHA256);
        } else {
            std::printf("archive: %s: %llu bytes, SHA-256 matches, rollout %d%%\n", name.c_str(),
                        static_cast<unsigned long long>(entry.archiveSize), entry.rolloutPercent);
        }
    }
    std::printf("%s\n", good ? "catalog is good" : "catalog has problems");
    return good;
}

std::optional<catalog::TrustedCatalogKey> readPublicKey(const std::string& path,
                                                        const std::string& identifier,
                                                        std::string& error) {
    std::optional<std::string> text = plist::readFileBytes(path);
    std::optional<std::string> bytes = text ? catalog::base64Decode(*text) : std::nullopt;
    catalog::TrustedCatalogKey key;
    if (!bytes || bytes->size() != key.publicKey.size()) {
        error = path + " is not a public key made by 'tavrix-catalog keygen'";
        return std::nullopt;
    }
    std::memcpy(key.publicKey.data(), bytes->data(), key.publicKey.size());
    key.identifier = identifier.empty() ? catalog::defaultKeyIdentifier(key.publicKey) : identifier;
    return key;
}

}  // namespace tavrix::tools
