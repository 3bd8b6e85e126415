// What the daemon last did that an operator asks about: the last update check and the last bundle
// payload, each with its time, outcome and one-line reason. Kept in one small property list under
// the state directory, so that it survives the daemon's idle exit.
#pragma once

#include <string>

#include "plist/Value.h"

namespace tavrix {

// The outcome words of an update check; the reason says the rest in words.
inline constexpr const char* kCheckUpToDate = "up-to-date";
// Nothing newer yet: a newer version is in a staged rollout that leaves this device out so far.
inline constexpr const char* kCheckHeldBack = "held-back";
inline constexpr const char* kCheckInstalled = "installed";
inline constexpr const char* kCheckDownloading = "downloading";
inline constexpr const char* kCheckNoCatalog = "no-catalog";
inline constexpr const char* kCheckCatalogRefused = "catalog-refused";
inline constexpr const char* kCheckFetchFailed = "fetch-failed";
inline constexpr const char* kCheckDownloadFailed = "download-failed";
inline constexpr const char* kCheckInstallFailed = "install-failed";
inline constexpr const char* kCheckNotSupported = "not-supported";

// Keys of the record, which are also the status view's.
inline constexpr const char* kLastCheckKey = "LastCheck";
inline constexpr const char* kLastPayloadKey = "LastPayload";
inline constexpr const char* kActivityTimeKey = "Time";
inline constexpr const char* kActivityOutcomeKey = "Outcome";
inline constexpr const char* kActivityReasonKey = "Reason";
inline constexpr const char* kActivityExtractedKey = "Extracted";

// "<root>/var/lib/tavrixservicesd/activity.plist".
std::string activityRecordPath();

// Each stamps the entry with the current time and replaces the one before. Safe from any thread;
// a record that cannot be written is logged and otherwise ignored.
void recordUpdateCheck(const std::string& outcome, const std::string& reason);
void recordPayload(bool extracted, const std::string& reason);

// The record as kept: LastCheck and LastPayload dictionaries, each present once written.
plist::Dictionary copyActivityRecord();

// Told of every entry once it is recorded (key, outcome or "" for a payload, reason), on the
// recording thread; the daemon announces them from its main loop. One observer; null for none.
using ActivityObserver = void (*)(const char* key, const std::string& outcome,
                                  const std::string& reason);
void setActivityObserver(ActivityObserver observer);

}  // namespace tavrix
