// The bundle manager: knows which behavior bundle the device uses, installs received bundle
// payloads and downloaded bundles, and redoes the bundle match for a behavior ID. Each of these
// takes its lock, so that changes from the main thread and the download thread never overlap.
#pragma once

#include <mutex>
#include <optional>
#include <string>

#include "base/Result.h"
#include "bundle/BundleTypes.h"
#include "bundle/CarrierBundle.h"
#include "bundle/UserBundleReplacement.h"
#include "plist/Value.h"

namespace tavrix {

class BundleManager {
  public:
    // The daemon root's bundle manager: sets the bundle locations once, then creates the manager
    // on first use (reading the existing links); it lives as long as the root.
    static BundleManager& sharedInstance();

    BundleManager(const BundleManager&) = delete;
    BundleManager& operator=(const BundleManager&) = delete;

    // Replaces the user bundle with the one packed in data (a gzip- or compress-compressed tar or
    // cpio archive). Failures are logged; the old user bundle is gone even then. Fails unless the
    // archive was extracted whole and put in place.
    Result<> installBehaviorBundleData(const plist::Data& data);
    // The one way the user bundle is replaced (a client's payload, a downloaded update): with what
    // fill makes, under the lock. Fails unless it was filled whole and put in place (the old
    // bundle stays unless the new one was placed).
    Result<> replaceUserBundle(const UserBundleFill& fill);

    // Keeps behaviorID and runs the reset flow for it.
    BundleChangeType resetBehaviorBundle(const std::optional<std::string>& behaviorID);
    // Finds and overlays the carrier file for the kept behavior ID, compares it with the linked
    // one and, when it changed, re-links it and tells every process.
    BundleChangeType runBundleReset();

    // Resets out to the newer of the system and the user bundle (the user one on equal versions).
    // False when neither has a version.
    bool findBundle(CarrierBundle& out) const;
    // The linked bundle's version, or nothing when unknown. Safe from any thread.
    std::optional<std::string> copyBundleVersion() const;
    // What going from current to matched changes.
    BundleChangeType compareBundles(const CarrierBundle& current,
                                    const CarrierBundle& matched) const;

    // The bundle and carrier file linked now: a copy taken under the lock.
    CarrierBundle currentBundle() const;
    const std::string& bundleLinkPath() const { return bundleLinkPath_; }
    const std::string& preferencesLinkPath() const { return preferencesLinkPath_; }

  private:
    BundleManager();
    // The reset flow; the caller holds operationLock_.
    BundleChangeType runBundleResetLocked();

    std::optional<std::string> behaviorID_;
    std::string bundleLinkPath_;
    std::string preferencesLinkPath_;
    CarrierBundle currentBundle_;
    // The links found at start-up do not describe one state: the next reset links again whatever
    // the comparison says.
    bool linksDisagree_ = false;
    // Taken by every change of the bundles and every read of currentBundle_: the main thread and
    // the download thread both come here.
    mutable std::mutex operationLock_;
};

}  // namespace tavrix
