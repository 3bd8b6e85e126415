// Where the two behavior bundles live: the read-only system bundle chosen by the device class,
// and the user bundle the daemon installs into the mobile user's home. Both are absolute paths
// under the platform root.
#pragma once

#include <string>

#include "bundle/BundleKeys.h"

namespace tavrix {

inline constexpr const char* kSystemBundlesDirectory = "/System/Library/TavrixBundles/";
inline constexpr const char* kUserBundlesDirectory = "/Library/TavrixBundles/";
inline constexpr const char* kDefaultBundleName = "Default.bundle";

struct BundleLocations {
    std::string system;
    std::string user;
};

// Computes both locations once per process and logs them; later calls do nothing.
void initializeBundleLocations();

// The locations; initializeBundleLocations runs first when it has not yet. The user location is
// empty when the mobile user's home directory is unknown: nothing may then be installed there.
const std::string& systemBundleLocation();
const std::string& userBundleLocation();

}  // namespace tavrix
