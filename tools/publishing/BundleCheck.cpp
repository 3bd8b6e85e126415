#include "publishing/BundleCheck.h"

#include <filesystem>

#include "bundle/BundleKeys.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::tools {
namespace {

namespace fs = std::filesystem;

// The property list at path when it is a dictionary.
Result<plist::Dictionary> readDictionary(const std::string& path) {
    Result<plist::Value> value = plist::readFile(path);
    if (!value) {
        return Failure{path + ": " + value.reason()};
    }
    if (value->asDictionary() == nullptr) {
        return Failure{path + ": not a dictionary"};
    }
    return std::move(*value->asDictionary());
}

Result<std::string> nonEmptyString(const plist::Dictionary& info, const char* key,
                                   const std::string& path) {
    auto entry = info.find(key);
    const plist::Value* value = entry != info.end() ? &entry->second : nullptr;
    if (value == nullptr || value->asString() == nullptr || value->asString()->empty()) {
        return Failure{path + ": no " + key + " string"};
    }
    return *value->asString();
}

}  // namespace

Result<BundleIdentity> checkBundleDirectory(const std::string& directory) {
    std::error_code status;
    if (!fs::is_directory(directory, status)) {
        return Failure{directory + ": not a directory"};
    }
    const std::string infoPath = (fs::path(directory) / kBundleInfoFileName).string();
    Result<plist::Dictionary> info = readDictionary(infoPath);
    if (!info) {
        return info.failure();
    }
    Result<std::string> identifier = nonEmptyString(*info, kBundleIdentifierKey, infoPath);
    if (!identifier) {
        return identifier.failure();
    }
    Result<std::string> version = nonEmptyString(*info, kBundleVersionKey, infoPath);
    if (!version) {
        return version.failure();
    }
    if (Result<plist::Dictionary> carrier =
            readDictionary((fs::path(directory) / kBaseCarrierFileName).string());
        !carrier) {
        return carrier.failure();
    }
    return BundleIdentity{*identifier, *version};
}

}  // namespace tavrix::tools
