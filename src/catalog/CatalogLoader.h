// Getting a verified catalog for one asset type: from its server, or from the copy of the last
// catalog that verified, kept in the type's cache directory for queries that stay local. Every
// way a catalog can be refused is decided here and answered as a CatalogRefusal.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "catalog/AssetCatalogFormat.h"
#include "catalog/AssetCatalogSettings.h"
#include "catalog/CatalogRefusal.h"

namespace tavrix::catalog {

// The catalog's entries. From the server (localOnly false) the catalog and its signature are
// fetched and verified with the trusted key the catalog names, checked against its expiry and
// the highest serial taken before, and then kept as the local copy with their serial recorded.
// Locally, the kept copy goes through the same checks with the current keys and time; no copy
// yet answers no entries. Without trusted keys only AllowUnsigned lets a catalog through.
// Nothing, with refusal saying why, when the catalog cannot be had or is refused; the kept copy
// is then left as it was.
std::optional<std::vector<CatalogEntry>> loadCatalogEntries(const AssetTypeSettings& settings,
                                                            bool localOnly,
                                                            CatalogRefusal& refusal);

}  // namespace tavrix::catalog
