// The bundle manager: knows the bundle locations, installs received bundle payloads and redoes the
// bundle match for a behavior ID. Callers must not overlap; they run on the main thread or on the
// update scheduler's queue.
#pragma once

#include <string>

#include "plist/Value.h"

namespace tavrix {

enum BundleChangeType {
    kBundleChangeTypeUnknown = -1,
    kBundleChangeTypeNoChange = 0,
    kBundleChangeTypeUpdate = 1,
    kBundleChangeTypeOverrideSwitch = 2,
};

class BundleManager {
  public:
    // The process's bundle manager, created on first use and never destroyed.
    static BundleManager& sharedInstance();

    // Unpacks a received bundle payload into the user bundle directory.
    void installBehaviorBundleData(const plist::Data& data);

    // Finds the carrier file for the behavior ID, re-links it when it changed and tells everyone.
    BundleChangeType resetBehaviorBundle(const std::string& tavrixID);
};

}  // namespace tavrix
