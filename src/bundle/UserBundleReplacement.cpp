#include "bundle/UserBundleReplacement.h"

#include <cerrno>
#include <cstring>

#include "bundle/BundleLocations.h"
#include "bundle/BundleManager.h"
#include "device/HomeDirectories.h"
#include "io/Paths.h"
#include "payload/PayloadUnpack.h"
#include "util/FileSystemUtilities.h"
#include "util/Log.h"

namespace tavrix {

Result<> BundleManager::replaceUserBundle(const UserBundleFill& fill) {
    std::lock_guard lock(operationLock_);
    const std::string& bundle = userBundleLocation();
    if (bundle.empty()) {
        // Removing or extracting relative to an unknown home could touch anything.
        logCFormat(
            "Not installing the behavior bundle: the home directory of the mobile user is "
            "unknown\n");
        return Failure{"the mobile user's home directory is unknown"};
    }
    // Everything below happens by path inside this directory, which nobody else can rearrange.
    const auto bundles = device::openMobileHomeDirectory(io::parentDirectory(bundle), true);
    if (!bundles) {
        const Failure failure{"the bundle directory " + io::parentDirectory(bundle) +
                              " is not the daemon's own"};
        logCFormat("Not installing the behavior bundle: %s\n", failure.reason.c_str());
        return failure;
    }
    const std::string staging = payload::extractionStagingPathFor(bundle);
    // A fill into what an earlier attempt left would mix the two bundles.
    if (int error = removeItemTree(staging); error != 0 && error != ENOENT) {
        logCFormat(LogPriority::Warning,
                   "Could not clear the staging directory %s (error %d), keeping the old bundle\n",
                   staging.c_str(), error);
        return Failure{std::string("the staging directory could not be cleared: ") +
                       std::strerror(error)};
    }
    const BundleFillOutcome filled = fill(staging);
    if (filled.fill == BundleFill::Refused) {
        removeItemTree(staging);
        return Failure{filled.reason};
    }
    // The extractor and the copy write without flushing: on the disk before the old bundle goes,
    // so that a power cut after the rename cannot leave empty files under the bundle's name.
    if (int error = bundles->flushTree(io::lastPathComponent(staging));
        error != 0 && error != ENOENT) {
        logCFormat(LogPriority::Warning,
                   "Could not flush the new bundle in %s (error %d), keeping the old one\n",
                   staging.c_str(), error);
        removeItemTree(staging);
        return Failure{std::string("the new bundle could not be flushed: ") + std::strerror(error)};
    }
    const std::string stagingName = io::lastPathComponent(staging);
    const std::string bundleName = io::lastPathComponent(bundle);
    // The new bundle takes the name in one step and the old one the staging name, whence it is
    // removed (or, after a crash, at the next launch): a crash or a tree that cannot be removed
    // whole leaves one whole bundle under the name, never part of the old one.
    int error = bundles->exchangeEntries(stagingName, bundleName);
    if (error == EINVAL || error == ENOSYS) {
        // A file system that cannot swap: the old bundle is removed first, and is kept when it
        // cannot be removed whole (what went by then is lost).
        if (int removed = removeItemTree(bundle); removed != 0 && removed != ENOENT) {
            logCFormat(LogPriority::Warning,
                       "Could not remove the bundle %s (error %d), keeping it\n", bundle.c_str(),
                       removed);
            removeItemTree(staging);
            return Failure{std::string("the old bundle could not be removed: ") +
                           std::strerror(removed)};
        }
        error = ENOENT;
    }
    if (error == ENOENT) {
        error = bundles->renameEntry(stagingName, bundleName);  // no old bundle
    }
    if (error != 0) {
        logCFormat(LogPriority::Warning, "Could not move the extracted bundle into %s (error %d)\n",
                   bundle.c_str(), error);
        removeItemTree(staging);
        return Failure{std::string("the extracted bundle could not be moved into place: ") +
                       std::strerror(error)};
    }
    if (int removed = removeItemTree(staging); removed != 0 && removed != ENOENT) {
        logCFormat(LogPriority::Warning, "Could not remove the old bundle, now %s (error %d)\n",
                   staging.c_str(), removed);
    }
    if (filled.fill != BundleFill::Whole) {
        return Failure{filled.reason};
    }
    return {};
}

}  // namespace tavrix
