#include "device/UserDatabase.h"

#include <pwd.h>
#include <unistd.h>

#include <cstdio>
#include <memory>
#include <vector>

#include "device/PlatformRoot.h"

namespace tavrix::device {
namespace {

struct FileCloser {
    void operator()(std::FILE* file) const { std::fclose(file); }
};

UserRecord recordFrom(const passwd& entry, std::string_view root) {
    UserRecord record;
    record.name = entry.pw_name;
    record.uid = entry.pw_uid;
    record.gid = entry.pw_gid;
    std::string_view home = entry.pw_dir == nullptr ? "" : entry.pw_dir;
    record.homeDirectory = home.empty() ? std::string() : resolvePathUnder(root, home);
    return record;
}

// The system's entry that lookup(entry, buffer, size, found) answers, with a buffer that grows
// while the C library says it is too small (up to 1 MiB).
template <typename Lookup>
std::optional<UserRecord> lookupInSystem(Lookup lookup) {
    long suggested = ::sysconf(_SC_GETPW_R_SIZE_MAX);
    std::vector<char> buffer(suggested > 0 ? static_cast<std::size_t>(suggested) : 4096);
    for (;;) {
        passwd entry{};
        passwd* found = nullptr;
        int error = lookup(&entry, buffer.data(), buffer.size(), &found);
        if (error == ERANGE && buffer.size() < (1u << 20)) {
            buffer.resize(buffer.size() * 2);
            continue;
        }
        if (error != 0 || found == nullptr) {
            return std::nullopt;
        }
        return recordFrom(entry, "");
    }
}

std::optional<UserRecord> lookupInFile(std::string_view root, std::string_view name) {
    std::string path = resolvePathUnder(root, "/etc/passwd");
    std::unique_ptr<std::FILE, FileCloser> file(std::fopen(path.c_str(), "re"));
    if (!file) {
        return std::nullopt;
    }
    std::vector<char> buffer(4096);
    for (;;) {
        passwd entry{};
        passwd* found = nullptr;
        int error = ::fgetpwent_r(file.get(), &entry, buffer.data(), buffer.size(), &found);
        if (error == ERANGE && buffer.size() < (1u << 20)) {
            // fgetpwent_r leaves the stream at the long line; a bigger buffer re-reads it.
            buffer.resize(buffer.size() * 2);
            continue;
        }
        if (error != 0 || found == nullptr) {
            return std::nullopt;
        }
        if (name == entry.pw_name) {
            return recordFrom(entry, root);
        }
    }
}

}  // namespace

std::optional<UserRecord> lookupUserUnder(std::string_view root, std::string_view name) {
    while (!root.empty() && root.back() == '/') {
        root.remove_suffix(1);
    }
    if (!root.empty()) {
        return lookupInFile(root, name);
    }
    const std::string key(name);
    return lookupInSystem([&](passwd* entry, char* buffer, std::size_t size, passwd** found) {
        return ::getpwnam_r(key.c_str(), entry, buffer, size, found);
    });
}

std::optional<UserRecord> lookupSystemUser(uid_t uid) {
    return lookupInSystem([uid](passwd* entry, char* buffer, std::size_t size, passwd** found) {
        return ::getpwuid_r(uid, entry, buffer, size, found);
    });
}

std::optional<UserRecord> lookupUser(std::string_view name) {
    return lookupUserUnder(platformRoot(), name);
}

}  // namespace tavrix::device
