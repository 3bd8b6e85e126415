// The user database under the platform root. With the root "/", the system's own lookup (NSS);
// with another root, the file <root>/etc/passwd, and home directories resolved under that root.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <string_view>

namespace tavrix::device {

struct UserRecord {
    std::string name;
    uid_t uid = 0;
    gid_t gid = 0;
    // Already resolved under the platform root ("/var/mobile" -> "<root>/var/mobile").
    std::string homeDirectory;
};

// The entry for name in the user database of the platform root, or nothing.
std::optional<UserRecord> lookupUser(std::string_view name);

// The entry for name in the user database of the given root ("" or "/" for the system's own).
std::optional<UserRecord> lookupUserUnder(std::string_view root, std::string_view name);

// The system's own entry for uid, its home directory as the system has it.
std::optional<UserRecord> lookupSystemUser(uid_t uid);

}  // namespace tavrix::device
