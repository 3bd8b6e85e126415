#include "catalog/AssetCatalogFormat.h"

#include <algorithm>
#include <cctype>

#include "catalog/CatalogCrypto.h"
#include "http/HttpTransfer.h"
#include "plist/PropertyListFormat.h"
#include "util/Log.h"

namespace tavrix::catalog {
namespace {

// The entry as a CatalogEntry, or nothing with whyNot set.
std::optional<CatalogEntry> readEntry(const plist::Value& value, const std::string& catalogURL,
                                      std::string& whyNot) {
    if (!value.isDictionary()) {
        whyNot = "it is not a dictionary";
        return std::nullopt;
    }
    CatalogEntry entry;
    if (const plist::Value* attributes = value.find(kCatalogAttributesKey)) {
        if (!attributes->isDictionary()) {
            whyNot = "Attributes is not a dictionary";
            return std::nullopt;
        }
        entry.attributes = *attributes->asDictionary();
    }
    const plist::Value* url = value.find(kCatalogArchiveURLKey);
    if (url == nullptr || url->asString() == nullptr || url->asString()->empty()) {
        whyNot = "ArchiveURL is missing or not a string";
        return std::nullopt;
    }
    std::optional<std::string> resolved = http::resolveHttpURL(catalogURL, *url->asString());
    if (!resolved) {
        whyNot = "ArchiveURL is not a valid http or https URL";
        return std::nullopt;
    }
    entry.archiveURL = *resolved;
    const plist::Value* size = value.find(kCatalogArchiveSizeKey);
    const plist::Integer* sizeNumber = size != nullptr ? size->asInteger() : nullptr;
    if (sizeNumber == nullptr || sizeNumber->isLargeUnsigned() || sizeNumber->signedValue() <= 0 ||
        static_cast<std::uint64_t>(sizeNumber->signedValue()) > kMaxArchiveBytes) {
        whyNot = "ArchiveSize is not an integer from 1 to " + std::to_string(kMaxArchiveBytes);
        return std::nullopt;
    }
    entry.archiveSize = static_cast<std::uint64_t>(sizeNumber->signedValue());
    const plist::Value* digest = value.find(kCatalogArchiveSHA256Key);
    if (digest == nullptr || digest->asString() == nullptr || !isSha256Hex(*digest->asString())) {
        whyNot = "ArchiveSHA256 is not 64 hex digits";
        return std::nullopt;
    }
    entry.archiveSHA256 = *digest->asString();
    if (const plist::Value* rollout = value.find(kCatalogRolloutPercentKey)) {
        const plist::Integer* percent = rollout->asInteger();
        if (percent == nullptr || percent->isLargeUnsigned() || percent->signedValue() < 0 ||
            percent->signedValue() > 100) {
            whyNot = "RolloutPercent is not an integer from 0 to 100";
            return std::nullopt;
        }
        entry.rolloutPercent = static_cast<int>(percent->signedValue());
    }
    std::transform(entry.archiveSHA256.begin(), entry.archiveSHA256.end(),
                   entry.archiveSHA256.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return entry;
}

}  // namespace

std::optional<plist::Value> parseCatalog(std::string_view bytes, std::string& whyNot) {
    plist::Refusal refusal;
    std::optional<plist::Value> catalog = plist::parse(bytes, &refusal);
    if (!catalog) {
        whyNot = "it is not a property list: " + refusal.reason;
        return std::nullopt;
    }
    if (!catalog->isDictionary()) {
        whyNot = "it is not a property-list dictionary";
        return std::nullopt;
    }
    return catalog;
}

std::optional<std::vector<CatalogEntry>> readCatalogEntries(const plist::Value& catalog,
                                                            const std::string& catalogURL,
                                                            std::string_view assetType,
                                                            std::string& whyNot) {
    const plist::Value* listedType = catalog.find(kCatalogAssetTypeKey);
    if (listedType == nullptr || listedType->asString() == nullptr ||
        *listedType->asString() != assetType) {
        whyNot = "its AssetType is not " + std::string(assetType);
        return std::nullopt;
    }
    const plist::Value* assets = catalog.find(kCatalogAssetsKey);
    if (assets == nullptr || assets->asArray() == nullptr) {
        whyNot = "it has no Assets array";
        return std::nullopt;
    }
    std::vector<CatalogEntry> entries;
    const plist::Array& list = *assets->asArray();
    for (std::size_t index = 0; index < list.size(); ++index) {
        std::string skipReason;
        if (std::optional<CatalogEntry> entry = readEntry(list[index], catalogURL, skipReason)) {
            entries.push_back(std::move(*entry));
        } else {
            logCFormat("Asset catalog: skipping entry %zu of %s: %s", index, catalogURL.c_str(),
                       skipReason.c_str());
        }
    }
    return entries;
}

}  // namespace tavrix::catalog
