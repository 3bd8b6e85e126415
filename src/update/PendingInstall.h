// The durable note of an over-the-air install under way: written before the old user bundle is
// removed, marked installed once the install has run (the new one in place and matched, or its
// copy failed), and removed once the download is purged. At the next launch after a crash or power
// loss, an install not yet marked is completed from the download still cached, and a marked one
// has its download purged (a purge cut short leaves part of it, which must never be installed).
#pragma once

#include <optional>
#include <string>

namespace tavrix {

struct PendingInstall {
    std::string assetDirectory;
    bool installed = false;
};

// "<root>/var/lib/tavrixservicesd/pending-install.plist".
std::string pendingInstallMarkerPath();

// Records the install's state (flushed to disk before it answers). False, logged, when it cannot
// be written.
[[nodiscard]] bool writePendingInstall(const PendingInstall& install);
// The install that did not finish, or nothing.
std::optional<PendingInstall> readPendingInstall();
void removePendingInstall();

}  // namespace tavrix
