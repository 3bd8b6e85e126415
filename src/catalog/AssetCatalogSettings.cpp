#include "catalog/AssetCatalogSettings.h"

#include <algorithm>
#include <cstring>

#include "device/PlatformRoot.h"

namespace tavrix::catalog {
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

// A key that cannot be read refuses the whole type rather than quietly trusting fewer keys.
bool readTrustedKeys(const plist::Value& type, std::vector<TrustedCatalogKey>& keys,
                     std::string& whyNot) {
    if (const plist::Value* single = type.find(kSettingsPublicKeyKey)) {
        std::optional<CatalogPublicKey> key = decodePublicKey(*single);
        if (!key) {
            whyNot = "PublicKey is not 32 bytes of data or their base64";
            return false;
        }
        keys.push_back({defaultKeyIdentifier(*key), *key});
    }
    const plist::Value* listed = type.find(kSettingsTrustedKeysKey);
    if (listed == nullptr) {
        return true;
    }
    if (!listed->isDictionary()) {
        whyNot = "TrustedKeys is not a dictionary";
        return false;
    }
    for (const auto& [identifier, value] : *listed->asDictionary()) {
        std::optional<CatalogPublicKey> key = decodePublicKey(value);
        if (identifier.empty() || !key) {
            whyNot =
                "TrustedKeys entry \"" + identifier + "\" is not 32 bytes of data or their base64";
            return false;
        }
        keys.push_back({identifier, *key});
    }
    return true;
}

// Sets target from the integer under key, when present. False, with whyNot, when it is no integer
// between minimum and maximum.
template <typename Number>
bool readLimit(const plist::Value& settings, const char* key, std::uint64_t minimum,
               std::uint64_t maximum, Number& target, std::string& whyNot) {
    const plist::Value* value = settings.find(key);
    if (value == nullptr) {
        return true;
    }
    const plist::Integer* number = value->asInteger();
    if (number == nullptr || (!number->isLargeUnsigned() && number->signedValue() < 0) ||
        number->unsignedValue() < minimum || number->unsignedValue() > maximum) {
        whyNot = std::string(key) + " is not an integer from " + std::to_string(minimum) + " to " +
                 std::to_string(maximum);
        return false;
    }
    target = static_cast<Number>(number->unsignedValue());
    return true;
}

// A day: no transfer of a catalog or bundle has a reason to take longer.
constexpr std::uint64_t kMaxSeconds = 86400;

bool readLimits(const plist::Value& settings, AssetLimits& limits, std::string& whyNot) {
    return readLimit(settings, kSettingsMaxExpandedBytesKey, 1, UINT64_MAX, limits.maxExpandedBytes,
                     whyNot) &&
           readLimit(settings, kSettingsMaxArchiveEntriesKey, 1, UINT64_MAX,
                     limits.maxArchiveEntries, whyNot) &&
           readLimit(settings, kSettingsFreeSpaceReserveKey, 0, UINT64_MAX,
                     limits.freeSpaceReserveBytes, whyNot) &&
           readLimit(settings, kSettingsConnectTimeoutKey, 1, kMaxSeconds,
                     limits.connectTimeoutSeconds, whyNot) &&
           readLimit(settings, kSettingsLowSpeedBytesKey, 1, UINT32_MAX,
                     limits.lowSpeedBytesPerSecond, whyNot) &&
           readLimit(settings, kSettingsLowSpeedSecondsKey, 1, kMaxSeconds, limits.lowSpeedSeconds,
                     whyNot) &&
           readLimit(settings, kSettingsCatalogTimeoutKey, 1, kMaxSeconds,
                     limits.catalogTimeoutSeconds, whyNot) &&
           readLimit(settings, kSettingsArchiveTimeoutKey, 1, kMaxSeconds,
                     limits.archiveTimeoutSeconds, whyNot);
}

}  // namespace

http::HttpTransferLimits AssetLimits::archiveTransfer() const {
    return {connectTimeoutSeconds, lowSpeedBytesPerSecond, lowSpeedSeconds,
            archiveTimeoutSeconds * 1000};
}

http::HttpTransferLimits AssetLimits::catalogTransfer(long remainingMilliseconds) const {
    return {connectTimeoutSeconds, lowSpeedBytesPerSecond, lowSpeedSeconds,
            std::max(remainingMilliseconds, 1L)};
}

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
    if (!readLimits(settings, result.limits, whyNot)) {
        return std::nullopt;
    }
    result.assetType = std::string(assetType);
    result.catalogURL = *url->asString();
    if (!readTrustedKeys(*type, result.trustedKeys, whyNot)) {
        return std::nullopt;
    }
    if (const plist::Value* allow = type->find(kSettingsAllowUnsignedKey)) {
        if (allow->asBoolean() == nullptr) {
            whyNot = "AllowUnsigned is not a boolean";
            return std::nullopt;
        }
        result.allowUnsigned = *allow->asBoolean();
    }
    result.cacheDirectory = device::resolvePath(cacheDirectory) + "/" + result.assetType;
    return result;
}

}  // namespace tavrix::catalog
