#include "bundle/BundleLocations.h"

#include "device/MobileUser.h"
#include "device/PlatformRoot.h"
#include "device/TXUtility.h"
#include "util/Log.h"
#include "util/SharedInstance.h"

namespace tavrix {
namespace {

BundleLocations computeLocations() {
    const std::optional<std::string>& deviceClass = TXUtility::currentProductCategory();
    BundleLocations computed;
    computed.system = device::resolvePath(std::string(kSystemBundlesDirectory) +
                                          deviceClass.value_or("") + "/" + kDefaultBundleName);
    // Without a known home there is no user bundle; an empty location keeps every install and
    // removal away from paths outside the device root.
    if (const char* home = device::MobileUser::homeDirectory()) {
        computed.user = std::string(home) + kUserBundlesDirectory + kDefaultBundleName;
    }
    return computed;
}

// Computed and logged by the first caller from any thread; fixed for the root's life.
const BundleLocations& locations() {
    return SharedInstance<BundleLocations>::current().instance([] {
        logCFormat("Initializing Carrier Bundle Locations\n");
        auto computed = std::make_unique<BundleLocations>(computeLocations());
        logCFormat("Using %s and %s for respective locations\n", computed->system.c_str(),
                   computed->user.c_str());
        return computed;
    });
}

}  // namespace

void initializeBundleLocations() {
    locations();
}

const std::string& systemBundleLocation() {
    initializeBundleLocations();
    return locations().system;
}

const std::string& userBundleLocation() {
    initializeBundleLocations();
    return locations().user;
}

}  // namespace tavrix
