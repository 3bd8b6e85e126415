// A client's payload becomes the user bundle: staged, extracted beside the bundle directory and
// renamed into its place.
#include "bundle/BundleManager.h"
#include "bundle/UserBundleReplacement.h"
#include "device/PlatformRoot.h"
#include "payload/PayloadUnpack.h"
#include "util/Log.h"

namespace tavrix {

bool BundleManager::installBehaviorBundleData(const plist::Data& data, std::string* whyNot) {
    std::string reason;
    logCFormat("Behavior bundle data is received %ld\n", static_cast<long>(data.size()));
    logCFormat("Writing the zipped file into: %s\n", payload::kBundleArchiveTempPath);
    const std::string stagedPath = device::resolvePath(payload::kBundleArchiveTempPath);
    // Only bytes this call wrote are unpacked: a payload that cannot be staged is refused, and
    // the bundle linked now stays.
    std::optional<payload::StagedPayload> staged = payload::stagePayload(data, stagedPath, &reason);
    bool installed = false;
    if (staged) {
        // Bounded, so that a payload that unpacks to far more than it weighs stops before the
        // disk fills; what was extracted until then is placed, like any other incomplete
        // payload: the old bundle is gone even when the new one fails.
        installed = replaceUserBundle(
            [&](const std::string& staging, std::string* failure) {
                if (payload::extractArchive(staged->fd(), stagedPath, staging,
                                            payload::ExtractionSafety::AsArchived,
                                            payload::kClientPayloadLimits, failure)) {
                    return true;
                }
                if (failure->empty()) {
                    *failure = "the archive could not be extracted";
                }
                logCFormat("%s\n", failure->c_str());
                return false;
            },
            IncompleteBundle::Place, &reason);
    }
    if (!installed && whyNot != nullptr) {
        *whyNot = reason;
    }
    return installed;
}

}  // namespace tavrix
