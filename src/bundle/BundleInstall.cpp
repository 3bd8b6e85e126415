// A client's payload becomes the user bundle: staged, extracted beside the bundle directory and
// renamed into its place.
#include "bundle/BundleLocations.h"
#include "bundle/BundleManager.h"
#include "device/PlatformRoot.h"
#include "payload/PayloadUnpack.h"
#include "util/Log.h"

namespace tavrix {

Result<> BundleManager::installBehaviorBundleData(const plist::Data& data) {
    logCFormat("Behavior bundle data is received %ld\n", static_cast<long>(data.size()));
    logCFormat("Writing the zipped file into: %s\n", payload::kBundleArchiveTempPath);
    const std::string stagedPath = device::resolvePath(payload::kBundleArchiveTempPath);
    // Only bytes this call wrote are unpacked: a payload that cannot be staged is refused, and
    // the bundle linked now stays.
    Result<payload::StagedPayload> staged = payload::stagePayload(data, stagedPath);
    if (!staged) {
        return staged.failure();
    }
    // Extracted beside the old bundle, which goes only once the new one is there. A damaged
    // payload still replaces it with whatever was extracted; one stopped at a limit (its size,
    // its entries, the free space it would leave) keeps the old bundle: nothing was wrong
    // with it, only there is no room for the new one.
    return replaceUserBundle([&](const std::string& staging) {
        // Entries reaching into the bundle directory itself belong to the new bundle.
        std::string failure;
        const payload::ExtractionOutcome outcome = payload::extractArchive(
            staged->fd(), stagedPath, staging, payload::ExtractionSafety::AsArchived,
            payload::kClientPayloadLimits, &failure, userBundleLocation());
        if (outcome == payload::ExtractionOutcome::Complete) {
            return BundleFillOutcome{};
        }
        if (failure.empty()) {
            failure = "the archive could not be extracted";
        }
        logCFormat("%s\n", failure.c_str());
        return BundleFillOutcome{outcome == payload::ExtractionOutcome::OverLimit
                                     ? BundleFill::Refused
                                     : BundleFill::Incomplete,
                                 failure};
    });
}

}  // namespace tavrix
