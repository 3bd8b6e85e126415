// The behavior manager façade: the single object behind the service interface. It decides whether
// the device takes part at all (a device with a cellular radio never does), stores the behavior ID,
// hands bundle payloads to the bundle manager and answers questions about behavior settings.
#pragma once

#include <optional>
#include <string>

#include "plist/Value.h"

namespace tavrix {

// Why a device does or does not take bundles, in the order isTavrixBundleSupported asks.
enum class BundleSupport { Supported, CellularRadio, NotEnabled, Disabled, NoBehaviorID };

// One line for an operator: why bundles are not supported ("" when they are).
const char* bundleSupportReason(BundleSupport support);

// What became of a bundle payload: extracted into the user bundle, or why not, in one line.
struct PayloadOutcome {
    bool extracted = false;
    std::string reason;
};

class TXManager {
  public:
    // The process's façade; its first creation redoes the bundle match for a stored behavior ID.
    static TXManager& sharedInstance();
    // Whether sharedInstance has been created, from any thread.
    static bool exists();

    // Stores the lower-cased ID, unpacks the bundle when there is one and redoes the bundle match.
    // False on a device with a cellular radio, for an ID that is too long, and when the ID could
    // not be stored. With a bundle and a payload, says what became of it.
    bool setTavrixID(const std::string& tavrixID, const std::optional<plist::Data>& bundle,
                     PayloadOutcome* payload = nullptr);
    // These three only read the preferences: they need no instance, so that a daemon still
    // waiting for the instance lock answers them without the start-up work.
    static bool isTavrixBundleSupported();
    // What isTavrixBundleSupported answers from, without logging.
    static BundleSupport bundleSupport();
    // The behavior setting for key from "com.zandor.tavrix", or nothing.
    static std::optional<plist::Value> copyTavrixValue(const std::string& key);
    bool checkForTavrixBundleUpdate();

  private:
    TXManager() = default;
};

}  // namespace tavrix
