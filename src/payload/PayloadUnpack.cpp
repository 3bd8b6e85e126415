#include "payload/PayloadUnpack.h"

#include <cstring>

#include "bundle/BundleLocations.h"
#include "bundle/BundleManager.h"
#include "payload/FileSystemHelper.h"
#include "platform/AtomicFile.h"
#include "platform/PlatformRoot.h"
#include "util/Log.h"

namespace tavrix {
namespace payload {

// Only the daemon reads the staged payload.
constexpr mode_t kStagedFileMode = 0600;
// A device root made for tests or the demo may lack /tmp; it gets the usual one.
constexpr mode_t kTemporaryDirectoryMode = 01777;

bool writeDataToFile(const plist::Data& data, const std::string& path) {
    if (platform::replaceFileAtomically(path, data, kStagedFileMode) == 0) {
        logCFormat("Successfully wrote the KW Data to file: %s\n", path.c_str());
    } else {
        logCFormat("Failed to write the zipped file: %s\n", path.c_str());
    }
    return true;
}

}  // namespace payload

void BundleManager::installBehaviorBundleData(const plist::Data& data) {
    logCFormat("Behavior bundle data is received %ld\n", static_cast<long>(data.size()));
    const std::string& bundleDirectory = userBundleLocation();
    if (bundleDirectory.empty()) {
        // Removing or extracting relative to an unknown home could touch anything.
        logCFormat(
            "Not installing the behavior bundle: the home directory of the mobile user is "
            "unknown\n");
        return;
    }
    logCFormat("Writing the zipped file into: %s\n", payload::kBundleArchiveTempPath);
    const std::string stagedPath = platform::resolvePath(payload::kBundleArchiveTempPath);

    payload::FileSystemHelper helper;
    const std::string stagingDirectory = stagedPath.substr(0, stagedPath.find_last_of('/'));
    if (!helper.fileExists(stagingDirectory)) {
        helper.createDirectory(stagingDirectory, payload::kTemporaryDirectoryMode, true);
    }
    payload::writeDataToFile(data, stagedPath);
    // The old bundle goes even when the new one fails to extract: the bundle manager then finds
    // whatever was extracted, never a mix of two payloads.
    helper.removeItem(bundleDirectory);
    // Bounded, so that a payload that unpacks to far more than it weighs stops before the disk
    // fills; what was extracted until then stays, like any other incomplete payload.
    payload::extractArchive(stagedPath, bundleDirectory, payload::ExtractionSafety::AsArchived,
                            payload::kClientPayloadLimits);
    helper.removeItem(stagedPath);
}

}  // namespace tavrix
