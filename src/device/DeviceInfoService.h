// The device information service: answers questions about the device by key.
// Answers come from the table <root>/etc/tavrix/DeviceInfo.plist (a dictionary, re-read when the
// file changes); a key missing from the table is answered from the running system where one is
// known (for example "ProductVersion" from <root>/etc/os-release, "wi-fi" from the network
// devices).
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "plist/Value.h"

namespace tavrix::device {

// The answer for key, of whatever type the table holds, or nothing.
std::optional<plist::Value> copyDeviceAnswer(std::string_view key);

// The answer for key when it is a string, else nothing.
std::optional<std::string> copyDeviceStringAnswer(std::string_view key);

// The answer for key when it is a boolean, else false.
bool deviceBooleanAnswer(std::string_view key);

// Several answers at once: a dictionary holding an entry for every key that has an answer.
plist::Dictionary copyDeviceAnswers(const std::vector<std::string>& keys);

}  // namespace tavrix::device
