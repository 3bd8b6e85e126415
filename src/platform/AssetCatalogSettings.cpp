#include "platform/AssetCatalogSettings.h"

#include <cstring>

#include "platform/PlatformRoot.h"

namespace tavrix::platform {
namespace {

// The asset type names a directory in the cache, so it must be one plain path component.
bool isPathComponent(std::string_view name) {
    return !name.empty() && name != "." && name != ".." &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

std::optional<CatalogPublicKey> decodePublicKey(const plist::Value& value) {
    std::optional<std::string> bytes;
    if (const plist::Data* data = value.asData()) {
        bytes = std::string(data->begin(), data->end());
    } else if (const std::string* text = value.asString()) {
        bytes = base64Decode(*text);
    }
    if (!bytes || bytes->size() != CatalogPublicKey().size()) {
        return std::nullopt;
    }
    CatalogPublicKey key{};
    std::memcpy(key.data(), bytes->data(), key.size());
    return key;
}

}  // namespace

std::optional<AssetTypeSettings> parseAssetTypeSettings(const plist::Value& settings,
                                                        std::string_view assetType,
                                                        std::string& whyNot) {
    if (!settings.isDictionary()) {
        whyNot = "the settings are not a dictionary";
        return std::nullopt;
    }
    if (!isPathComponent(assetType)) {
        whyNot = "the asset type is not a valid name";
        return std::nullopt;
    }
    std::string cacheDirectory = kDefaultAssetCacheDirectory;
    if (const plist::Value* configured = settings.find(kSettingsCacheDirectoryKey)) {
        const std::string* path = configured->asString();
        if (path == nullptr || path->empty() || path->front() != '/') {
            whyNot = "CacheDirectory is not an absolute path";
            return std::nullopt;
        }
        cacheDirectory = *path;
    }
    const plist::Value* types = settings.find(kSettingsAssetTypesKey);
    const plist::Value* type = types != nullptr ? types->find(assetType) : nullptr;
    if (type == nullptr || !type->isDictionary()) {
        whyNot = "no settings for this asset type";
        return std::nullopt;
    }
    const plist::Value* url = type->find(kSettingsCatalogURLKey);
    if (url == nullptr || url->asString() == nullptr || url->asString()->empty()) {
        whyNot = "no CatalogURL for this asset type";
        return std::nullopt;
    }
    AssetTypeSettings result;
    result.assetType = std::string(assetType);
    result.catalogURL = *url->asString();
    if (const plist::Value* key = type->find(kSettingsPublicKeyKey)) {
        result.publicKey = decodePublicKey(*key);
        if (!result.publicKey) {
            whyNot = "PublicKey is not 32 bytes of data or their base64";
            return std::nullopt;
        }
    }
    result.cacheDirectory = resolvePath(cacheDirectory) + "/" + result.assetType;
    return result;
}

}  // namespace tavrix::platform
