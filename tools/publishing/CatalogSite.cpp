#include "publishing/CatalogSite.h"

#include <cstdio>
#include <ctime>
#include <filesystem>
#include <set>
#include <system_error>

#include "catalog/AssetCatalogFormat.h"
#include "catalog/CatalogTrust.h"
#include "io/AtomicFile.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::tools {
namespace {

namespace fs = std::filesystem;

constexpr double kSecondsPerDay = 86400.0;
constexpr const char* kArchiveExtension = ".tgz";

std::string pathIn(const std::string& site, const char* name) {
    return (fs::path(site) / name).string();
}

Failure writeFailure(const std::string& path, int error) {
    return {"cannot write " + path + ": " +
            std::error_code(error, std::generic_category()).message()};
}

// The archive file names a catalog lists in the site's archives directory.
std::set<std::string> listedArchives(const plist::Dictionary& catalog) {
    std::set<std::string> names;
    auto assets = catalog.find(catalog::kCatalogAssetsKey);
    if (assets == catalog.end() || assets->second.asArray() == nullptr) {
        return names;
    }
    const std::string prefix = std::string(kArchivesDirectoryName) + "/";
    for (const plist::Value& asset : *assets->second.asArray()) {
        const plist::Value* url = asset.find(catalog::kCatalogArchiveURLKey);
        const std::string* text = url != nullptr ? url->asString() : nullptr;
        if (text != nullptr && text->starts_with(prefix)) {
            names.insert(text->substr(prefix.size()));
        }
    }
    return names;
}

std::int64_t serialOf(const plist::Dictionary& catalog) {
    auto serial = catalog.find(catalog::kCatalogSerialKey);
    const plist::Integer* number = serial != catalog.end() ? serial->second.asInteger() : nullptr;
    return number != nullptr && !number->isLargeUnsigned() && number->signedValue() > 0
               ? number->signedValue()
               : 0;
}

// Removes the archives that no catalog a device may still hold names: neither the new one nor
// the one it replaced.
void removeUnlistedArchives(const std::string& site, const std::set<std::string>& keep) {
    std::error_code code;
    fs::directory_iterator walk(pathIn(site, kArchivesDirectoryName), code);
    for (; !code && walk != fs::directory_iterator(); walk.increment(code)) {
        const std::string name = walk->path().filename().string();
        if (!walk->is_regular_file(code) || !name.ends_with(kArchiveExtension) ||
            keep.contains(name)) {
            continue;
        }
        std::error_code removeCode;
        if (fs::remove(walk->path(), removeCode)) {
            std::printf("removed %s/%s: no catalog being served lists it\n", kArchivesDirectoryName,
                        name.c_str());
        } else {
            std::fprintf(stderr, "tavrix-catalog: cannot remove %s: %s\n", walk->path().c_str(),
                         removeCode.message().c_str());
        }
    }
}

// Puts bytes live as the site's catalog, with its signature when there is one.
Result<> goLive(const std::string& site, const plist::Dictionary& catalog, const std::string& bytes,
                const std::optional<std::string>& signature) {
    const std::string path = pathIn(site, kCatalogFileName);
    const std::string signaturePath = path + catalog::kCatalogSignatureSuffix;
    std::set<std::string> keep = listedArchives(catalog);
    if (Result<plist::Dictionary> previous = readServedCatalog(site)) {
        keep.merge(listedArchives(*previous));
    }
    // The signature first: a device that fetches between the two sees a pair that does not
    // verify and fetches again, never an old catalog taken as new.
    if (signature) {
        if (int error = io::replaceFileAtomically(signaturePath, *signature, 0644); error != 0) {
            return writeFailure(signaturePath, error);
        }
    } else {
        std::error_code code;
        fs::remove(signaturePath, code);  // a stale signature would make devices refuse it
    }
    if (int error = io::replaceFileAtomically(path, bytes, 0644); error != 0) {
        return writeFailure(path, error);
    }
    std::error_code code;
    fs::remove(pathIn(site, kUnsignedCatalogFileName), code);
    removeUnlistedArchives(site, keep);
    auto expires = catalog.find(catalog::kCatalogExpiresKey);
    auto keyID = catalog.find(catalog::kCatalogKeyIDKey);
    auto assets = catalog.find(catalog::kCatalogAssetsKey);
    std::printf("wrote %s: %zu asset(s), serial %lld, expires %s, %s\n", path.c_str(),
                assets != catalog.end() && assets->second.asArray() != nullptr
                    ? assets->second.asArray()->size()
                    : 0,
                static_cast<long long>(serialOf(catalog)),
                expires != catalog.end() && expires->second.asDate() != nullptr
                    ? catalog::catalogDateText(*expires->second.asDate()).c_str()
                    : "never",
                keyID != catalog.end() && keyID->second.asString() != nullptr
                    ? ("signed with " + *keyID->second.asString()).c_str()
                    : "unsigned");
    return {};
}

}  // namespace

