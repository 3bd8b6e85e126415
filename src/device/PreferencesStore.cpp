#include "device/PreferencesStore.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <system_error>

#include "device/HomeDirectories.h"
#include "device/UserDatabase.h"
#include "io/Directory.h"
#include "io/UniqueFd.h"
#include "plist/CachedPropertyListFile.h"
#include "plist/PropertyListFormat.h"
#include "util/Log.h"
#include "util/PropertyListFile.h"
#include "util/SharedInstance.h"

namespace tavrix::device {
namespace {

const Failure kNotADictionary{"it is not a dictionary"};

constexpr std::string_view kPreferencesDirectory = "/Library/Preferences";
constexpr std::string_view kExtension = ".plist";
constexpr std::string_view kLockExtension = ".lock";
constexpr mode_t kFileMode = 0644;
// Only the daemon and root take the lock: nobody else can hold a write back for ever.
constexpr mode_t kLockFileMode = 0600;
constexpr int kLockAttempts = 4;

std::string errorText(int error) {
    return std::generic_category().message(error);
}

void logFailure(const char* action, const std::string& path, int error) {
    logCFormat(LogPriority::Warning, "Preferences: cannot %s %s: %s", action, path.c_str(),
               errorText(error).c_str());
}

// A name used as one path component: a domain or a user.
bool isValidComponent(std::string_view name) {
    return !name.empty() && name != "." && name != ".." &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

// Identifies one version of a file, so that damage is logged once per version.
struct FileVersion {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    timespec modified{};

    bool operator==(const FileVersion& other) const {
        return device == other.device && inode == other.inode && size == other.size &&
               modified.tv_sec == other.modified.tv_sec &&
               modified.tv_nsec == other.modified.tv_nsec;
    }
};

std::optional<FileVersion> versionOf(const std::string& path) {
    struct stat info {};
    if (::stat(path.c_str(), &info) != 0) {
        return std::nullopt;
    }
    return FileVersion{info.st_dev, info.st_ino, info.st_size, info.st_mtim};
}

std::string ownerText(uid_t owner) {
    return "it belongs to user " + std::to_string(owner);
}

// Holds an exclusive flock on the domain's lock file for its lifetime. The file is the daemon's
// own, mode 0600 (anything else at its name is replaced), since a lock anyone could open is a
// lock anyone could hold for ever.
class DomainLock {
  public:
    DomainLock(const io::Directory& directory, const std::string& name) {
        // Made whole under a temporary name and renamed into place, so that whatever else sits
        // at the name (a link planted there first) is replaced in one step, never raced.
        for (int attempt = 0; attempt < kLockAttempts && !fd_; ++attempt) {
            fd_.reset(::openat(directory.fd(), name.c_str(), O_RDWR | O_NOFOLLOW | O_CLOEXEC));
            struct stat info {};
            if (fd_ && ::fstat(fd_.get(), &info) == 0 && S_ISREG(info.st_mode) &&
                io::isTrustedOwner(info.st_uid)) {
                break;
            }
            const bool missing = !fd_ && errno == ENOENT;
            fd_.reset();
            directory.writeFile(name, kLockFileMode, /*replace=*/!missing, std::string_view());
        }
        if (!fd_) {
            return;
        }
        int result = 0;
        do {
            result = ::flock(fd_.get(), LOCK_EX);
        } while (result != 0 && errno == EINTR);
        locked_ = result == 0;
    }
    DomainLock(const DomainLock&) = delete;
    DomainLock& operator=(const DomainLock&) = delete;

    bool locked() const { return locked_; }

  private:
    io::UniqueFd fd_;
    bool locked_ = false;
};

}  // namespace

struct PreferencesStore::Domain {
    Domain(std::string home, std::string directory, std::string fileName)
        : home(std::move(home)),
          directory(std::move(directory)),
          fileName(std::move(fileName)),
          path(this->directory + "/" + this->fileName),
          file(path, [this] { return openForReading(); }) {}

