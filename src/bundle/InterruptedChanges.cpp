#include "bundle/InterruptedChanges.h"

#include <algorithm>
#include <optional>
#include <vector>

#include "bundle/BundleInfo.h"
#include "bundle/BundleLinks.h"
#include "bundle/BundleLocations.h"
#include "bundle/BundleTypes.h"
#include "bundle/OverriddenCarrierFile.h"
#include "device/HomeDirectories.h"
#include "device/PlatformRoot.h"
#include "io/Directory.h"
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

// Removes the abandoned temporaries of the daemon's user in directory, and the entry named
// staged when it is the daemon's user's: only what the daemon wrote, in a directory others may
// write in too.
void removeOwnLeftovers(const std::optional<io::Directory>& directory,
                        std::string_view staged = {}) {
    std::vector<std::string> names;
    if (!directory || readDirectoryNames(directory->path(), names) != 0) {
        return;
    }
    for (const std::string& name : names) {
        auto entry = directory->entryStatus(name);
        const bool leftover = name == staged ? entry && io::isOwnUser(entry->st_uid)
                                             : io::isAbandonedTemporary(*directory, name);
        if (leftover && directory->removeEntry(name) == 0) {
            logCFormat("Removed %s, left by an interrupted change\n",
                       directory->pathOf(name).c_str());
        }
    }
}

std::optional<io::Directory> openDirectory(const std::string& path) {
    int error = 0;
    return io::Directory::open(path, io::Directory::LastLink::Follow, &error);
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
            removeOwnLeftovers(device::openMobileHomeDirectory(dirNameOfPath(link), false));
        }
    }
    std::string overlays = overriddenFilesDirectory();
    if (!overlays.empty()) {
        overlays.pop_back();
        removeOwnLeftovers(device::openMobileHomeDirectory(overlays, false));
    }
    const std::string staged = device::resolvePath(payload::kBundleArchiveTempPath);
    const auto temporary = openDirectory(dirNameOfPath(staged));
    removeOwnLeftovers(temporary, baseNameOfPath(staged));
    if (const std::string& userBundle = userBundleLocation(); !userBundle.empty()) {
        if (device::openMobileHomeDirectory(dirNameOfPath(userBundle), false)) {
            removeLeftover(payload::extractionStagingPathFor(userBundle));
        }
    }
}

void pruneOverriddenFilesOfRemovedBundles(const std::string& keep) {
    std::string overlays = overriddenFilesDirectory();
    std::vector<std::string> names;
    if (overlays.empty() ||
        !device::openMobileHomeDirectory(overlays.substr(0, overlays.size() - 1), false) ||
        readDirectoryNames(overlays, names) != 0) {
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
