// The status view: what an operator asks about the daemon's state, read from what a launch already
// has at hand (preferences, links, Info dictionaries, the job store, the activity record). Reading
// it starts no work: no catalog fetch, no bundle match.
#pragma once

#include "plist/Value.h"

namespace tavrix {

inline constexpr const char* kStatusBehaviorIDKey = "BehaviorID";
inline constexpr const char* kStatusSupportedKey = "Supported";
inline constexpr const char* kStatusWhyNotSupportedKey = "WhyNotSupported";
inline constexpr const char* kStatusLinkedBundleKey = "LinkedBundle";
inline constexpr const char* kStatusSystemBundleVersionKey = "SystemBundleVersion";
inline constexpr const char* kStatusUserBundleVersionKey = "UserBundleVersion";
inline constexpr const char* kStatusNextUpdateCheckKey = "NextUpdateCheck";
inline constexpr const char* kStatusDaemonVersionKey = "DaemonVersion";
// True while this daemon waits for the previous one to finish its work.
inline constexpr const char* kStatusWaitingForPreviousDaemonKey = "WaitingForPreviousDaemon";
// LastCheck and LastPayload come from the activity record under its own keys.

// The status dictionary; a key is absent when its answer is unknown or none. A daemon that does not
// hold the instance lock yet leaves out the linked bundle and the next check (reading them would
// start the bundle manager's clean-up and the check timer) and says it is waiting.
plist::Dictionary copyDaemonStatus(bool holdsInstanceLock);

}  // namespace tavrix