    // The domain's file: the daemon's own (or root's), in the protected Preferences directory.
    // A symbolic link of the daemon's is followed (the behavior settings are read through one);
    // anything another user put there reads as no file.
    io::UniqueFd openForReading() const {
        auto preferences = openDirectoryInHome(home, directory, false);
        if (!preferences) {
            return {};
        }
        auto entry = preferences->entryStatus(fileName);
        if (!entry) {
            return {};
        }
        if (!io::isTrustedOwner(entry->st_uid)) {
            logDistrustOnce(path, ownerText(entry->st_uid));
            return {};
        }
        const int follow = S_ISLNK(entry->st_mode) ? 0 : O_NOFOLLOW;
        io::UniqueFd fd(::openat(preferences->fd(), fileName.c_str(),
                                 O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC | follow));
        struct stat opened {};
        if (!fd || ::fstat(fd.get(), &opened) != 0) {
            return {};
        }
        // A file is judged by what was opened; a link that was followed must still be the
        // daemon's (another user may have put one there only after the first look).
        if (follow == 0) {
            auto now = preferences->entryStatus(fileName);
            if (!now || !S_ISLNK(now->st_mode) || !io::isTrustedOwner(now->st_uid)) {
                return {};
            }
        }
        return io::isTrustedOwner(opened.st_uid) ? std::move(fd) : io::UniqueFd();
    }

