#include "CatalogPublisher.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <system_error>

#include "bundle/BundleKeys.h"
#include "catalog/AssetCatalogFormat.h"
#include "catalog/CatalogTrust.h"
#include "io/AtomicFile.h"
#include "payload/Archive.h"
#include "plist/PropertyListFormat.h"
#include "publishing/BundleCheck.h"

namespace tavrix::tools {
namespace {

namespace fs = std::filesystem;

constexpr const char* kBundleExtension = ".bundle";
// The whole bundle is packed in memory; this keeps that bounded.
constexpr std::uint32_t kMaxBundleBytes = 1u << 30;
// Every entry's modification time (2001-01-01), so that archives depend on file contents only.
constexpr std::int64_t kEntryModificationTime = 978307200;

std::string systemError(const std::string& action, const std::string& path, int error) {
    return action + " " + path + ": " + std::strerror(error);
}

bool isSafeFileNameCharacter(char c) {
    return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '.' ||
           c == '-' || c == '_';
}

// "Default.bundle" at version 1.2 becomes "Default-1.2-<sha256>.tgz": the digest in the name means
// a file once published is never replaced by other bytes under its name. Anything unusual in the
// first two parts becomes "_", so the name is always one plain path component.
std::string archiveNameFor(const std::string& directory, const std::string& version,
                           const std::string& digest) {
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
    return name + "-" + digest + ".tgz";
}

// The version is always the bundle's own: a catalog that names another one makes every device
// download the bundle again at each check.
Result<std::string> bundleVersion(const BundleToPublish& bundle) {
    Result<BundleIdentity> identity = checkBundleDirectory(bundle.directory);
    if (!identity) {
        return identity.failure();
    }
    if (!bundle.version.empty() && bundle.version != identity->version) {
        return Failure{bundle.directory + ": --version " + bundle.version + " differs from " +
                       kBundleInfoFileName + " " + kBundleVersionKey + " " + identity->version};
    }
    return identity->version;
}

// The regular files below directory as paths relative to it, sorted so archives are
// reproducible. Symbolic links and special files are left out with a warning.
Result<std::vector<std::string>> bundleFiles(const std::string& directory) {
    std::error_code code;
    if (!fs::is_directory(directory, code)) {
        return Failure{directory + " is not a directory"};
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
        return Failure{systemError("cannot list", directory, code.value())};
    }
    std::sort(files.begin(), files.end());
    return files;
}

// The archive of the files.
Result<std::string> packBundle(const std::string& directory,
                               const std::vector<std::string>& files) {
    std::unique_ptr<payload::Archive> archive =
        payload::Archive::initWithMaxUncompressedSize(kMaxBundleBytes, directory);
    if (!archive) {
        return Failure{"cannot set up an archive for " + directory};
    }
    archive->setEntryModificationTime(kEntryModificationTime);
    for (const std::string& file : files) {
        std::string path = (fs::path(directory) / file).string();
        if (!archive->addFile(path, file)) {
            return Failure{"cannot add " + path + " (unreadable, or the bundle is over " +
                           std::to_string(kMaxBundleBytes) + " bytes)"};
        }
    }
    if (!archive->close()) {
        return Failure{"cannot finish the archive of " + directory};
    }
    const plist::Data& data = archive->archiveData();
    return std::string(reinterpret_cast<const char*>(data.data()), data.size());
}

// Writes the archive under its content-addressed name. A file already there with that name holds
// the same bytes and is left alone; one that does not is damaged, and is refused.
Result<> storeArchive(const std::string& path, const std::string& bytes,
                      const std::string& digest) {
    int error = io::createFileAtomically(path, bytes, 0644);
    if (error == EEXIST) {
        std::optional<std::string> existing = catalog::sha256HexOfFile(path);
        if (existing != digest) {
            return Failure{path + " does not hold the bytes its name says; remove it"};
        }
        return {};
    }
    if (error != 0) {
        return Failure{systemError("cannot write", path, error)};
    }
    return {};
}

plist::Value attributesFor(const BundleToPublish& bundle, const std::string& version) {
    plist::Dictionary attributes{{catalog::kCatalogVersionAttribute, plist::Value(version)}};
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
Result<plist::Value> publishBundle(const PublishRequest& request, const BundleToPublish& bundle) {
    Result<std::string> version = bundleVersion(bundle);
    if (!version) {
        return version.failure();
    }
    Result<std::vector<std::string>> files = bundleFiles(bundle.directory);
    if (!files) {
        return files.failure();
    }
    Result<std::string> bytes = packBundle(bundle.directory, *files);
    if (!bytes) {
        return bytes.failure();
    }
    const std::size_t size = bytes->size();
    if (size > catalog::kMaxArchiveBytes) {
        return Failure{bundle.directory + " packs larger than devices accept"};
    }
    catalog::Sha256Digest hasher;
    hasher.update(*bytes);
    const std::string digest = hasher.finishHex();
    if (digest.empty()) {
        return Failure{"cannot take the SHA-256 of the archive of " + bundle.directory};
    }
    std::string relativeURL = std::string(kArchivesDirectoryName) + "/" +
                              archiveNameFor(bundle.directory, *version, digest);
    if (Result<> stored = storeArchive((fs::path(request.outputDirectory) / relativeURL).string(),
                                       *bytes, digest);
        !stored) {
        return stored.failure();
    }
    std::printf("packed %s: %zu files, %zu bytes, Version %s\n", relativeURL.c_str(), files->size(),
                size, version->c_str());
    plist::Dictionary entry{
        {catalog::kCatalogAttributesKey, attributesFor(bundle, *version)},
        {catalog::kCatalogArchiveURLKey, plist::Value(relativeURL)},
        {catalog::kCatalogArchiveSizeKey, plist::Value(static_cast<long long>(size))},
        {catalog::kCatalogArchiveSHA256Key, plist::Value(digest)},
    };
    if (bundle.rolloutPercent) {
        entry.emplace(catalog::kCatalogRolloutPercentKey, plist::Value(*bundle.rolloutPercent));
    }
    return plist::Value(std::move(entry));
}

// The catalog already in the output directory, or a new one when there is none yet or with fresh.
Result<plist::Dictionary> startingCatalog(const PublishRequest& request) {
    plist::Dictionary fresh{{catalog::kCatalogAssetTypeKey, plist::Value(request.assetType)},
                            {catalog::kCatalogAssetsKey, plist::Value(plist::Array())}};
    std::string path = (fs::path(request.outputDirectory) / kCatalogFileName).string();
    std::error_code code;
    if (request.fresh || !fs::exists(path, code)) {
        return fresh;
    }
    Result<plist::Dictionary> catalog = readServedCatalog(request.outputDirectory);
    if (!catalog) {
        return Failure{catalog.reason() + "; use --fresh to replace it"};
    }
    auto type = catalog->find(catalog::kCatalogAssetTypeKey);
    auto assets = catalog->find(catalog::kCatalogAssetsKey);
    if (assets == catalog->end() || assets->second.asArray() == nullptr) {
        return Failure{path + " is not a catalog; use --fresh to replace it"};
    }
    if (type == catalog->end() || type->second.asString() == nullptr ||
        *type->second.asString() != request.assetType) {
        return Failure{path + " lists another asset type; use --fresh to replace it"};
    }
    return catalog;
}

const plist::Value* versionOf(const plist::Value& entry) {
    const plist::Value* attributes = entry.find(catalog::kCatalogAttributesKey);
    return attributes != nullptr ? attributes->find(catalog::kCatalogVersionAttribute) : nullptr;
}

// Devices install by version, so a version published again replaces its entry.
void addOrReplace(plist::Array& entries, plist::Value entry) {
    const plist::Value* version = versionOf(entry);
    for (plist::Value& existing : entries) {
        const plist::Value* existingVersion = versionOf(existing);
        if (existingVersion != nullptr && version != nullptr && *existingVersion == *version) {
            existing = std::move(entry);
            return;
        }
    }
    entries.push_back(std::move(entry));
}

}  // namespace

Result<> publishCatalog(const PublishRequest& request) {
    if (Result<> open = refuseWhileStaged(request.outputDirectory); !open) {
        return open;
    }
    std::string archives = (fs::path(request.outputDirectory) / kArchivesDirectoryName).string();
    std::error_code code;
    fs::create_directories(archives, code);
    if (code) {
        return Failure{systemError("cannot create", archives, code.value())};
    }
    Result<plist::Dictionary> catalog = startingCatalog(request);
    if (!catalog) {
        return catalog.failure();
    }
    plist::Array entries = *catalog->at(catalog::kCatalogAssetsKey).asArray();
    for (const BundleToPublish& bundle : request.bundles) {
        Result<plist::Value> entry = publishBundle(request, bundle);
        if (!entry) {
            return entry.failure();
        }
        addOrReplace(entries, std::move(*entry));
    }
    catalog->insert_or_assign(catalog::kCatalogAssetsKey, plist::Value(std::move(entries)));
    return completeCatalog(request.outputDirectory, std::move(*catalog), request.completion);
}

}  // namespace tavrix::tools
