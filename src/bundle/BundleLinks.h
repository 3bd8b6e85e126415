// The two links in the mobile user's home that make a bundle and its carrier file current, and
// the small path helpers the bundle core uses everywhere. None of the helpers logs.
#pragma once

#include <string>

#include "bundle/CarrierBundle.h"

namespace tavrix {

// Points bundleLink at bundle.bundlePath and preferencesLink at bundle.carrierFilePath (each
// replacing what was there, by rename inside the link's protected directory), verifies both and
// re-reads the bundle version. The record takes the two link paths. True when both links are in
// place.
bool establishBundleLinks(CarrierBundle& bundle, const std::string& bundleLink,
                          const std::string& preferencesLink);

// Whether the two links read at start-up both resolve but describe two linked states: the
// carrier file lies neither inside the linked bundle nor inside overlayDirectory (the generated
// files). A crash between the two link changes leaves such a pair. Links that do not resolve are
// the comparison's to judge.
bool linksDisagree(const CarrierBundle& linked, const std::string& overlayDirectory);

// Whether the link at linkPath is one the daemon made: a symbolic link of root or the daemon's
// user in a protected directory of the mobile home. Anything else there (logged once) is treated
// as no link, and replaced at the next linking.
bool isDaemonLink(const std::string& linkPath);

// POSIX basename / dirname of the path (cut at 1023 bytes); "." for an empty path.
std::string baseNameOfPath(const std::string& path);
std::string dirNameOfPath(const std::string& path);
// A symbolic link's text (at most 1023 bytes), or empty when path is no readable link.
std::string readLinkTarget(const std::string& path);

}  // namespace tavrix
