#include "bundle/BundleInfo.h"

#include <sys/stat.h>
#include <unistd.h>

#include "util/PropertyListFile.h"

namespace tavrix {

std::optional<plist::Value> BundleDirectory::copyInfoValue(std::string_view key) const {
    std::optional<plist::Value> info = readPropertyListFile(path_ + "/" + kBundleInfoFileName);
    if (!info) {
        return std::nullopt;
    }
    const plist::Value* value = info->find(key);
    return value == nullptr ? std::nullopt : std::optional<plist::Value>(*value);
}

std::optional<BundleDirectory> createBundleAtPath(const std::string& path) {
    struct stat info {};
    if (path.empty() || ::stat(path.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
        return std::nullopt;
    }
    return BundleDirectory(path);
}

std::optional<plist::Value> copyBundleInfoValue(const std::string& path, std::string_view key) {
    for (int attempt = 0; attempt < kBundleInfoRetryCount; ++attempt) {
        // Created afresh each time: the bundle may appear or change between attempts.
        std::optional<BundleDirectory> bundle = createBundleAtPath(path);
        if (!bundle) {
            return std::nullopt;
        }
        if (auto value = bundle->copyInfoValue(key)) {
            return value;
        }
        ::usleep(kBundleInfoRetryDelayMicroseconds);
    }
    return std::nullopt;
}

std::optional<plist::Value> copyBundleVersionAtPath(const std::string& path) {
    return copyBundleInfoValue(path, kBundleVersionKey);
}

std::optional<plist::Value> copyBundleVersionAtURL(const std::string& directoryURL) {
    return copyBundleInfoValue(directoryURL, kBundleVersionKey);
}

std::optional<std::string> copyBundleIdentifierAtPath(const std::string& path) {
    std::optional<BundleDirectory> bundle = createBundleAtPath(path);
    if (!bundle) {
        return std::nullopt;
    }
    std::optional<plist::Value> value = bundle->copyInfoValue(kBundleIdentifierKey);
    if (!value || !value->isString()) {
        return std::nullopt;
    }
    return *value->asString();
}

std::string bundleInfoValueText(const std::optional<plist::Value>& value) {
    if (!value) {
        return {};
    }
    if (const std::string* text = value->asString()) {
        return *text;
    }
    return value->description();
}

}  // namespace tavrix
