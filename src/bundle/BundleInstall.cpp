// A client's payload becomes the user bundle: staged, extracted beside the bundle directory and
// renamed into its place.
#include <cerrno>
#include <cstring>

#include "bundle/BundleLocations.h"
#include "bundle/BundleManager.h"
#include "device/PlatformRoot.h"
#include "io/Paths.h"
#include "payload/PayloadUnpack.h"
#include "util/FileSystemHelper.h"
#include "util/Log.h"

namespace tavrix {
namespace {

// A device root made for tests or the demo may lack /tmp; it gets the usual one.
constexpr mode_t kTemporaryDirectoryMode = 01777;

}  // namespace

bool BundleManager::installBehaviorBundleData(const plist::Data& data, std::string* whyNot) {
    auto refuse = [whyNot](std::string reason) {
        if (whyNot != nullptr) {
            *whyNot = std::move(reason);
        }
        return false;
    };
    logCFormat("Behavior bundle data is received %ld\n", static_cast<long>(data.size()));
    const std::string& bundleDirectory = userBundleLocation();
    if (bundleDirectory.empty()) {
        // Removing or extracting relative to an unknown home could touch anything.
        logCFormat(
            "Not installing the behavior bundle: the home directory of the mobile user is "
            "unknown\n");
        return refuse("the mobile user's home directory is unknown");
    }
    logCFormat("Writing the zipped file into: %s\n", payload::kBundleArchiveTempPath);
    const std::string stagedPath = device::resolvePath(payload::kBundleArchiveTempPath);

    FileSystemHelper helper;
    const std::string stagingDirectory = io::parentDirectory(stagedPath);
    if (!helper.fileExists(stagingDirectory)) {
        helper.createDirectory(stagingDirectory, kTemporaryDirectoryMode, true);
    }
    payload::writeDataToFile(data, stagedPath);
    // The old bundle goes even when the new one fails to extract: the bundle manager then finds
    // whatever was extracted, never a mix of two payloads. A bundle that cannot be removed whole
    // (and would mix with the new one) stays as it is.
    int removed = helper.removeItem(bundleDirectory);
    if (removed != 0 && removed != ENOENT) {
        logCFormat("Could not remove the bundle %s (error %d), keeping it\n",
                   bundleDirectory.c_str(), removed);
        helper.removeItem(stagedPath);
        return refuse("the old bundle could not be removed: " +
                      std::string(std::strerror(removed)));
    }
    // Extracted beside the bundle directory and renamed into place: a crash part way leaves no
    // bundle directory with some of its files (start-up removes the staging directory).
    const std::string staging = payload::extractionStagingPathFor(bundleDirectory);
    helper.removeItem(staging);
    // Bounded, so that a payload that unpacks to far more than it weighs stops before the disk
    // fills; what was extracted until then stays, like any other incomplete payload.
    std::string extractionFailure;
    const bool extracted =
        payload::extractArchive(stagedPath, staging, payload::ExtractionSafety::AsArchived,
                                payload::kClientPayloadLimits, &extractionFailure);
    if (!extracted) {
        if (extractionFailure.empty()) {
            extractionFailure = "the archive could not be extracted";
        }
        logCFormat("%s\n", extractionFailure.c_str());
    }
    bool placed = true;
    if (::rename(staging.c_str(), bundleDirectory.c_str()) != 0) {
        const int error = errno;
        logCFormat("Could not move the extracted bundle into %s (error %d)\n",
                   bundleDirectory.c_str(), error);
        helper.removeItem(staging);
        placed = false;
        extractionFailure = "the extracted bundle could not be moved into place: " +
                            std::string(std::strerror(error));
    }
    helper.removeItem(stagedPath);
    if (!extracted || !placed) {
        return refuse(extractionFailure);
    }
    return true;
}

}  // namespace tavrix
