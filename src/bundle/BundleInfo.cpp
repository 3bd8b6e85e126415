#include "bundle/BundleInfo.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "util/PropertyListFile.h"

namespace tavrix {

std::string BundleDirectory::infoPath() const {
    return path_ + "/" + kBundleInfoFileName;
}

std::optional<plist::Value> BundleDirectory::copyInfoValue(std::string_view key,
                                                           plist::Refusal* refusal) const {
    std::optional<plist::Value> info = plist::readFile(infoPath(), refusal);
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

namespace {

// A refused Info dictionary is logged once per request, after the last attempt; a missing one is
// not (a bundle being installed has none yet).
void logInfoRefusal(const BundleDirectory& bundle, const plist::Refusal& refusal) {
    if (!refusal.reason.empty() && refusal.error != ENOENT) {
        logPropertyListRefusal(bundle.infoPath(), refusal, "ignoring it");
    }
}

}  // namespace

std::optional<plist::Value> copyBundleInfoValue(const std::string& path, std::string_view key) {
    for (int attempt = 0; attempt < kBundleInfoRetryCount; ++attempt) {
        // Created afresh each time: the bundle may appear or change between attempts.
        std::optional<BundleDirectory> bundle = createBundleAtPath(path);
        if (!bundle) {
            return std::nullopt;
        }
        plist::Refusal refusal;
        if (auto value = bundle->copyInfoValue(key, &refusal)) {
            return value;
        }
        if (attempt + 1 == kBundleInfoRetryCount) {
            logInfoRefusal(*bundle, refusal);
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
    plist::Refusal refusal;
    std::optional<plist::Value> value = bundle->copyInfoValue(kBundleIdentifierKey, &refusal);
    logInfoRefusal(*bundle, refusal);
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
