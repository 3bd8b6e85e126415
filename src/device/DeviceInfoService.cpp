#include "device/DeviceInfoService.h"

#include <memory>

#include "device/PlatformRoot.h"
#include "device/RunningSystemFacts.h"
#include "plist/CachedPropertyListFile.h"
#include "util/Log.h"
#include "util/PropertyListFile.h"

namespace tavrix::device {
namespace {

plist::CachedPropertyListFile& tableFile() {
    static plist::CachedPropertyListFile file(resolvePath("/etc/tavrix/DeviceInfo.plist"));
    return file;
}

// The table's dictionary, or null when it is missing or unusable. An unusable table is logged
// only by the read that parsed it, so each version of the file is reported once.
std::shared_ptr<const plist::Value> currentTable() {
    auto snapshot = tableFile().read();
    if (snapshot.state == plist::CachedPropertyListFile::State::Damaged) {
        if (snapshot.freshlyRead) {
            logPropertyListRefusal(tableFile().path(), snapshot.refusal, "ignoring it");
        }
        return nullptr;
    }
    if (snapshot.state == plist::CachedPropertyListFile::State::Missing) {
        return nullptr;
    }
    if (!snapshot.value->isDictionary()) {
        if (snapshot.freshlyRead) {
            logCFormat("Device information table %s is not a dictionary; ignoring it",
                       tableFile().path().c_str());
        }
        return nullptr;
    }
    return snapshot.value;
}

std::optional<plist::Value> answerFrom(const plist::Value* table, std::string_view key) {
    if (table != nullptr) {
        if (const plist::Value* entry = table->find(key)) {
            return *entry;
        }
    }
    return runningSystemAnswer(platformRoot(), key);
}

}  // namespace

std::optional<plist::Value> copyDeviceAnswer(std::string_view key) {
    auto table = currentTable();
    return answerFrom(table.get(), key);
}

std::optional<std::string> copyDeviceStringAnswer(std::string_view key) {
    auto answer = copyDeviceAnswer(key);
    if (!answer || !answer->isString()) {
        return std::nullopt;
    }
    return *answer->asString();
}

bool deviceBooleanAnswer(std::string_view key) {
    auto answer = copyDeviceAnswer(key);
    const bool* flag = answer ? answer->asBoolean() : nullptr;
    return flag != nullptr && *flag;
}

plist::Dictionary copyDeviceAnswers(const std::vector<std::string>& keys) {
    // One read of the table for all keys, so the answers belong to one version of it.
    auto table = currentTable();
    plist::Dictionary answers;
    for (const std::string& key : keys) {
        if (auto answer = answerFrom(table.get(), key)) {
            answers.insert_or_assign(key, std::move(*answer));
        }
    }
    return answers;
}

}  // namespace tavrix::device
