#include "bundle/CarrierBundle.h"

#include "bundle/BundleInfo.h"
#include "bundle/BundleLinks.h"
#include "io/Paths.h"
#include "util/Log.h"

namespace tavrix {

void CarrierBundle::reset() {
    logCFormat("Resetting bundle object\n");
    *this = CarrierBundle{};
}

void CarrierBundle::resetWithPath(const std::string& path) {
    // path may be this record's own bundlePath, which reset() empties.
    std::string kept = path;
    reset();
    bundlePath = std::move(kept);
    bundleRealPath = io::realPathOf(bundlePath);
    bundleVersion = bundleInfoValueText(copyBundleVersionAtPath(bundlePath));
}

void CarrierBundle::initFromLinks(const std::string& bundleLink,
                                  const std::string& preferencesLink) {
    bundleLinkPath = bundleLink;
    // The link's own text, so that a later comparison sees exactly what was linked.
    bundlePath = readLinkTarget(bundleLink);
    bundleRealPath = io::realPathOf(bundleLink);
    bundleVersion = bundleInfoValueText(copyBundleVersionAtPath(bundlePath));
    preferencesLinkPath = preferencesLink;
}

std::string CarrierBundle::bundleName() const {
    return bundlePath.empty() ? std::string() : baseNameOfPath(bundlePath);
}

std::string CarrierBundle::copyBundleIdentifier() const {
    return copyBundleIdentifierAtPath(bundlePath).value_or("");
}

}  // namespace tavrix
