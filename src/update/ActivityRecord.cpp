#include "update/ActivityRecord.h"

#include <atomic>
#include <cstring>
#include <mutex>

#include "device/DaemonStateFile.h"
#include "plist/PropertyListFormat.h"
#include "util/Clock.h"
#include "util/Log.h"

namespace tavrix {
namespace {

constexpr const char* kRecordFileName = "activity.plist";
constexpr mode_t kRecordMode = 0644;

// The main thread (payloads, checks a client asks for) and the download thread both write.
std::mutex& recordLock() {
    static std::mutex lock;
    return lock;
}

plist::Dictionary readRecordLocked() {
    return device::readDaemonStateFile(kRecordFileName);
}

std::atomic<ActivityObserver> observer{nullptr};

void replaceEntry(const char* key, plist::Dictionary entry) {
    entry.insert_or_assign(kActivityTimeKey, plist::Value(plist::Date{Clock::absoluteTimeNow()}));
    std::lock_guard lock(recordLock());
    plist::Dictionary record = readRecordLocked();
    record.insert_or_assign(key, plist::Value(std::move(entry)));
    // Binary keeps the fraction of a second, so two checks within a second stay apart.
    if (int error = device::writeDaemonStateFile(kRecordFileName, plist::Value(std::move(record)),
                                                 plist::Format::Binary, kRecordMode);
        error != 0) {
        logCFormat(LogPriority::Warning, "Could not record the %s in %s: %s\n", key,
                   activityRecordPath().c_str(), std::strerror(error));
    }
}

}  // namespace

std::string activityRecordPath() {
    return device::daemonStateFilePath(kRecordFileName);
}

void recordUpdateCheck(const std::string& outcome, const std::string& reason) {
    replaceEntry(kLastCheckKey, {{kActivityOutcomeKey, plist::Value(outcome)},
                                 {kActivityReasonKey, plist::Value(reason)}});
    if (ActivityObserver told = observer.load()) {
        told(kLastCheckKey, outcome, reason);
    }
}

void recordPayload(bool extracted, const std::string& reason) {
    replaceEntry(kLastPayloadKey, {{kActivityExtractedKey, plist::Value(extracted)},
                                   {kActivityReasonKey, plist::Value(reason)}});
    if (ActivityObserver told = observer.load()) {
        told(kLastPayloadKey, "", reason);
    }
}

void setActivityObserver(ActivityObserver newObserver) {
    observer.store(newObserver);
}

plist::Dictionary copyActivityRecord() {
    std::lock_guard lock(recordLock());
    return readRecordLocked();
}

}  // namespace tavrix
