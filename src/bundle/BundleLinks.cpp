#include "bundle/BundleLinks.h"

#include <libgen.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "bundle/BundleInfo.h"
#include "device/HomeDirectories.h"
#include "io/Directory.h"
#include "io/Paths.h"
#include "util/Log.h"

namespace tavrix {
namespace {

constexpr std::size_t kPathBufferSize = 1024;

// Copies path into buffer, cut at kPathBufferSize - 1 bytes, for the POSIX calls that may write
// into their argument.
void copyCut(const std::string& path, char (&buffer)[kPathBufferSize]) {
    std::size_t length = std::min(path.size(), kPathBufferSize - 1);
    std::memcpy(buffer, path.data(), length);
    buffer[length] = '\0';
}

// The new link is made under a temporary name beside linkPath and renamed over whatever is there,
// so that a reader (or a crash) finds the old link or the new one, never none; the directory is
// flushed, so that after a power cut the links come back in the order they were written. An
// empty directory in the way goes, as a plain remove would take it; one that holds something
// stays and fails.
bool linkPathTo(const std::string& linkPath, const std::string& target) {
    bool linked = false;
    if (!linkPath.empty()) {
        auto directory = device::openMobileHomeDirectory(dirNameOfPath(linkPath), true);
        linked = directory && directory->replaceSymlink(baseNameOfPath(linkPath), target) == 0;
    }
    if (!linked) {
        logCFormat(LogPriority::Warning, "Failed to establish link from %s to %s\n",
                   linkPath.c_str(), target.c_str());
        return false;
    }
    return true;
}

bool linkBundle(CarrierBundle& bundle) {
    logCFormat("Establishing bundle %s. Symlink points to %s\n", bundle.bundleLinkPath.c_str(),
               bundle.bundlePath.c_str());
    if (!linkPathTo(bundle.bundleLinkPath, bundle.bundlePath)) {
        return false;
    }
    if (readLinkTarget(bundle.bundleLinkPath) != bundle.bundlePath) {
        logCFormat(LogPriority::Warning,
                   "Problem linking the bundle, %s does not link to %s, instead it links to %s\n",
                   bundle.bundleLinkPath.c_str(), bundle.bundlePath.c_str(),
                   readLinkTarget(bundle.bundleLinkPath).c_str());
        return false;
    }
    logCFormat("Establishing pref %s. Symlink points to %s\n", bundle.preferencesLinkPath.c_str(),
               bundle.carrierFilePath.c_str());
    if (!linkPathTo(bundle.preferencesLinkPath, bundle.carrierFilePath)) {
        return false;
    }
    bool linked = readLinkTarget(bundle.preferencesLinkPath) == bundle.carrierFilePath;
    // The version is re-read only for a bundle that is fully linked.
    bundle.bundleVersion.clear();
    if (linked) {
        bundle.bundleVersion = bundleInfoValueText(copyBundleVersionAtPath(bundle.bundlePath));
    }
    return linked;
}

}  // namespace

bool establishBundleLinks(CarrierBundle& bundle, const std::string& bundleLink,
                          const std::string& preferencesLink) {
    bundle.bundleLinkPath = bundleLink;
    bundle.preferencesLinkPath = preferencesLink;
    bool linked = linkBundle(bundle);
    logCFormat("Dump state of the bundle being linked\n");
    return linked;
}

bool isDaemonLink(const std::string& linkPath) {
    if (linkPath.empty()) {
        return false;
    }
    auto directory = device::openMobileHomeDirectory(dirNameOfPath(linkPath), false);
    if (!directory) {
        return false;
    }
    auto entry = directory->entryStatus(baseNameOfPath(linkPath));
    if (!entry) {
        return false;
    }
    if (!S_ISLNK(entry->st_mode)) {
        device::logDistrustOnce(linkPath, "it is not a symbolic link");
        return false;
    }
    if (!io::isTrustedOwner(entry->st_uid)) {
        device::logDistrustOnce(linkPath, "it belongs to user " + std::to_string(entry->st_uid));
        return false;
    }
    return true;
}

bool linksDisagree(const CarrierBundle& linked, const std::string& overlayDirectory) {
    const std::string bundle = io::realPathOf(linked.bundleLinkPath);
    if (io::kindOfPath(bundle) != io::PathKind::Directory) {
        return false;
    }
    const std::string carrierFile = io::realPathOf(linked.preferencesLinkPath);
    if (io::kindOfPath(carrierFile) != io::PathKind::RegularFile) {
        return false;
    }
    auto inside = [&carrierFile](const std::string& directory) {
        return !directory.empty() && carrierFile.starts_with(directory + "/");
    };
    return !inside(bundle) &&
           (overlayDirectory.empty() || !inside(io::realPathOf(overlayDirectory)));
}

std::string baseNameOfPath(const std::string& path) {
    char buffer[kPathBufferSize];
    copyCut(path, buffer);
    return basename(buffer);
}

std::string dirNameOfPath(const std::string& path) {
    char buffer[kPathBufferSize];
    copyCut(path, buffer);
    return dirname(buffer);
}

std::string readLinkTarget(const std::string& path) {
    std::string target = io::readLinkTarget(path).value_or(std::string());
    if (target.size() > kPathBufferSize - 1) {
        target.resize(kPathBufferSize - 1);
    }
    return target;
}

}  // namespace tavrix
