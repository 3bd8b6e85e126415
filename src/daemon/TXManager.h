// The behavior manager façade: the single object behind the service interface. It decides whether
// the device takes part at all (a device with a cellular radio never does), stores the behavior ID,
// hands bundle payloads to the bundle manager and answers questions about behavior settings.
#pragma once

#include <optional>
#include <string>

#include "plist/Value.h"

namespace tavrix {

class TXManager {
  public:
    // The process's façade; its first creation redoes the bundle match for a stored behavior ID.
    static TXManager& sharedInstance();

    // Stores the lower-cased ID, unpacks the bundle when there is one and redoes the bundle match.
    // False only on a device with a cellular radio.
    bool setTavrixID(const std::string& tavrixID, const std::optional<plist::Data>& bundle);
    bool isTavrixBundleSupported();
    // The behavior setting for key from "com.zandor.tavrix", or nothing.
    std::optional<plist::Value> copyTavrixValue(const std::string& key);
    bool checkForTavrixBundleUpdate();

  private:
    TXManager() = default;
};

}  // namespace tavrix
