#include "catalog/CatalogRollout.h"

#include <string>

#include "catalog/CatalogCrypto.h"

namespace tavrix::catalog {

int rolloutBucket(std::string_view deviceSerialNumber, std::string_view version) {
    Sha256Digest digest;
    // The separator keeps ("ab", "c") and ("a", "bc") apart.
    digest.update(deviceSerialNumber);
    digest.update(std::string_view("\n", 1));
    digest.update(version);
    std::string hex = digest.finishHex();
    return static_cast<int>(std::stoull(hex.substr(0, 16), nullptr, 16) % 100);
}

bool takesPartInRollout(std::string_view deviceSerialNumber, std::string_view version,
                        int percent) {
    if (percent >= 100) {
        return true;
    }
    if (deviceSerialNumber.empty()) {
        return false;
    }
    return rolloutBucket(deviceSerialNumber, version) < percent;
}

}  // namespace tavrix::catalog
