#include "catalog/CatalogTrust.h"

#include "device/DaemonStateFile.h"
#include "plist/DateText.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::catalog {
namespace {

constexpr const char* kSerialFilePrefix = "catalog-serial-";
constexpr const char* kHighestSerialKey = "HighestSerial";
constexpr std::size_t kDefaultIdentifierLength = 16;

std::string serialFileName(std::string_view assetType) {
    return kSerialFilePrefix + std::string(assetType) + ".plist";
}

}  // namespace

std::string catalogDateText(plist::Date date) {
    const double seconds = date.secondsSinceReferenceDate;
    return plist::hasDateText(seconds) ? plist::readableDateText(seconds) + " UTC" : "?";
}

std::string defaultKeyIdentifier(const CatalogPublicKey& publicKey) {
    Sha256Digest digest;
    digest.update(
        std::string_view(reinterpret_cast<const char*>(publicKey.data()), publicKey.size()));
    return digest.finishHex().substr(0, kDefaultIdentifierLength);
}

std::optional<CatalogMetadata> readCatalogMetadata(const plist::Value& catalog,
                                                   CatalogRefusal& refusal) {
    CatalogMetadata metadata;
    const plist::Value* serial = catalog.find(kCatalogSerialKey);
    const plist::Integer* number = serial != nullptr ? serial->asInteger() : nullptr;
    if (number == nullptr || number->isLargeUnsigned() || number->signedValue() < 1) {
        refusal = {CatalogRefusalKind::Malformed, "it has no Serial integer from 1"};
        return std::nullopt;
    }
    metadata.serial = number->signedValue();
    const plist::Value* expires = catalog.find(kCatalogExpiresKey);
    if (expires == nullptr || expires->asDate() == nullptr) {
        refusal = {CatalogRefusalKind::Malformed, "it has no Expires date"};
        return std::nullopt;
    }
    metadata.expires = *expires->asDate();
    return metadata;
}

std::optional<std::string> catalogKeyID(const plist::Value& catalog) {
    const plist::Value* keyID = catalog.find(kCatalogKeyIDKey);
    if (keyID == nullptr || keyID->asString() == nullptr) {
        return std::nullopt;
    }
    return *keyID->asString();
}

bool verifyWithTrustedKey(std::string_view bytes, std::string_view signature,
                          const std::optional<std::string>& keyID,
                          const std::vector<TrustedCatalogKey>& keys, CatalogRefusal& refusal) {
    if (!keyID) {
        refusal = {CatalogRefusalKind::UnknownKey, "it names no signing key"};
        return false;
    }
    for (const TrustedCatalogKey& key : keys) {
        if (key.identifier != *keyID) {
            continue;
        }
        if (signature.empty()) {
            refusal = {CatalogRefusalKind::MissingSignature, "it has no signature"};
            return false;
        }
        if (!verifyCatalogSignature(bytes, signature, key.publicKey)) {
            refusal = {CatalogRefusalKind::BadSignature,
                       "its signature does not verify with the key " + *keyID};
            return false;
        }
        return true;
    }
    refusal = {CatalogRefusalKind::UnknownKey,
               "it is signed with the key " + *keyID + ", which is not among the trusted keys"};
    return false;
}

bool checkFreshness(const CatalogMetadata& metadata, plist::Date now,
                    std::optional<std::int64_t> highestAccepted, CatalogRefusal& refusal) {
    if (metadata.expires <= now) {
        refusal = {CatalogRefusalKind::Expired, "it expired at " +
                                                    catalogDateText(metadata.expires) +
                                                    ", it is now " + catalogDateText(now)};
        return false;
    }
    if (highestAccepted && metadata.serial < *highestAccepted) {
        refusal = {CatalogRefusalKind::Rollback, "its serial " + std::to_string(metadata.serial) +
                                                     " is below the serial already accepted, " +
                                                     std::to_string(*highestAccepted)};
        return false;
    }
    return true;
}

std::optional<std::int64_t> readAcceptedSerial(std::string_view assetType) {
    const plist::Dictionary stored = device::readDaemonStateFile(serialFileName(assetType));
    auto serial = stored.find(kHighestSerialKey);
    const plist::Integer* number = serial != stored.end() ? serial->second.asInteger() : nullptr;
    if (number == nullptr || number->isLargeUnsigned()) {
        return std::nullopt;
    }
    return number->signedValue();
}

int recordAcceptedSerial(std::string_view assetType, std::int64_t serial) {
    const plist::Value record(
        plist::Dictionary{{kHighestSerialKey, plist::Value(static_cast<long long>(serial))}});
    return device::writeDaemonStateFile(serialFileName(assetType), record, plist::Format::Xml,
                                        0644);
}

}  // namespace tavrix::catalog
