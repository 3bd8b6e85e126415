#include "bundle/BundleInfo.h"

#include <cerrno>
#include <chrono>
#include <map>
#include <memory>
#include <mutex>
#include <thread>

#include "io/Paths.h"
#include "plist/CachedPropertyListFile.h"
#include "util/PropertyListFile.h"

namespace tavrix {

std::string BundleDirectory::infoPath() const {
    return path_ + "/" + kBundleInfoFileName;
}

namespace {

// One request asks a bundle's Info dictionary several times (the choice of bundle, its record, the
// comparison, the pruning): each version of the file is parsed once, and asked again only when
// it changed. Few bundles exist; the table is emptied should it ever grow.
std::shared_ptr<plist::CachedPropertyListFile> cachedInfoFile(const std::string& path) {
    constexpr std::size_t kMaxCachedFiles = 16;
    static std::mutex mutex;
    static std::map<std::string, std::shared_ptr<plist::CachedPropertyListFile>> files;
    std::lock_guard lock(mutex);
    auto& file = files[path];
    if (!file) {
        if (files.size() > kMaxCachedFiles) {
            files.clear();
            return cachedInfoFile(path);
        }
        file = std::make_shared<plist::CachedPropertyListFile>(path);
    }
    return file;
}

}  // namespace

Result<std::optional<plist::Value>> BundleDirectory::copyInfoValue(std::string_view key) const {
    const plist::CachedPropertyListFile::Snapshot info = cachedInfoFile(infoPath())->read();
    if (info.state == plist::CachedPropertyListFile::State::Damaged) {
        return info.refusal;
    }
    auto valueFor = [&](const plist::Value& dictionary) {
        const plist::Value* value = dictionary.find(key);
        return value == nullptr ? std::nullopt : std::optional<plist::Value>(*value);
    };
    if (info.state == plist::CachedPropertyListFile::State::Valid) {
        return valueFor(*info.value);
    }
    // Not opened: read directly for the reason (missing, or not readable).
    Result<plist::Value> unopened = plist::readFile(infoPath());
    if (!unopened) {
        return unopened.failure();
    }
    return valueFor(*unopened);
}

std::optional<BundleDirectory> createBundleAtPath(const std::string& path) {
    if (io::kindOfPath(path) != io::PathKind::Directory) {
        return std::nullopt;
    }
    return BundleDirectory(path);
}

namespace {

// A refused Info dictionary is logged once per request, after the last attempt; a missing one is
// not (a bundle being installed has none yet).
void logInfoRefusal(const BundleDirectory& bundle, const Failure& refusal) {
    if (refusal.error != ENOENT) {
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
        Result<std::optional<plist::Value>> value = bundle->copyInfoValue(key);
        if (value && *value) {
            return std::move(*value);
        }
        if (!value && attempt + 1 == kBundleInfoRetryCount) {
            logInfoRefusal(*bundle, value.failure());
        }
        std::this_thread::sleep_for(std::chrono::microseconds(kBundleInfoRetryDelayMicroseconds));
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
    Result<std::optional<plist::Value>> value = bundle->copyInfoValue(kBundleIdentifierKey);
    if (!value) {
        logInfoRefusal(*bundle, value.failure());
        return std::nullopt;
    }
    if (!*value || !(*value)->isString()) {
        return std::nullopt;
    }
    return *(*value)->asString();
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
