// Staged rollouts: an asset released to a share of the fleet first. Whether a device takes part
// is a stable hash of its serial number and the asset's version, so the same device decides the
// same way on every query, and raising the share only adds devices.
#pragma once

#include <string_view>

namespace tavrix::catalog {

// The device's place in the rollout of this version, from 0 to 99.
int rolloutBucket(std::string_view deviceSerialNumber, std::string_view version);

// True when the device is among the first percent of devices for this version. A device whose
// serial number is unknown takes part only in full releases, so that unknown devices do not all
// fall into one bucket together.
bool takesPartInRollout(std::string_view deviceSerialNumber, std::string_view version, int percent);

}  // namespace tavrix::catalog
