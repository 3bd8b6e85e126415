// What a published catalog holds, for the operator: serial, expiry, key and each asset with its
// rollout, as the catalog says it (nothing is verified here; that is `verify`).
#pragma once

#include <string>

#include "base/Result.h"

namespace tavrix::tools {

// Prints the catalog at source (a URL or a site directory) on stdout; for a directory, also a
// catalog waiting for its signature.
Result<> showCatalog(const std::string& source);

}  // namespace tavrix::tools
