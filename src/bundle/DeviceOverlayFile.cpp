#include "bundle/DeviceOverlayFile.h"

#include <algorithm>
#include <string_view>
#include <vector>

#include "util/FileSystemHelper.h"
#include "util/Log.h"

namespace tavrix {
namespace {

constexpr char kFieldSeparator = '_';

bool hasField(std::string_view name, std::string_view wanted) {
    std::size_t start = 0;
    for (;;) {
        std::size_t end = name.find(kFieldSeparator, start);
        if (name.substr(start, end - start) == wanted) {
            return true;
        }
        if (end == std::string_view::npos) {
            return false;
        }
        start = end + 1;
    }
}

}  // namespace

std::optional<std::string> findDeviceOverlayFileName(const std::string& directory,
                                                     const std::string& prefix,
                                                     const std::string& extension,
                                                     const std::string& model) {
    if (directory.empty() || prefix.empty() || extension.empty() || model.empty()) {
        logCFormat("None of the arguments to this function can be empty\n");
        return std::nullopt;
    }
    logCFormat(
        "Going through the contents in the directory searching for pattern '%s', and "
        "extension: '%s'\n",
        prefix.c_str(), extension.c_str());
    std::vector<std::string> names;
    FileSystemHelper().listDirectory(directory, names, false);
    // The kernel's order differs between file systems; name order makes the choice repeatable.
    std::sort(names.begin(), names.end());
    for (const std::string& name : names) {
        if (!name.starts_with(prefix) || !name.ends_with(extension)) {
            continue;
        }
        logCFormat("Found a file with the prefix matching: %s\n", name.c_str());
        // The extension goes before splitting, so that "overrides_DT1.plist" names "DT1".
        std::string_view stem(name.data(), name.size() - extension.size());
        if (hasField(stem, model)) {
            logCFormat("Found match, file %s contains this device's specific carrier plist\n",
                       name.c_str());
            return name;
        }
    }
    logCFormat("No device specific overlay file name found in the base bundle\n");
    return std::nullopt;
}

}  // namespace tavrix
