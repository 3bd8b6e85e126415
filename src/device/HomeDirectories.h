// The daemon's directories in the mobile home (Library, its Preferences, the bundles), where every
// application can reach as the mobile user. Each is opened from the home one component at a
// time, never through a symbolic link, and every component, the home included, must be one
// nobody else can rearrange (io::whyNotProtected): then no other user can move, replace or
// redirect anything the daemon keeps below it. What fails is logged once and treated as absent.
#pragma once

#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>

#include "io/Directory.h"

namespace tavrix::device {

// The directory at directoryPath, the home itself or a directory below it. With createMissing,
// missing components are created (mode 0755), and a link or file in the way, or a directory of
// another owner, inside a directory the daemon owns is moved out of the way for the daemon's own.
// Nothing (logged once) for a path outside the home or a component that fails the check.
std::optional<io::Directory> openDirectoryInHome(const std::string& home,
                                                 const std::string& directoryPath,
                                                 bool createMissing);

// The same below the mobile user's home directory; nothing when it is unknown.
std::optional<io::Directory> openMobileHomeDirectory(const std::string& directoryPath,
                                                     bool createMissing);

// The paths distrusted so far, each with its reason: one per daemon root, so that a path is
// reported once for the daemon's life however often it is looked at.
class DistrustedPaths {
  public:
    // True the first time this path is distrusted for this reason.
    bool addFirst(const std::string& path, const std::string& reason);

  private:
    std::mutex mutex_;
    std::set<std::pair<std::string, std::string>> logged_;
};

// Logs "Not trusting <path>: <reason>; treating it as absent" the first time this path is
// distrusted for this reason.
void logDistrustOnce(const std::string& path, const std::string& reason);

}  // namespace tavrix::device
