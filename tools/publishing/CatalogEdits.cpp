#include "publishing/CatalogEdits.h"

#include <cstdio>
#include <functional>

#include "catalog/AssetCatalogFormat.h"

namespace tavrix::tools {
namespace {

bool hasVersion(const plist::Value& entry, const std::string& version) {
    const plist::Value* attributes = entry.find(catalog::kCatalogAttributesKey);
    const plist::Value* listed = attributes != nullptr ? attributes->find("Version") : nullptr;
    return listed != nullptr && listed->asString() != nullptr && *listed->asString() == version;
}

// Applies change to the served catalog's assets and completes the result. change answers false
// when it found nothing to change.
Result<> editCatalog(const std::string& site, const Completion& completion,
                     const std::function<bool(plist::Array& assets)>& change,
                     const std::string& nothingToChange) {
    if (Result<> open = refuseWhileStaged(site); !open) {
        return open;
    }
    Result<plist::Dictionary> catalog = readServedCatalog(site);
    if (!catalog) {
        return catalog.failure();
    }
    auto assets = catalog->find(catalog::kCatalogAssetsKey);
    if (assets == catalog->end() || assets->second.asArray() == nullptr) {
        return Failure{site + "/" + kCatalogFileName + " has no Assets array"};
    }
    plist::Array entries = *assets->second.asArray();
    if (!change(entries)) {
        return Failure{nothingToChange};
    }
    assets->second = plist::Value(std::move(entries));
    return completeCatalog(site, std::move(*catalog), completion);
}

}  // namespace

Result<> refreshCatalog(const std::string& site, const Completion& completion) {
    return editCatalog(site, completion, [](plist::Array&) { return true; }, {});
}

Result<> withdrawVersion(const std::string& site, const std::string& version,
                         const Completion& completion) {
    return editCatalog(
        site, completion,
        [&](plist::Array& assets) {
            return std::erase_if(assets, [&](const plist::Value& entry) {
                       return hasVersion(entry, version);
                   }) > 0;
        },
        "the catalog lists no version " + version);
}

Result<> setRollout(const std::string& site, const std::string& version, int percent,
                    const Completion& completion) {
    return editCatalog(
        site, completion,
        [&](plist::Array& assets) {
            bool found = false;
            for (plist::Value& entry : assets) {
                plist::Dictionary* fields = entry.asDictionary();
                if (fields == nullptr || !hasVersion(entry, version)) {
                    continue;
                }
                found = true;
                if (percent >= 100) {
                    fields->erase(catalog::kCatalogRolloutPercentKey);
                } else {
                    fields->insert_or_assign(catalog::kCatalogRolloutPercentKey,
                                             plist::Value(percent));
                }
            }
            return found;
        },
        "the catalog lists no version " + version);
}

}  // namespace tavrix::tools
