// The device overlay file of a base bundle: an "overrides_<model>[_<model>...].plist" file in the
// bundle's carrier directory that names this device's hardware model.
#pragma once

#include <optional>
#include <string>

namespace tavrix {

inline constexpr const char* kDeviceOverlayFilePrefix = "overrides_";
inline constexpr const char* kDeviceOverlayFileExtension = ".plist";

// The name of the entry of directory that starts with prefix, ends with extension, and whose name
// without the extension, split at '_', holds model as one of its fields ("overrides_DT1_DT2.plist"
// names "DT1" and "DT2"). Entries are tried in name order, so the first such name wins. Nothing
// (logged) when there is none or an argument is empty.
std::optional<std::string> findDeviceOverlayFileName(const std::string& directory,
                                                     const std::string& prefix,
                                                     const std::string& extension,
                                                     const std::string& model);

}  // namespace tavrix
