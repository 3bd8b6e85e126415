// The bundle manager: knows which behavior bundle the device uses, installs received bundle
// payloads and redoes the bundle match for a behavior ID. Callers that change the bundles hold
// operationLock() so that they never overlap.
#pragma once

#include <mutex>
#include <optional>
#include <string>

#include "bundle/BundleTypes.h"
#include "bundle/CarrierBundle.h"
#include "plist/Value.h"

namespace tavrix {

class BundleManager {
  public:
    // The process's bundle manager: sets the bundle locations once, then creates the manager on
    // first use (reading the existing links); never destroyed.
    static BundleManager& sharedInstance();

    BundleManager(const BundleManager&) = delete;
    BundleManager& operator=(const BundleManager&) = delete;

    // Replaces the user bundle with the one packed in data (a gzip- or compress-compressed tar or
    // cpio archive). Failures are logged; the old user bundle is gone even then. True when the
    // archive was extracted whole and put in place; otherwise whyNot, when given, says why.
    bool installBehaviorBundleData(const plist::Data& data, std::string* whyNot = nullptr);

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

    // Held by each caller across a change of the bundles (a client's payload and bundle match, an
    // over-the-air install and its match), which may come from the main thread and the update
    // download's thread at once.
    std::recursive_mutex& operationLock() const { return operationLock_; }

    // The bundle and carrier file linked now: a copy taken under operationLock().
    CarrierBundle currentBundle() const;
    const std::string& bundleLinkPath() const { return bundleLinkPath_; }
    const std::string& preferencesLinkPath() const { return preferencesLinkPath_; }

  private:
    BundleManager();

    std::optional<std::string> behaviorID_;
    std::string bundleLinkPath_;
    std::string preferencesLinkPath_;
    CarrierBundle currentBundle_;
    // The links found at start-up do not describe one state: the next reset links again whatever
    // the comparison says.
    bool linksDisagree_ = false;
    // Also guards currentBundle_, which other threads read.
    mutable std::recursive_mutex operationLock_;
};

}  // namespace tavrix
