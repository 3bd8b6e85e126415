#include "catalog/AssetCatalogFormat.h"

#include <algorithm>
#include <cctype>

#include "catalog/CatalogCrypto.h"
#include "http/HttpTransfer.h"
#include "plist/PropertyListFormat.h"
#include "util/Log.h"

namespace tavrix::catalog {
namespace {

// The entry as a CatalogEntry.
Result<CatalogEntry> readEntry(const plist::Value& value, const std::string& catalogURL) {
    if (!value.isDictionary()) {
        return Failure{"it is not a dictionary"};
    }
    CatalogEntry entry;
    if (const plist::Value* attributes = value.find(kCatalogAttributesKey)) {
        if (!attributes->isDictionary()) {
            return Failure{"Attributes is not a dictionary"};
        }
        entry.attributes = *attributes->asDictionary();
    }
    const plist::Value* url = value.find(kCatalogArchiveURLKey);
    if (url == nullptr || url->asString() == nullptr || url->asString()->empty()) {
        return Failure{"ArchiveURL is missing or not a string"};
    }
    std::optional<std::string> resolved = http::resolveHttpURL(catalogURL, *url->asString());
    if (!resolved) {
        return Failure{"ArchiveURL is not a valid http or https URL"};
    }
    entry.archiveURL = *resolved;
    const plist::Value* size = value.find(kCatalogArchiveSizeKey);
    const plist::Integer* sizeNumber = size != nullptr ? size->asInteger() : nullptr;
    if (sizeNumber == nullptr || sizeNumber->isLargeUnsigned() || sizeNumber->signedValue() <= 0 ||
        static_cast<std::uint64_t>(sizeNumber->signedValue()) > kMaxArchiveBytes) {
        return Failure{"ArchiveSize is not an integer from 1 to " +
                       std::to_string(kMaxArchiveBytes)};
    }
    entry.archiveSize = static_cast<std::uint64_t>(sizeNumber->signedValue());
    const plist::Value* digest = value.find(kCatalogArchiveSHA256Key);
    if (digest == nullptr || digest->asString() == nullptr || !isSha256Hex(*digest->asString())) {
        return Failure{"ArchiveSHA256 is not 64 hex digits"};
    }
    entry.archiveSHA256 = *digest->asString();
    if (const plist::Value* rollout = value.find(kCatalogRolloutPercentKey)) {
        const plist::Integer* percent = rollout->asInteger();
        if (percent == nullptr || percent->isLargeUnsigned() || percent->signedValue() < 0 ||
            percent->signedValue() > 100) {
            return Failure{"RolloutPercent is not an integer from 0 to 100"};
        }
        entry.rolloutPercent = static_cast<int>(percent->signedValue());
    }
    std::transform(entry.archiveSHA256.begin(), entry.archiveSHA256.end(),
                   entry.archiveSHA256.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return entry;
}

}  // namespace

Result<plist::Value> parseCatalog(std::string_view bytes) {
    Result<plist::Value> catalog = plist::parse(bytes);
    if (!catalog) {
        return Failure{"it is not a property list: " + catalog.reason()};
    }
    if (!catalog->isDictionary()) {
        return Failure{"it is not a property-list dictionary"};
    }
    return std::move(*catalog);
}

Result<std::vector<CatalogEntry>> readCatalogEntries(const plist::Value& catalog,
                                                     const std::string& catalogURL,
                                                     std::string_view assetType) {
    const plist::Value* listedType = catalog.find(kCatalogAssetTypeKey);
    if (listedType == nullptr || listedType->asString() == nullptr ||
        *listedType->asString() != assetType) {
        return Failure{"its AssetType is not " + std::string(assetType)};
    }
    const plist::Value* assets = catalog.find(kCatalogAssetsKey);
    if (assets == nullptr || assets->asArray() == nullptr) {
        return Failure{"it has no Assets array"};
    }
    std::vector<CatalogEntry> entries;
    const plist::Array& list = *assets->asArray();
    for (std::size_t index = 0; index < list.size(); ++index) {
        if (Result<CatalogEntry> entry = readEntry(list[index], catalogURL)) {
            entries.push_back(std::move(*entry));
        } else {
            logCFormat("Asset catalog: skipping entry %zu of %s: %s", index, catalogURL.c_str(),
                       entry.reason().c_str());
        }
    }
    return entries;
}

}  // namespace tavrix::catalog
