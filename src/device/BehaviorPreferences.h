// The daemon's own small state: values in the preferences domain "com.zandor.tavrixservices" of
// the mobile user, for any host. These two functions are the only way the daemon touches it.
#pragma once

#include <cstddef>
#include <optional>
#include <string_view>

#include "plist/Value.h"

namespace tavrix {

inline constexpr std::string_view kBehaviorPreferencesDomain = "com.zandor.tavrixservices";

// The behavior ID a client set (a string); its presence means a behavior is configured.
inline constexpr std::string_view kTavrixIDKey = "TavrixID";
// A boolean set by the device's configuration; absent or false: bundles are not supported.
inline constexpr std::string_view kEnableSupportKey = "EnableSupport";
// A date: when the next over-the-air update check is due.
inline constexpr std::string_view kNextUpdateKey = "NextUpdate";

// The longest behavior ID stored, in bytes: real IDs are short names, and a longer one would only
// grow the preferences toward what their reader refuses.
inline constexpr std::size_t kMaxBehaviorIDBytes = 1024;

// The stored value for key, of whatever type it has, or nothing when the key is absent. Callers
// check the type themselves.
std::optional<plist::Value> copyBehaviorPreference(std::string_view key);

// Sets the value for key (nothing removes it) and synchronizes the domain at once, so the value is
// on disk when this returns. Answers whether synchronizing succeeded; when it did not, the value
// is dropped, so that reads show what is stored.
[[nodiscard]] bool setBehaviorPreference(std::string_view key, const std::optional<plist::Value>& value);

}  // namespace tavrix
