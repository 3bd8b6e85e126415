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
Result<> readTrustedKeys(const plist::Value& type, std::vector<TrustedCatalogKey>& keys) {
    if (const plist::Value* single = type.find(kSettingsPublicKeyKey)) {
        std::optional<CatalogPublicKey> key = decodePublicKey(*single);
        if (!key) {
            return Failure{"PublicKey is not 32 bytes of data or their base64"};
        }
        keys.push_back({defaultKeyIdentifier(*key), *key});
    }
    const plist::Value* listed = type.find(kSettingsTrustedKeysKey);
    if (listed == nullptr) {
        return {};
    }
    if (!listed->isDictionary()) {
        return Failure{"TrustedKeys is not a dictionary"};
    }
    for (const auto& [identifier, value] : *listed->asDictionary()) {
        std::optional<CatalogPublicKey> key = decodePublicKey(value);
        if (identifier.empty() || !key) {
            return Failure{"TrustedKeys entry \"" + identifier +
                           "\" is not 32 bytes of data or their base64"};
        }
        keys.push_back({identifier, *key});
    }
    return {};
}

// Sets target from the integer under key, when present. Fails when it is no integer between
// minimum and maximum.
template <typename Number>
Result<> readLimit(const plist::Value& settings, const char* key, std::uint64_t minimum,
                   std::uint64_t maximum, Number& target) {
    const plist::Value* value = settings.find(key);
    if (value == nullptr) {
        return {};
    }
    const plist::Integer* number = value->asInteger();
    if (number == nullptr || (!number->isLargeUnsigned() && number->signedValue() < 0) ||
        number->unsignedValue() < minimum || number->unsignedValue() > maximum) {
        return Failure{std::string(key) + " is not an integer from " + std::to_string(minimum) +
                       " to " + std::to_string(maximum)};
    }
    target = static_cast<Number>(number->unsignedValue());
    return {};
}

// A day: no transfer of a catalog or bundle has a reason to take longer.
constexpr std::uint64_t kMaxSeconds = 86400;

Result<> readLimits(const plist::Value& settings, AssetLimits& limits) {
    for (Result<> limit :
         {readLimit(settings, kSettingsMaxExpandedBytesKey, 1, UINT64_MAX, limits.maxExpandedBytes),
          readLimit(settings, kSettingsMaxArchiveEntriesKey, 1, UINT64_MAX,
                    limits.maxArchiveEntries),
          readLimit(settings, kSettingsFreeSpaceReserveKey, 0, UINT64_MAX,
                    limits.freeSpaceReserveBytes),
          readLimit(settings, kSettingsConnectTimeoutKey, 1, kMaxSeconds,
                    limits.connectTimeoutSeconds),
          readLimit(settings, kSettingsLowSpeedBytesKey, 1, UINT32_MAX,
                    limits.lowSpeedBytesPerSecond),
          readLimit(settings, kSettingsLowSpeedSecondsKey, 1, kMaxSeconds, limits.lowSpeedSeconds),
          readLimit(settings, kSettingsCatalogTimeoutKey, 1, kMaxSeconds,
                    limits.catalogTimeoutSeconds),
          readLimit(settings, kSettingsArchiveTimeoutKey, 1, kMaxSeconds,
                    limits.archiveTimeoutSeconds)}) {
        if (!limit) {
            return limit;
        }
    }
    return {};
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

Result<AssetTypeSettings> parseAssetTypeSettings(const plist::Value& settings,
                                                 std::string_view assetType) {
    if (!settings.isDictionary()) {
        return Failure{"the settings are not a dictionary"};
    }
    if (!isPathComponent(assetType)) {
        return Failure{"the asset type is not a valid name"};
    }
    std::string cacheDirectory = kDefaultAssetCacheDirectory;
    if (const plist::Value* configured = settings.find(kSettingsCacheDirectoryKey)) {
        const std::string* path = configured->asString();
        if (path == nullptr || path->empty() || path->front() != '/') {
            return Failure{"CacheDirectory is not an absolute path"};
        }
        cacheDirectory = *path;
    }
    const plist::Value* types = settings.find(kSettingsAssetTypesKey);
    const plist::Value* type = types != nullptr ? types->find(assetType) : nullptr;
    if (type == nullptr || !type->isDictionary()) {
        return Failure{"no settings for this asset type"};
    }
    const plist::Value* url = type->find(kSettingsCatalogURLKey);
    if (url == nullptr || url->asString() == nullptr || url->asString()->empty()) {
        return Failure{"no CatalogURL for this asset type"};
    }
    AssetTypeSettings result;
    if (Result<> limits = readLimits(settings, result.limits); !limits) {
        return limits.failure();
    }
    result.assetType = std::string(assetType);
    result.catalogURL = *url->asString();
    if (Result<> keys = readTrustedKeys(*type, result.trustedKeys); !keys) {
        return keys.failure();
    }
    if (const plist::Value* allow = type->find(kSettingsAllowUnsignedKey)) {
        if (allow->asBoolean() == nullptr) {
            return Failure{"AllowUnsigned is not a boolean"};
        }
        result.allowUnsigned = *allow->asBoolean();
    }
    result.cacheDirectory = device::resolvePath(cacheDirectory) + "/" + result.assetType;
    return result;
}

}  // namespace tavrix::catalog
