#include "bundle/OverriddenCarrierFile.h"

#include <limits.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <iterator>
#include <vector>

#include "bundle/BundleLinks.h"
#include "bundle/BundleLocations.h"
#include "device/HomeDirectories.h"
#include "device/MobileUser.h"
#include "io/Directory.h"
#include "plist/PropertyListFormat.h"
#include "util/FileURL.h"
#include "util/Log.h"

namespace tavrix {
namespace {

constexpr char kFieldSeparator = '+';
constexpr const char* kPropertyListExtension = ".plist";
constexpr mode_t kOverriddenFileMode = 0644;

std::vector<std::string> sortedFields(const std::string& name) {
    std::vector<std::string> fields;
    std::size_t start = 0;
    for (;;) {
        std::size_t end = name.find(kFieldSeparator, start);
        fields.push_back(name.substr(start, end - start));
        if (end == std::string::npos) {
            break;
        }
        start = end + 1;
    }
    std::sort(fields.begin(), fields.end());
    return fields;
}

std::string fileNameFor(const std::string& prefix, const std::string& bundleVersion) {
    return prefix + kFieldSeparator + bundleVersion + kPropertyListExtension;
}

// The overlay key is a behavior ID or a hardware model, texts that other parties choose. Bytes that
// would split the name into other fields ('+'), leave the directory ('/'), or garble a listing
// (control characters) are written as %XX, and '%' itself too, so that two keys never share one
// file name and every file stays inside the overlay directory.
std::string fileNameField(std::string_view key) {
    static constexpr char kHex[] = "0123456789abcdef";
    std::string field;
    field.reserve(key.size());
    for (char c : key) {
        auto byte = static_cast<unsigned char>(c);
        if (byte < 0x20 || byte == 0x7F || c == '/' || c == kFieldSeparator || c == '%') {
            field += '%';
            field += kHex[byte >> 4];
            field += kHex[byte & 0xF];
        } else {
            field += c;
        }
    }
    return field;
}

std::string overlayDirectory() {
    const char* home = device::MobileUser::homeDirectory();
    return std::string(home != nullptr ? home : "") + kUserBundlesDirectory + kOverlayDirectoryName;
}

}  // namespace

std::string overriddenFilesDirectory() {
    return device::MobileUser::homeDirectory() != nullptr ? overlayDirectory() : std::string();
}

std::optional<std::string> overriddenFilePath(OverlayContext& context) {
    context.overriddenFilePrefix.clear();
    std::string bundleName = context.bundle.bundleName();
    if (bundleName.empty()) {
        logCFormat("There is no valid carrier bundle name\n");
        return std::nullopt;
    }
    std::string prefix = std::string(overlayTypeWord(context.overlayType)) + kFieldSeparator +
                         bundleName + kFieldSeparator + fileNameField(context.overlayKey);
    logCFormat("Overridden filename prefix: %s\n", prefix.c_str());
    const std::string& currentPath = context.bundle.carrierFilePath;
    logCFormat("Current carrier file path name: %s\n", currentPath.c_str());

    const std::string& version = context.bundle.bundleVersion;
    if (currentPath.find(kFieldSeparator) != std::string::npos) {
        std::vector<std::string> current = sortedFields(baseNameOfPath(currentPath));
        std::vector<std::string> overridden = sortedFields(fileNameFor(prefix, version));
        std::vector<std::string> extra;
        std::set_difference(current.begin(), current.end(), overridden.begin(), overridden.end(),
                            std::back_inserter(extra));
        for (const std::string& field : extra) {
            logCFormat("Adding the extra identifier %s to the file name\n", field.c_str());
            prefix += kFieldSeparator + field;
        }
        logCFormat("Overridden carrier file path name: %s\n",
                   (overlayDirectory() + fileNameFor(prefix, version)).c_str());
    }
    context.overriddenFilePrefix = prefix;

    std::string fileName = fileNameFor(prefix, version);
    // A name the file system cannot hold is no path at all; nothing is written then.
    if (device::MobileUser::homeDirectory() == nullptr || fileName.size() > NAME_MAX ||
        fileName.find_first_of(std::string_view("/\0", 2)) != std::string::npos) {
        return std::nullopt;
    }
    return overlayDirectory() + fileName;
}

bool writeOverriddenCarrierFile(const plist::Value& dictionary,
                                const std::optional<std::string>& path) {
    Result<std::string> xml = plist::serialize(dictionary);
    if (!xml) {
        logCFormat(LogPriority::Warning, "Failed to serialize the overridden dictionary\n");
        return false;
    }
    std::optional<io::Directory> directory;
    if (path) {
        directory = device::openMobileHomeDirectory(dirNameOfPath(*path), true);
    }
    if (!path || !fileURLFromPath(*path)) {
        logCFormat(LogPriority::Warning, "Failed to create the file URL\n");
        return false;
    }
    const int error = directory ? directory->writeFile(baseNameOfPath(*path), kOverriddenFileMode,
                                                       /*replace=*/false, *xml)
                                : EACCES;
    if (error != 0) {
        logCFormat(LogPriority::Warning,
                   "Failed to write the overridden carrier bundle with error code: %d\n", error);
        return false;
    }
    logCFormat("The overridden file was successfully written to %s\n", path->c_str());
    return true;
}

bool isGeneratedCarrierFile(const std::string& path) {
    auto directory = device::openMobileHomeDirectory(dirNameOfPath(path), false);
    if (!directory) {
        return false;
    }
    const std::string name = baseNameOfPath(path);
    int error = 0;
    if (directory->openOwnFile(name, &error)) {
        return true;
    }
    if (error != ENOENT) {
        // Not written by the daemon: it goes, and the daemon writes its own.
        device::logDistrustOnce(path, error == ELOOP    ? "it is a symbolic link"
                                      : error == EINVAL ? "it is not a regular file"
                                      : error == EPERM  ? "it belongs to another user"
                                                        : std::strerror(error));
        directory->removeEntry(name);
    }
    return false;
}

}  // namespace tavrix
