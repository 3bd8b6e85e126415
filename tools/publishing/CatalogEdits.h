// Changes to a published catalog that need no packing: a new expiry, a version withdrawn, a
// rollout widened or narrowed. Each makes a new catalog from the one served, with the next serial,
// and completes it like a publication.
#pragma once

#include <optional>
#include <string>

#include "publishing/CatalogSite.h"

namespace tavrix::tools {

// The same assets under a new serial and expiry.
Result<> refreshCatalog(const std::string& site, const Completion& completion);

// Every asset of version left out. An error when the catalog lists none.
Result<> withdrawVersion(const std::string& site, const std::string& version,
                         const Completion& completion);

// Every asset of version offered to percent of the devices (100: all). An error when the catalog
// lists none.
Result<> setRollout(const std::string& site, const std::string& version, int percent,
                    const Completion& completion);

}  // namespace tavrix::tools
