#include "device/HomeDirectories.h"

#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string_view>
#include <utility>

#include "device/MobileUser.h"
#include "util/Log.h"
#include "util/SharedInstance.h"

namespace tavrix::device {
namespace {

constexpr mode_t kDirectoryMode = 0755;

std::string errorText(int error) {
    return std::strerror(error);
}

// What another user put where the daemon's own directory belongs goes, in a directory the daemon
// owns: a link or file removed, a directory renamed aside (its content is not the daemon's to
// delete). A link goes whoever made it; the daemon's and root's own files and directories stay.
bool moveAside(const io::Directory& parent, const std::string& name, const struct stat& entry) {
    if (parent.status().st_uid != ::geteuid() ||
        (io::isTrustedOwner(entry.st_uid) && !S_ISLNK(entry.st_mode))) {
        return false;
    }
    if (!S_ISDIR(entry.st_mode)) {
        return parent.removeEntry(name) == 0;
    }
    const std::string aside = "." + name + ".untrusted-" + std::to_string(entry.st_ino);
    return ::renameat2(parent.fd(), name.c_str(), parent.fd(), aside.c_str(), RENAME_NOREPLACE) ==
           0;
}

// The child name of parent as a protected directory, or nothing (logged once).
std::optional<io::Directory> openProtectedChild(const io::Directory& parent,
                                                const std::string& name, bool createMissing) {
    // One pass may create the directory, another move something out of its way first.
    for (int attempt = 0; attempt < 3; ++attempt) {
        int error = 0;
        std::optional<io::Directory> child = parent.openChild(name, &error);
        std::string why;
        if (child) {
            Result<> protectedChild = io::checkProtected(child->status());
            if (protectedChild) {
                return child;
            }
            why = protectedChild.reason();
        } else if (error == ENOENT && createMissing) {
            if (::mkdirat(parent.fd(), name.c_str(), kDirectoryMode) == 0) {
                // The umask must not narrow what the mobile user's applications need to read.
                // Should this fail, the directory is only less readable: the daemon goes on.
                if (::fchmodat(parent.fd(), name.c_str(), kDirectoryMode, 0) != 0) {
                }
            } else if (errno != EEXIST) {
                logCFormat(LogPriority::Warning, "Cannot create the directory %s: %s\n",
                           parent.pathOf(name).c_str(), errorText(errno).c_str());
                return std::nullopt;
            }
            continue;
        } else if (error == ENOENT) {
            return std::nullopt;
        } else {
            why = error == ELOOP ? "it is a symbolic link" : errorText(error);
        }
        logDistrustOnce(parent.pathOf(name), why);
        std::optional<struct stat> entry = parent.entryStatus(name);
        if (!createMissing || !entry || !moveAside(parent, name, *entry)) {
            return std::nullopt;
        }
        logCFormat("Moved %s out of the way of the daemon's own directory\n",
                   parent.pathOf(name).c_str());
    }
    return std::nullopt;
}

}  // namespace

bool DistrustedPaths::addFirst(const std::string& path, const std::string& reason) {
    std::lock_guard lock(mutex_);
    return logged_.emplace(path, reason).second;
}

void logDistrustOnce(const std::string& path, const std::string& reason) {
    auto& distrusted = SharedInstance<DistrustedPaths>::current().instance(
        [] { return std::make_unique<DistrustedPaths>(); });
    if (!distrusted.addFirst(path, reason)) {
        return;
    }
    logCFormat("Not trusting %s: %s; treating it as absent\n", path.c_str(), reason.c_str());
}

std::optional<io::Directory> openDirectoryInHome(const std::string& home,
                                                 const std::string& directoryPath,
                                                 bool createMissing) {
    if (home.empty() || !(directoryPath == home || directoryPath.starts_with(home + "/"))) {
        logDistrustOnce(directoryPath, "it is outside the mobile home " + home);
        return std::nullopt;
    }
    int error = 0;
    std::optional<io::Directory> current =
        io::Directory::open(home, io::Directory::LastLink::Refuse, &error);
    if (!current) {
        logDistrustOnce(home, error == ELOOP ? "it is a symbolic link" : errorText(error));
        return std::nullopt;
    }
    if (Result<> protectedHome = io::checkProtected(current->status()); !protectedHome) {
        logDistrustOnce(home, protectedHome.reason());
        return std::nullopt;
    }
    std::string_view rest = std::string_view(directoryPath).substr(home.size());
    while (current && !rest.empty()) {
        std::size_t start = rest.find_first_not_of('/');
        if (start == std::string_view::npos) {
            break;
        }
        rest.remove_prefix(start);
        std::size_t end = rest.find('/');
        std::string name(rest.substr(0, end));
        rest.remove_prefix(end == std::string_view::npos ? rest.size() : end);
        if (name == "." || name == "..") {
            logDistrustOnce(directoryPath, "it names . or ..");
            return std::nullopt;
        }
        current = openProtectedChild(*current, name, createMissing);
    }
    return current;
}

std::optional<io::Directory> openMobileHomeDirectory(const std::string& directoryPath,
                                                     bool createMissing) {
    const char* home = MobileUser::homeDirectory();
    if (home == nullptr) {
        return std::nullopt;
    }
    return openDirectoryInHome(home, directoryPath, createMissing);
}

}  // namespace tavrix::device
