// The device root that the unit-test process runs under (TAVRIX_ROOT).
#pragma once

#include <filesystem>

namespace tavrix::test {

// Created on first use: etc/passwd with "mobile" (home /var/mobile, the test's own uid and gid).
const std::filesystem::path& unitTestRoot();

}  // namespace tavrix::test
