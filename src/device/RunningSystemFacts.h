// Device facts read from the running system, for keys the device table does not answer:
// the release file for versions, the device tree or DMI for the model and serial number, and the
// network device classes for radios. Every path is taken under a given root.
#pragma once

#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>

#include "plist/Value.h"

namespace tavrix::device {

// The assignments of an os-release file ("KEY=value", the value optionally in single or double
// quotes). Comments, blank lines and malformed lines are skipped.
std::map<std::string, std::string, std::less<>> parseOsRelease(std::string_view text);

// The running system's answer for key under root ("" for "/"), or nothing when the system does
// not know it. Booleans are answered as booleans, everything else as strings.
std::optional<plist::Value> runningSystemAnswer(std::string_view root, std::string_view key);

}  // namespace tavrix::device
