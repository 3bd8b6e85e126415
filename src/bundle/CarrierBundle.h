// One bundle and the carrier file chosen in it: a plain value, copied whole.
#pragma once

#include <string>

#include "bundle/BundleTypes.h"

namespace tavrix {

struct CarrierBundle {
    // The bundle directory (for a linked bundle: the bundle link's text as stored).
    std::string bundlePath;
    // bundlePath fully resolved; empty when it cannot be resolved.
    std::string bundleRealPath;
    // The home-directory links pointing at the bundle and at the carrier file; set only when the
    // record was read from, or written to, the links.
    std::string bundleLinkPath;
    std::string preferencesLinkPath;
    // Which overlays the carrier file carries.
    OverlayType overlayType = kNoOverlay;
    // The carrier property list the preferences link points at.
    std::string carrierFilePath;
    // "QZBundleVersion" of the bundle at bundlePath as text; empty when unknown.
    std::string bundleVersion;

    // Empties every field (logs "Resetting bundle object").
    void reset();
    // reset, then describes the bundle at path (real path and version read from disk).
    void resetWithPath(const std::string& path);
    // Reads the bundle fields from the two links; carrierFilePath and overlayType stay as they are.
    void initFromLinks(const std::string& bundleLink, const std::string& preferencesLink);
    // The last component of bundlePath ("Default.bundle"), empty when bundlePath is.
    std::string bundleName() const;
    // "QZBundleIdentifier" of the bundle at bundlePath, empty when absent or not a string.
    std::string copyBundleIdentifier() const;
};

}  // namespace tavrix
