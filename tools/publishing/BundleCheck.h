// What makes a directory worth packing as a behavior bundle: an Info dictionary naming the bundle
// and its version, and a base carrier file. A bundle without them installs but can never be
// matched, and a published version that differs from the bundle's own makes every later update
// check download it again; so the tools refuse such a directory before packing it.
#pragma once

#include <optional>
#include <string>

#include "base/Result.h"

namespace tavrix::tools {

struct BundleIdentity {
    std::string identifier;
    std::string version;
};

// The identity read from directory's Info.plist; a failure is one line naming the file and what
// is wrong with it.
Result<BundleIdentity> checkBundleDirectory(const std::string& directory);

}  // namespace tavrix::tools