    std::string home;
    std::string directory;
    std::string fileName;
    std::string path;
    plist::CachedPropertyListFile file;
    // Values set and not yet synchronized; nothing means the key is removed.
    std::map<std::string, std::optional<plist::Value>, std::less<>> pending;
    std::optional<FileVersion> loggedDamage;
};

PreferencesStore& PreferencesStore::shared() {
    return SharedInstance<PreferencesStore>::current().instance(
        [] { return std::make_unique<PreferencesStore>(); });
}

PreferencesStore::PreferencesStore() = default;
PreferencesStore::~PreferencesStore() = default;

std::optional<plist::Value> PreferencesStore::copyValue(std::string_view key,
                                                        std::string_view domain,
                                                        std::string_view user) {
    std::lock_guard lock(mutex_);
    Domain* state = domainFor(domain, user);
    if (state == nullptr) {
        return std::nullopt;
    }
    if (auto change = state->pending.find(key); change != state->pending.end()) {
        return change->second;
    }
    auto snapshot = state->file.read();
    if (snapshot.state == plist::CachedPropertyListFile::State::Missing) {
        return std::nullopt;
    }
    if (snapshot.value == nullptr || !snapshot.value->isDictionary()) {
        if (snapshot.freshlyRead) {
            logDamage(*state, snapshot.value == nullptr ? snapshot.refusal : kNotADictionary);
        }
        return std::nullopt;
    }
    const plist::Value* found = snapshot.value->find(key);
    return found == nullptr ? std::nullopt : std::optional<plist::Value>(*found);
}

void PreferencesStore::setValue(std::string_view key, const std::optional<plist::Value>& value,
                                std::string_view domain, std::string_view user) {
    std::lock_guard lock(mutex_);
    Domain* state = domainFor(domain, user);
    if (state != nullptr) {
        state->pending.insert_or_assign(std::string(key), value);
    }
}

bool PreferencesStore::synchronize(std::string_view domain, std::string_view user) {
    std::lock_guard lock(mutex_);
    Domain* state = domainFor(domain, user);
    return state != nullptr && synchronizeLocked(*state);
}

bool PreferencesStore::storeValue(std::string_view key, const std::optional<plist::Value>& value,
                                  std::string_view domain, std::string_view user) {
    std::lock_guard lock(mutex_);
    Domain* state = domainFor(domain, user);
    if (state == nullptr) {
        return false;
    }
    auto [change, inserted] = state->pending.insert_or_assign(std::string(key), value);
    if (!synchronizeLocked(*state)) {
        state->pending.erase(change);
        return false;
    }
    return true;
}

bool PreferencesStore::synchronizeLocked(Domain& domain) {
    if (!domain.pending.empty()) {
        if (!writePending(domain)) {
            return false;
        }
        domain.pending.clear();
    }
    domain.file.invalidate();
    return true;
}

PreferencesStore::Domain* PreferencesStore::domainFor(std::string_view domain,
                                                      std::string_view user) {
    if (!isValidComponent(domain) || domain.size() + kExtension.size() > NAME_MAX) {
        logCFormat(LogPriority::Warning, "Preferences: invalid domain name \"%s\"",
                   std::string(domain).c_str());
        return nullptr;
    }
    if (!isValidComponent(user)) {
        logCFormat(LogPriority::Warning, "Preferences: invalid user name \"%s\"",
                   std::string(user).c_str());
        return nullptr;
    }
    auto userDomains = users_.find(user);
    if (userDomains != users_.end()) {
        if (auto known = userDomains->second.find(domain); known != userDomains->second.end()) {
            return known->second.get();
        }
    }
    auto record = lookupUser(user);
    if (!record || record->homeDirectory.empty()) {
        logCFormat("Preferences: no home directory for user \"%s\"", std::string(user).c_str());
        return nullptr;
    }
    std::string directory = record->homeDirectory + std::string(kPreferencesDirectory);
    auto& slot = users_[std::string(user)][std::string(domain)];
    slot = std::make_unique<Domain>(record->homeDirectory, std::move(directory),
                                    std::string(domain) + std::string(kExtension));
    return slot.get();
}

bool PreferencesStore::writePending(Domain& domain) {
    auto preferences = openDirectoryInHome(domain.home, domain.directory, true);
    if (!preferences) {
        logCFormat(LogPriority::Warning, "Preferences: cannot use the directory %s",
                   domain.directory.c_str());
        return false;
    }
    DomainLock lock(*preferences, "." + domain.fileName + std::string(kLockExtension));
    if (!lock.locked()) {
        logFailure("lock", domain.path, errno);
        return false;
    }

    // Read afresh under the lock: another process may have written other keys since. Only the
    // daemon's own file is merged; whatever else is there is replaced.
    plist::Dictionary contents;
    int error = 0;
    io::UniqueFd current = preferences->openOwnFile(domain.fileName, &error);
    if (current) {
        // A file too large to read is not a damaged one: its values are unknown, not absent, and
        // writing would drop them all.
        struct stat info {};
        if (::fstat(current.get(), &info) != 0 ||
            static_cast<std::uint64_t>(info.st_size) > plist::kMaxPropertyListBytes) {
            logFailure("read", domain.path, EFBIG);
            return false;
        }
        Result<plist::Value> stored = plist::readOpenFile(current.get());
        if (!stored && stored.failure().error != 0) {
            logFailure("read", domain.path, stored.failure().error);
            return false;
        }
        if (stored && stored->isDictionary()) {
            contents = std::move(*stored->asDictionary());
        } else {
            logDamage(domain, stored ? kNotADictionary : stored.failure());
        }
    } else if (error == EPERM || error == ELOOP || error == EINVAL) {
        auto entry = preferences->entryStatus(domain.fileName);
        logDistrustOnce(domain.path, error == ELOOP    ? "it is a symbolic link"
                                     : error == EINVAL ? "it is not a regular file"
                                                       : ownerText(entry ? entry->st_uid : 0));
    } else if (error != ENOENT) {
        logFailure("read", domain.path, error);
        return false;
    }

    for (const auto& [key, value] : domain.pending) {
        if (value) {
            contents.insert_or_assign(key, *value);
        } else if (auto existing = contents.find(key); existing != contents.end()) {
            contents.erase(existing);
        }
    }
    // Never a file its own reader would refuse, and then read as empty.
    Result<std::string> bytes = plist::serialize(plist::Value(std::move(contents)));
    if (!bytes) {
        logCFormat("Preferences: not writing %s: %s", domain.path.c_str(), bytes.reason().c_str());
        return false;
    }
    if (int failure = preferences->writeFile(domain.fileName, kFileMode, true, *bytes);
        failure != 0) {
        logFailure("replace", domain.path, failure);
        return false;
    }
    return true;
}

void PreferencesStore::logDamage(Domain& domain, const Failure& refusal) {
    auto version = versionOf(domain.path);
    if (version && domain.loggedDamage == version) {
        return;
    }
    domain.loggedDamage = version;
    logPropertyListRefusal(domain.path, refusal, "reading it as empty");
}

}  // namespace tavrix::device
