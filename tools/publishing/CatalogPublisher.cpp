#include "CatalogPublisher.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <system_error>

#include "catalog/AssetCatalogFormat.h"
#include "catalog/CatalogTrust.h"
#include "io/AtomicFile.h"
#include "payload/Archive.h"
#include "plist/PropertyListFormat.h"
#include "publishing/BundleCheck.h"

namespace tavrix::tools {
namespace {

namespace fs = std::filesystem;

constexpr const char* kInfoFileName = "Info.plist";
constexpr const char* kBundleVersionKey = "QZBundleVersion";
constexpr const char* kBundleExtension = ".bundle";
// The whole bundle is packed in memory; this keeps that bounded.
constexpr std::uint32_t kMaxBundleBytes = 1u << 30;
// Every entry's modification time (2001-01-01), so that archives depend on file contents only.
constexpr std::int64_t kEntryModificationTime = 978307200;
constexpr double kSecondsPerDay = 86400.0;

using Failure = std::optional<std::string>;

std::string systemError(const std::string& action, const std::string& path, int error) {
    return action + " " + path + ": " + std::strerror(error);
}

bool isSafeFileNameCharacter(char c) {
    return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '.' ||
           c == '-' || c == '_';
}

// "Default.bundle" at version 1.2 becomes "Default-1.2.tgz"; anything unusual in either part
// becomes "_", so the name is always one plain path component.
std::string archiveNameFor(const std::string& directory, const std::string& version) {
    std::string stem = fs::path(directory).lexically_normal().filename().string();
    if (stem.empty()) {
        stem = fs::path(directory).lexically_normal().parent_path().filename().string();
    }
    if (stem.size() > std::strlen(kBundleExtension) && stem.ends_with(kBundleExtension)) {
        stem.resize(stem.size() - std::strlen(kBundleExtension));
    }
    std::string name = stem + "-" + version;
    std::replace_if(
        name.begin(), name.end(), [](char c) { return !isSafeFileNameCharacter(c); }, '_');
    if (name.front() == '.') {
        name.front() = '_';
    }
    return name + ".tgz";
}

// The version is always the bundle's own: a catalog that names another one makes every device
// download the bundle again at each check.
std::optional<std::string> bundleVersion(const BundleToPublish& bundle, std::string& error) {
    std::optional<BundleIdentity> identity = checkBundleDirectory(bundle.directory, error);
    if (!identity) {
        return std::nullopt;
    }
    if (!bundle.version.empty() && bundle.version != identity->version) {
        error = bundle.directory + ": --version " + bundle.version + " differs from " +
                kInfoFileName + " " + kBundleVersionKey + " " + identity->version;
        return std::nullopt;
    }
    return identity->version;
}

// The regular files below directory as paths relative to it, sorted so archives are
// reproducible. Symbolic links and special files are left out with a warning.
std::optional<std::vector<std::string>> bundleFiles(const std::string& directory,
                                                    std::string& error) {
    std::error_code code;
    if (!fs::is_directory(directory, code)) {
        error = directory + " is not a directory";
        return std::nullopt;
    }
    std::vector<std::string> files;
    fs::recursive_directory_iterator walk(directory, code);
    for (; !code && walk != fs::recursive_directory_iterator(); walk.increment(code)) {
        const fs::directory_entry& entry = *walk;
        std::string relative = fs::relative(entry.path(), directory, code).generic_string();
        if (entry.is_symlink(code)) {
            std::fprintf(stderr, "tavrix-catalog: leaving out the symbolic link %s\n",
                         entry.path().c_str());
        } else if (entry.is_regular_file(code)) {
            files.push_back(relative);
        } else if (!entry.is_directory(code)) {
            std::fprintf(stderr, "tavrix-catalog: leaving out the special file %s\n",
                         entry.path().c_str());
        }
    }
    if (code) {
        error = systemError("cannot list", directory, code.value());
        return std::nullopt;
    }
    std::sort(files.begin(), files.end());
    return files;
}

Failure packBundle(const std::string& directory, const std::vector<std::string>& files,
                   const std::string& archivePath) {
    std::unique_ptr<payload::Archive> archive =
        payload::Archive::initWithMaxUncompressedSize(kMaxBundleBytes, archivePath);
    if (!archive) {
        return "cannot set up an archive for " + directory;
    }
    archive->setEntryModificationTime(kEntryModificationTime);
    for (const std::string& file : files) {
        std::string path = (fs::path(directory) / file).string();
        if (!archive->addFile(path, file)) {
            return "cannot add " + path + " (unreadable, or the bundle is over " +
                   std::to_string(kMaxBundleBytes) + " bytes)";
        }
    }
    if (!archive->close() || !archive->writeToFile(archivePath)) {
        return "cannot write " + archivePath;
    }
    return std::nullopt;
}

plist::Value attributesFor(const BundleToPublish& bundle, const std::string& version) {
    plist::Dictionary attributes{{"Version", plist::Value(version)}};
    if (!bundle.productTypes.empty()) {
        plist::Array types(bundle.productTypes.begin(), bundle.productTypes.end());
        attributes.emplace("SupportedProductTypes", plist::Value(std::move(types)));
    }
    if (!bundle.minimumOSVersion.empty()) {
        attributes.emplace("MinimumOSVersion", plist::Value(bundle.minimumOSVersion));
    }
    if (!bundle.maximumOSVersion.empty()) {
        attributes.emplace("MaximumOSVersion", plist::Value(bundle.maximumOSVersion));
    }
    return plist::Value(std::move(attributes));
}

// Packs one bundle into the archives directory and answers its catalog entry.
std::optional<plist::Value> publishBundle(const PublishRequest& request,
                                          const BundleToPublish& bundle, std::string& error) {
    std::optional<std::string> version = bundleVersion(bundle, error);
    if (!version) {
        return std::nullopt;
    }
    std::optional<std::vector<std::string>> files = bundleFiles(bundle.directory, error);
    if (!files) {
        return std::nullopt;
    }
    std::string name = archiveNameFor(bundle.directory, *version);
    std::string relativeURL = std::string(kArchivesDirectoryName) + "/" + name;
    std::string archivePath = (fs::path(request.outputDirectory) / relativeURL).string();
    if (Failure failure = packBundle(bundle.directory, *files, archivePath)) {
        error = *failure;
        return std::nullopt;
    }
    std::error_code code;
    std::uintmax_t size = fs::file_size(archivePath, code);
    std::optional<std::string> digest = catalog::sha256HexOfFile(archivePath);
    if (code || !digest) {
        error = "cannot read back " + archivePath;
        return std::nullopt;
    }
    if (size > catalog::kMaxArchiveBytes) {
        error = archivePath + " is larger than devices accept";
        return std::nullopt;
    }
    std::printf("packed %s: %zu files, %ju bytes, Version %s\n", relativeURL.c_str(), files->size(),
                size, version->c_str());
    plist::Dictionary entry{
        {catalog::kCatalogAttributesKey, attributesFor(bundle, *version)},
        {catalog::kCatalogArchiveURLKey, plist::Value(relativeURL)},
        {catalog::kCatalogArchiveSizeKey, plist::Value(static_cast<long long>(size))},
        {catalog::kCatalogArchiveSHA256Key, plist::Value(*digest)},
    };
    if (bundle.rolloutPercent) {
        entry.emplace(catalog::kCatalogRolloutPercentKey, plist::Value(*bundle.rolloutPercent));
    }
    return plist::Value(std::move(entry));
}

// The serial of the catalog already in the output directory, 0 when there is none: devices refuse
// to go back, so even a fresh catalog continues from it.
std::int64_t previousSerial(const PublishRequest& request) {
    std::string path = (fs::path(request.outputDirectory) / kCatalogFileName).string();
    std::optional<plist::Value> catalog = plist::readFile(path);
    const plist::Value* serial = catalog ? catalog->find(catalog::kCatalogSerialKey) : nullptr;
    const plist::Integer* number = serial != nullptr ? serial->asInteger() : nullptr;
    return number != nullptr && !number->isLargeUnsigned() && number->signedValue() > 0
               ? number->signedValue()
               : 0;
}

// The entries of the catalog already in the output directory (none when there is none yet).
std::optional<plist::Array> existingEntries(const PublishRequest& request, std::string& error) {
    std::string path = (fs::path(request.outputDirectory) / kCatalogFileName).string();
    std::error_code code;
    if (request.fresh || !fs::exists(path, code)) {
        return plist::Array();
    }
    plist::Refusal refusal;
    std::optional<plist::Value> catalog = plist::readFile(path, &refusal);
    if (!catalog) {
        error = path + ": " + refusal.reason + "; use --fresh to replace it";
        return std::nullopt;
    }
    const plist::Value* type = catalog ? catalog->find(catalog::kCatalogAssetTypeKey) : nullptr;
    const plist::Value* assets = catalog ? catalog->find(catalog::kCatalogAssetsKey) : nullptr;
    if (assets == nullptr || assets->asArray() == nullptr) {
        error = path + " is not a catalog; use --fresh to replace it";
        return std::nullopt;
    }
    if (type == nullptr || type->asString() == nullptr || *type->asString() != request.assetType) {
        error = path + " lists another asset type; use --fresh to replace it";
        return std::nullopt;
    }
    return *assets->asArray();
}

void addOrReplace(plist::Array& entries, plist::Value entry) {
    const plist::Value* url = entry.find(catalog::kCatalogArchiveURLKey);
    for (plist::Value& existing : entries) {
        const plist::Value* existingURL = existing.find(catalog::kCatalogArchiveURLKey);
        if (existingURL != nullptr && url != nullptr && *existingURL == *url) {
            existing = std::move(entry);
            return;
        }
    }
    entries.push_back(std::move(entry));
}

bool writeFile(const std::string& path, const std::string& bytes, mode_t mode) {
    return io::replaceFileAtomically(path, bytes, mode) == 0;
}

// Writes the catalog and, with a key, its detached signature of exactly those bytes. The
// signature goes first, each file replaced whole: a device that fetches between the two sees a
// pair that does not verify and fetches again, never an old catalog taken as new.
Failure writeCatalog(const PublishRequest& request, std::int64_t serial, plist::Array entries) {
    std::string path = (fs::path(request.outputDirectory) / kCatalogFileName).string();
    std::string signaturePath = path + catalog::kCatalogSignatureSuffix;
    double now = static_cast<double>(std::time(nullptr));
    plist::Dictionary catalog{
        {catalog::kCatalogAssetTypeKey, plist::Value(request.assetType)},
        {catalog::kCatalogSerialKey, plist::Value(static_cast<long long>(serial))},
        {catalog::kCatalogExpiresKey,
         plist::Value(plist::Date::fromUnixTime(now + request.expiresInDays * kSecondsPerDay))},
        {catalog::kCatalogAssetsKey, plist::Value(std::move(entries))},
    };
    if (request.secretKey) {
        catalog.emplace(
            catalog::kCatalogKeyIDKey,
            plist::Value(request.keyIdentifier.empty() ? keyIdentifierOf(*request.secretKey)
                                                       : request.keyIdentifier));
    }
    std::string bytes = plist::serialize(plist::Value(std::move(catalog)));
    if (!request.secretKey) {
        std::error_code ignored;
        fs::remove(signaturePath, ignored);  // a stale signature would make devices refuse it
    } else {
        std::string signature(catalog::kCatalogSignatureBytes, '\0');
        crypto_sign_detached(reinterpret_cast<unsigned char*>(signature.data()), nullptr,
                             reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size(),
                             request.secretKey->data());
        if (!writeFile(signaturePath, signature, 0644)) {
            return systemError("cannot write", signaturePath, errno);
        }
    }
    if (!writeFile(path, bytes, 0644)) {
        return systemError("cannot write", path, errno);
    }
    return std::nullopt;
}

}  // namespace

std::optional<std::string> publishCatalog(const PublishRequest& request) {
    if (!catalog::sodiumReady()) {
        return "libsodium cannot be initialised";
    }
    std::string archives = (fs::path(request.outputDirectory) / kArchivesDirectoryName).string();
    std::error_code code;
    fs::create_directories(archives, code);
    if (code) {
        return systemError("cannot create", archives, code.value());
    }
    std::string error;
    std::int64_t serial = request.serial.value_or(previousSerial(request) + 1);
    std::optional<plist::Array> entries = existingEntries(request, error);
    if (!entries) {
        return error;
    }
    for (const BundleToPublish& bundle : request.bundles) {
        std::optional<plist::Value> entry = publishBundle(request, bundle, error);
        if (!entry) {
            return error;
        }
        addOrReplace(*entries, std::move(*entry));
    }
    std::size_t count = entries->size();
    if (Failure failure = writeCatalog(request, serial, std::move(*entries))) {
        return failure;
    }
    std::printf("wrote %s/%s: %zu asset(s), serial %lld, expires in %d days, %s\n",
                request.outputDirectory.c_str(), kCatalogFileName, count,
                static_cast<long long>(serial), request.expiresInDays,
                request.secretKey ? "signed" : "unsigned");
    return std::nullopt;
}

std::optional<std::string> generateKeyPair(const std::string& secretKeyPath,
                                           const std::string& publicKeyPath, std::string& error) {
    if (!catalog::sodiumReady()) {
        error = "libsodium cannot be initialised";
        return std::nullopt;
    }
    catalog::CatalogPublicKey publicKey{};
    catalog::CatalogSecretKey secretKey{};
    crypto_sign_keypair(publicKey.data(), secretKey.data());
    std::string publicText = catalog::base64Encode(publicKey.data(), publicKey.size());
    // Never over a key that is already there; complete under its name or not at all.
    const int writeError = io::createFileAtomically(
        secretKeyPath,
        std::string_view(reinterpret_cast<const char*>(secretKey.data()), secretKey.size()), 0600);
    sodium_memzero(secretKey.data(), secretKey.size());
    if (writeError != 0) {
        error = systemError("cannot create", secretKeyPath, writeError);
        return std::nullopt;
    }
    if (!writeFile(publicKeyPath, publicText + "\n", 0644)) {
        error = systemError("cannot write", publicKeyPath, errno);
        return std::nullopt;
    }
    return publicText;
}

std::string keyIdentifierOf(const catalog::CatalogSecretKey& secretKey) {
    catalog::CatalogPublicKey publicKey{};
    crypto_sign_ed25519_sk_to_pk(publicKey.data(), secretKey.data());
    return catalog::defaultKeyIdentifier(publicKey);
}

std::optional<catalog::CatalogSecretKey> readSecretKey(const std::string& path,
                                                       std::string& error) {
    std::optional<std::string> bytes = plist::readFileBytes(path);
    catalog::CatalogSecretKey key{};
    if (!bytes || bytes->size() != key.size()) {
        error = path + " is not a secret key made by 'tavrix-catalog keygen'";
        return std::nullopt;
    }
    std::memcpy(key.data(), bytes->data(), key.size());
    sodium_memzero(bytes->data(), bytes->size());
    return key;
}

}  // namespace tavrix::tools
