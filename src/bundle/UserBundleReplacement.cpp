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

bool BundleManager::replaceUserBundle(const UserBundleFill& fill, std::string* whyNot) {
    std::lock_guard lock(operationLock_);
    const std::string& bundle = userBundleLocation();
    if (bundle.empty()) {
        // Removing or extracting relative to an unknown home could touch anything.
        logCFormat(
            "Not installing the behavior bundle: the home directory of the mobile user is "
            "unknown\n");
        *whyNot = "the mobile user's home directory is unknown";
        return false;
    }
    // Everything below happens by path inside this directory, which nobody else can rearrange.
    const auto bundles = device::openMobileHomeDirectory(io::parentDirectory(bundle), true);
    if (!bundles) {
        *whyNot =
            "the bundle directory " + io::parentDirectory(bundle) + " is not the daemon's own";
        logCFormat("Not installing the behavior bundle: %s\n", whyNot->c_str());
        return false;
    }
    const std::string staging = payload::extractionStagingPathFor(bundle);
    removeItemTree(staging);
    const BundleFill filled = fill(staging, whyNot);
    if (filled == BundleFill::Refused) {
        removeItemTree(staging);
        return false;
    }
    // The extractor and the copy write without flushing: on the disk before the old bundle goes,
    // so that a power cut after the rename cannot leave empty files under the bundle's name.
    if (int error = bundles->flushTree(io::lastPathComponent(staging));
        error != 0 && error != ENOENT) {
        logCFormat(LogPriority::Warning,
                   "Could not flush the new bundle in %s (error %d), keeping the old one\n",
                   staging.c_str(), error);
        removeItemTree(staging);
        *whyNot = std::string("the new bundle could not be flushed: ") + std::strerror(error);
        return false;
    }
    // A bundle that cannot be removed whole (and would mix with the new one) stays as it is.
    if (int removed = removeItemTree(bundle); removed != 0 && removed != ENOENT) {
        logCFormat(LogPriority::Warning, "Could not remove the bundle %s (error %d), keeping it\n",
                   bundle.c_str(), removed);
        removeItemTree(staging);
        *whyNot = std::string("the old bundle could not be removed: ") + std::strerror(removed);
        return false;
    }
    if (int error =
            bundles->renameEntry(io::lastPathComponent(staging), io::lastPathComponent(bundle));
        error != 0) {
        logCFormat(LogPriority::Warning, "Could not move the extracted bundle into %s (error %d)\n",
                   bundle.c_str(), error);
        removeItemTree(staging);
        *whyNot = std::string("the extracted bundle could not be moved into place: ") +
                  std::strerror(error);
        return false;
    }
    return filled == BundleFill::Whole;
}

}  // namespace tavrix
