// The device root that the unit-test process runs under (TAVRIX_ROOT).
#pragma once

#include <filesystem>

#include "plist/Value.h"

namespace tavrix::test {

// Created on first use: etc/passwd with "mobile" (home /var/mobile, the test's own uid and gid).
const std::filesystem::path& unitTestRoot();

// Replaces the device table (etc/tavrix/DeviceInfo.plist) by rename, so that every version is a
// new file to its cache.
void writeDeviceTable(const plist::Dictionary& table);

}  // namespace tavrix::test