Result<plist::Dictionary> readServedCatalog(const std::string& site) {
    const std::string path = pathIn(site, kCatalogFileName);
    Result<plist::Value> catalog = plist::readFile(path);
    if (!catalog) {
        return Failure{path + ": " + catalog.reason()};
    }
    if (catalog->asDictionary() == nullptr) {
        return Failure{path + " is not a catalog"};
    }
    return *catalog->asDictionary();
}

Result<> refuseWhileStaged(const std::string& site) {
    std::error_code code;
    const std::string staged = pathIn(site, kUnsignedCatalogFileName);
    if (fs::exists(staged, code)) {
        return Failure{staged +
                       " waits for its signature: sign it with 'tavrix-catalog sign' or remove it"};
    }
    return {};
}

Result<> completeCatalog(const std::string& site, plist::Dictionary catalog,
                         const Completion& completion) {
    const Result<plist::Dictionary> served = readServedCatalog(site);
    const std::int64_t serial = completion.serial.value_or((served ? serialOf(*served) : 0) + 1);
    const double now = static_cast<double>(std::time(nullptr));
    catalog.insert_or_assign(catalog::kCatalogSerialKey,
                             plist::Value(static_cast<long long>(serial)));
    catalog.insert_or_assign(
        catalog::kCatalogExpiresKey,
        plist::Value(plist::Date::fromUnixTime(now + completion.expiresInDays * kSecondsPerDay)));
    std::string keyIdentifier = completion.keyIdentifier;
    if (completion.mode == Completion::Mode::SignNow && keyIdentifier.empty()) {
        const CatalogSigner& signer = *completion.signer;
        keyIdentifier = catalog::defaultKeyIdentifier(
            signer.secretKey ? publicKeyOf(*signer.secretKey) : signer.publicKey);
    }
    if (completion.mode == Completion::Mode::Unsigned) {
        catalog.erase(catalog::kCatalogKeyIDKey);
    } else {
        catalog.insert_or_assign(catalog::kCatalogKeyIDKey, plist::Value(keyIdentifier));
    }
    const Result<std::string> encoded = plist::serialize(plist::Value(catalog));
    if (!encoded) {
        return Failure{"the catalog cannot be written: " + encoded.reason()};
    }
    const std::string& bytes = *encoded;
    switch (completion.mode) {
        case Completion::Mode::Stage: {
            const std::string path = pathIn(site, kUnsignedCatalogFileName);
            if (int error = io::replaceFileAtomically(path, bytes, 0644); error != 0) {
                return writeFailure(path, error);
            }
            std::printf(
                "staged %s: serial %lld, for the key %s; devices see nothing until "
                "'tavrix-catalog sign' puts it live\n",
                path.c_str(), static_cast<long long>(serial), keyIdentifier.c_str());
            return {};
        }
        case Completion::Mode::Unsigned:
            return goLive(site, catalog, bytes, std::nullopt);
        case Completion::Mode::SignNow:
            break;
    }
    Result<std::string> signature = signCatalogBytes(*completion.signer, bytes);
    if (!signature) {
        return signature.failure();
    }
    return goLive(site, catalog, bytes, *signature);
}

Result<> signStagedCatalog(const std::string& site, const CatalogSigner& signer) {
    const std::string path = pathIn(site, kUnsignedCatalogFileName);
    Result<std::string> bytes = plist::readFileBytes(path);
    if (!bytes) {
        return Failure{path + ": " + bytes.reason() +
                       "; 'publish --stage' and the other commands write it"};
    }
    Result<plist::Value> catalog = catalog::parseCatalog(*bytes);
    if (!catalog) {
        return Failure{path + ": " + catalog.reason()};
    }
    Result<std::string> signature = signCatalogBytes(signer, *bytes);
    if (!signature) {
        return signature.failure();
    }
    return goLive(site, *catalog->asDictionary(), *bytes, *signature);
}

}  // namespace tavrix::tools
