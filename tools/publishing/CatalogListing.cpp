#include "publishing/CatalogListing.h"

#include <cstdio>
#include <ctime>
#include <filesystem>

#include "catalog/AssetCatalogFormat.h"
#include "catalog/CatalogTrust.h"
#include "publishing/CatalogSite.h"
#include "publishing/CatalogVerifier.h"

namespace tavrix::tools {
namespace {

namespace fs = std::filesystem;

const std::string* textAt(const plist::Value& dictionary, const char* key) {
    const plist::Value* value = dictionary.find(key);
    return value != nullptr ? value->asString() : nullptr;
}

std::string textOr(const plist::Value& dictionary, const char* key, const char* none) {
    const std::string* text = textAt(dictionary, key);
    return text != nullptr ? *text : none;
}

void printAsset(const plist::Value& asset) {
    const plist::Value* attributesValue = asset.find(catalog::kCatalogAttributesKey);
    const plist::Value attributes =
        attributesValue != nullptr ? *attributesValue : plist::Value(plist::Dictionary());
    const plist::Value* rollout = asset.find(catalog::kCatalogRolloutPercentKey);
    const plist::Integer* percent = rollout != nullptr ? rollout->asInteger() : nullptr;
    std::string products = "all";
    if (const plist::Value* types = attributes.find("SupportedProductTypes");
        types != nullptr && types->asArray() != nullptr) {
        products.clear();
        for (const plist::Value& type : *types->asArray()) {
            products += (products.empty() ? "" : ",") +
                        (type.asString() != nullptr ? *type.asString() : "?");
        }
    }
    std::printf("  version %s: rollout %lld %%, products %s, OS %s to %s, %s\n",
                textOr(attributes, "Version", "(none)").c_str(),
                percent != nullptr ? static_cast<long long>(percent->signedValue()) : 100LL,
                products.c_str(), textOr(attributes, "MinimumOSVersion", "any").c_str(),
                textOr(attributes, "MaximumOSVersion", "any").c_str(),
                textOr(asset, catalog::kCatalogArchiveURLKey, "(no archive)").c_str());
}

void printCatalog(const plist::Value& catalog) {
    const plist::Value* serial = catalog.find(catalog::kCatalogSerialKey);
    const plist::Value* expires = catalog.find(catalog::kCatalogExpiresKey);
    const plist::Value* assets = catalog.find(catalog::kCatalogAssetsKey);
    std::printf("asset type: %s\n", textOr(catalog, catalog::kCatalogAssetTypeKey, "?").c_str());
    std::printf("serial: %s\n", serial != nullptr ? serial->description().c_str() : "(none)");
    if (expires != nullptr && expires->asDate() != nullptr) {
        const double days =
            (expires->asDate()->unixTime() - static_cast<double>(std::time(nullptr))) / 86400.0;
        std::printf("expires: %s (%s %.1f days)\n",
                    catalog::catalogDateText(*expires->asDate()).c_str(),
                    days >= 0 ? "in" : "EXPIRED", days >= 0 ? days : -days);
    } else {
        std::printf("expires: (none)\n");
    }
    std::printf("key: %s\n", textOr(catalog, catalog::kCatalogKeyIDKey, "(unsigned)").c_str());
    const plist::Array* list = assets != nullptr ? assets->asArray() : nullptr;
    std::printf("assets: %zu\n", list != nullptr ? list->size() : 0);
    for (const plist::Value& asset : list != nullptr ? *list : plist::Array()) {
        printAsset(asset);
    }
}

Result<> showOne(const std::string& location) {
    Result<std::string> bytes = readPublished(location, catalog::kMaxCatalogBytes);
    if (!bytes) {
        return bytes.failure();
    }
    Result<plist::Value> catalog = catalog::parseCatalog(*bytes);
    if (!catalog) {
        return catalog.failure();
    }
    std::printf("catalog: %s\n", location.c_str());
    printCatalog(*catalog);
    return {};
}

}  // namespace

Result<> showCatalog(const std::string& source) {
    if (Result<> shown = showOne(catalogLocation(source)); !shown) {
        return shown;
    }
    std::error_code code;
    const fs::path staged = fs::path(source) / kUnsignedCatalogFileName;
    if (!source.starts_with("http://") && !source.starts_with("https://") &&
        fs::exists(staged, code)) {
        std::printf("\nwaiting for its signature ('tavrix-catalog sign'):\n");
        return showOne(staged.string());
    }
    return {};
}

}  // namespace tavrix::tools
