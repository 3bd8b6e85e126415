// Getting a verified catalog for one asset type: from its server, or from the copy of the last
// catalog that verified, kept in the type's cache directory for queries that stay local.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/AssetCatalogFormat.h"
#include "platform/AssetCatalogSettings.h"

namespace tavrix::platform {

// The catalog's entries. From the server (localOnly false) the catalog and, with a key
// configured, its signature are fetched and verified, and the pair is kept as the local copy.
// Locally, the kept copy is verified again with the current key; no copy yet answers no entries.
// Nothing, with whyNot saying why, when the catalog cannot be had or is refused.
std::optional<std::vector<CatalogEntry>> loadCatalogEntries(const AssetTypeSettings& settings,
                                                            bool localOnly, std::string& whyNot);

}  // namespace tavrix::platform
