// The durable note of an over-the-air install under way: written before the old user bundle is
// removed and removed once the new one is matched and its download purged, so that an install cut
// short by a crash or power loss is completed at the next launch from the download still cached.
#pragma once

#include <optional>
#include <string>

namespace tavrix {

// "<root>/var/lib/tavrixservicesd/pending-install.plist".
std::string pendingInstallMarkerPath();

// Records that the asset in assetDirectory is being installed (flushed to disk before it
// answers). False, logged, when it cannot be written.
bool writePendingInstall(const std::string& assetDirectory);
// The asset directory of an install that did not finish, or nothing.
std::optional<std::string> readPendingInstall();
void removePendingInstall();

}  // namespace tavrix
