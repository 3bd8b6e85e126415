#include "bundle/InterruptedChanges.h"

#include <algorithm>
#include <vector>

#include "bundle/BundleInfo.h"
#include "bundle/BundleLinks.h"
#include "bundle/BundleLocations.h"
#include "bundle/BundleTypes.h"
#include "bundle/OverriddenCarrierFile.h"
#include "device/PlatformRoot.h"
#include "io/AtomicFile.h"
#include "payload/PayloadUnpack.h"
#include "util/FileSystemUtilities.h"
#include "util/Log.h"

namespace tavrix {
namespace {

constexpr std::string_view kPropertyListExtension = ".plist";

void removeLeftover(const std::string& path) {
    if (removeItemTree(path) == 0) {
        logCFormat("Removed %s, left by an interrupted change\n", path.c_str());
    }
}

// Removes the entries of directory whose names start with prefix.
void removeEntriesStartingWith(const std::string& directory, std::string_view prefix) {
    std::vector<std::string> names;
    if (directory.empty() || readDirectoryNames(directory, names) != 0) {
        return;
    }
    for (const std::string& name : names) {
        if (name.starts_with(prefix)) {
            removeLeftover(directory + "/" + name);
        }
    }
}

// The bundle version a generated file's name ends with ("...+<version>.plist"), or empty.
std::string versionInFileName(const std::string& name) {
    if (!name.ends_with(kPropertyListExtension)) {
        return {};
    }
    std::string stem = name.substr(0, name.size() - kPropertyListExtension.size());
    std::size_t separator = stem.rfind('+');
    return separator == std::string::npos ? std::string() : stem.substr(separator + 1);
}

}  // namespace

void removeLeftoversOfInterruptedChanges(const std::string& bundleLink,
                                         const std::string& preferencesLink) {
    for (const std::string& link : {bundleLink, preferencesLink}) {
        if (!link.empty()) {
            removeEntriesStartingWith(dirNameOfPath(link), kLinkTemporaryPrefix);
        }
    }
    std::string overlays = overriddenFilesDirectory();
    if (!overlays.empty()) {
        overlays.pop_back();
        removeEntriesStartingWith(overlays, io::kAtomicWritePrefix);
    }
    const std::string staged = device::resolvePath(payload::kBundleArchiveTempPath);
    removeLeftover(staged);
    removeEntriesStartingWith(dirNameOfPath(staged), io::kAtomicWritePrefix);
    if (const std::string& userBundle = userBundleLocation(); !userBundle.empty()) {
        removeLeftover(payload::extractionStagingPathFor(userBundle));
    }
}

void pruneOverriddenFilesOfRemovedBundles(const std::string& keep) {
    std::string overlays = overriddenFilesDirectory();
    std::vector<std::string> names;
    if (overlays.empty() || readDirectoryNames(overlays, names) != 0) {
        return;
    }
    std::vector<std::string> installed;
    for (const std::string& location : {systemBundleLocation(), userBundleLocation()}) {
        if (!location.empty()) {
            std::string version = bundleInfoValueText(copyBundleVersionAtPath(location));
            if (!version.empty()) {
                installed.push_back(std::move(version));
            }
        }
    }
    for (const std::string& name : names) {
        const std::string path = overlays + name;
        if (overlayTypeOfCarrierFileName(name) == kNoOverlay || path == keep) {
            continue;
        }
        const std::string version = versionInFileName(name);
        if (version.empty() ||
            std::find(installed.begin(), installed.end(), version) != installed.end()) {
            continue;
        }
        if (removeItemTree(path) == 0) {
            logCFormat("Removed the overridden carrier file %s of a bundle no longer installed\n",
                       path.c_str());
        }
    }
}

}  // namespace tavrix
