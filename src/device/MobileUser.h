// Facts about the "mobile" user, the owner of the per-user bundle data and preferences: its name,
// home directory, uid and gid, looked up once in the user database of the platform root on the
// first use of any accessor and never changed afterwards.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <string_view>

namespace tavrix::device {

class MobileUser {
  public:
    struct Facts {
        // Resolved under the root; nothing when the user or its home directory is unknown.
        std::optional<std::string> homeDirectory;
        // 0 when the user is unknown.
        uid_t uid = 0;
        gid_t gid = 0;
    };

    // The user's facts from the user database of root ("" or "/" for the system's own).
    static Facts lookUpUnder(std::string_view root);

    // "mobile".
    static const std::string& name();
    // The home directory, or null when it is unknown.
    static const char* homeDirectory();
    static uid_t uid();
    static gid_t gid();

  private:
    static const Facts& facts();
};

}  // namespace tavrix::device
