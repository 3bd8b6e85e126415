// How the linked bundle and a newly matched one differ, and the grammar by which a behavior ID and
// a version are read back out of an overlay carrier file name:
//   <prefix>+<bundle name>+<overlay key>[+<extra identifier>]+<version>.plist
// with the prefix "device+behavior", "id+behavior" or "device+id+behavior".
// BundleManager::compareBundles is defined with these.
#pragma once

#include <string>

#include "bundle/BundleTypes.h"
#include "bundle/CarrierBundle.h"

namespace tavrix {

inline constexpr char kCarrierFileNameDelimiter = '+';

// What going from one overlay type to another changes: equal types nothing, a change of the
// behavior bit alone an override switch, any change of the device bit an update. Unknown (logged)
// when either type is above kDeviceBehaviorOverlay.
BundleChangeType changeTypeForOverlayTransition(OverlayType current, OverlayType matched);

// True when matched is to replace current although both are the same bundle: its version is
// higher, or its carrier file name carries another behavior ID or a higher version.
bool isCandidateBundleNewer(const CarrierBundle& current, const CarrierBundle& matched);

// True when the matched carrier file name carries another behavior ID than the current one, or
// the same ID with a higher version. False when either name cannot be read.
bool compareCarrierFileNames(const std::string& currentName, const std::string& matchedName);

// The overlay key of an overlay carrier file name; empty when the name is no overlay file name or
// does not have four or five pieces after its prefix.
std::string behaviorIDFromCarrierFileName(const std::string& fileName);

// The text between the last '+' and the first ".plist" of an overlay carrier file name; empty when
// there is none.
std::string versionFromCarrierFileName(const std::string& fileName);

// True when the record's bundle and preferences links are in place and lead where it says.
bool bundleLinksExist(const CarrierBundle& bundle);

}  // namespace tavrix
