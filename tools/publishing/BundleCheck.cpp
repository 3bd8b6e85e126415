#include "publishing/BundleCheck.h"

#include <filesystem>

#include "plist/PropertyListFormat.h"

namespace tavrix::tools {
namespace {

namespace fs = std::filesystem;

constexpr const char* kInfoFileName = "Info.plist";
constexpr const char* kBaseCarrierFileName = "behavior.plist";
constexpr const char* kIdentifierKey = "QZBundleIdentifier";
constexpr const char* kVersionKey = "QZBundleVersion";

// The property list at path when it is a dictionary; otherwise error says why.
std::optional<plist::Value> readDictionary(const std::string& path, std::string& error) {
    plist::Refusal refusal;
    std::optional<plist::Value> value = plist::readFile(path, &refusal);
    if (!value) {
        error = path + ": " + (refusal.reason.empty() ? "cannot be read" : refusal.reason);
        return std::nullopt;
    }
    if (value->asDictionary() == nullptr) {
        error = path + ": not a dictionary";
        return std::nullopt;
    }
    return value;
}

std::optional<std::string> nonEmptyString(const plist::Value& info, const char* key,
                                          const std::string& path, std::string& error) {
    const plist::Value* value = info.find(key);
    if (value == nullptr || value->asString() == nullptr || value->asString()->empty()) {
        error = path + ": no " + key + " string";
        return std::nullopt;
    }
    return *value->asString();
}

}  // namespace

std::optional<BundleIdentity> checkBundleDirectory(const std::string& directory,
                                                   std::string& error) {
    std::error_code status;
    if (!fs::is_directory(directory, status)) {
        error = directory + ": not a directory";
        return std::nullopt;
    }
    const std::string infoPath = (fs::path(directory) / kInfoFileName).string();
    std::optional<plist::Value> info = readDictionary(infoPath, error);
    if (!info) {
        return std::nullopt;
    }
    BundleIdentity identity;
    auto identifier = nonEmptyString(*info, kIdentifierKey, infoPath, error);
    auto version = identifier ? nonEmptyString(*info, kVersionKey, infoPath, error) : std::nullopt;
    if (!version) {
        return std::nullopt;
    }
    if (!readDictionary((fs::path(directory) / kBaseCarrierFileName).string(), error)) {
        return std::nullopt;
    }
    return BundleIdentity{*identifier, *version};
}

}  // namespace tavrix::tools
