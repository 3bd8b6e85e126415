#include "device/PreferencesStore.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <system_error>

#include "device/UserDatabase.h"
#include "io/AtomicFile.h"
#include "io/Paths.h"
#include "io/UniqueFd.h"
#include "plist/CachedPropertyListFile.h"
#include "plist/PropertyListFormat.h"
#include "util/Log.h"
#include "util/PropertyListFile.h"

namespace tavrix::device {
namespace {

const plist::Refusal kNotADictionary{0, "it is not a dictionary"};

constexpr std::string_view kPreferencesDirectory = "/Library/Preferences";
constexpr std::string_view kExtension = ".plist";
constexpr mode_t kDirectoryMode = 0755;
constexpr mode_t kFileMode = 0644;
// The kernel's own limit on links followed in one lookup.
constexpr int kMaxLinkHops = 40;

std::string errorText(int error) {
    return std::generic_category().message(error);
}

void logFailure(const char* action, const std::string& path, int error) {
    logCFormat("Preferences: cannot %s %s: %s", action, path.c_str(), errorText(error).c_str());
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

// Creates path and its missing parents with mode 0755.
bool makeDirectories(const std::string& path) {
    struct stat info {};
    if (::stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode)) {
        return true;
    }
    for (std::size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
        std::string prefix = path.substr(0, end);
        if (::mkdir(prefix.c_str(), kDirectoryMode) == 0) {
            // The umask must not narrow what other readers of the preferences need.
            ::chmod(prefix.c_str(), kDirectoryMode);
        } else if (errno != EEXIST) {
            logFailure("create directory", prefix, errno);
            return false;
        }
        if (end == std::string::npos) {
            break;
        }
    }
    return true;
}

std::optional<std::string> readLink(const std::string& path) {
    auto target = io::readLinkTarget(path);
    if (!target) {
        logFailure("read symbolic link", path, errno);
    }
    return target;
}

// The file that writing to path must replace: path itself, or the file at the end of its chain of
// symbolic links, so that a domain linked to another file keeps its link.
std::optional<std::string> writeTarget(const std::string& path) {
    std::string current = path;
    for (int hop = 0; hop < kMaxLinkHops; ++hop) {
        struct stat info {};
        if (::lstat(current.c_str(), &info) != 0) {
            if (errno == ENOENT) {
                return current;
            }
            logFailure("examine", current, errno);
            return std::nullopt;
        }
        if (!S_ISLNK(info.st_mode)) {
            return current;
        }
        auto target = readLink(current);
        if (!target) {
            return std::nullopt;
        }
        current = !target->empty() && target->front() == '/'
                      ? *target
                      : io::parentDirectory(current) + "/" + *target;
    }
    logFailure("follow the symbolic links at", path, ELOOP);
    return std::nullopt;
}

// Replaces the file at target with bytes so that readers see either the old or the new file whole.
bool replaceFile(const std::string& target, std::string_view bytes) {
    if (int error = io::replaceFileAtomically(target, bytes, kFileMode); error != 0) {
        logFailure("replace", target, error);
        return false;
    }
    return true;
}

// Holds an exclusive flock on a descriptor for its lifetime.
class ExclusiveLock {
  public:
    explicit ExclusiveLock(int fd) : fd_(fd) {
        int result = 0;
        do {
            result = ::flock(fd_, LOCK_EX);
        } while (result != 0 && errno == EINTR);
        locked_ = result == 0;
    }
    ~ExclusiveLock() {
        if (locked_) {
            ::flock(fd_, LOCK_UN);
        }
    }
    ExclusiveLock(const ExclusiveLock&) = delete;
    ExclusiveLock& operator=(const ExclusiveLock&) = delete;

    bool locked() const { return locked_; }

  private:
    int fd_;
    bool locked_ = false;
};

}  // namespace

struct PreferencesStore::Domain {
    Domain(std::string directory, std::string path)
        : directory(std::move(directory)), path(std::move(path)), file(this->path) {}

    std::string directory;
    std::string path;
    plist::CachedPropertyListFile file;
    // Values set and not yet synchronized; nothing means the key is removed.
    std::map<std::string, std::optional<plist::Value>, std::less<>> pending;
    std::optional<FileVersion> loggedDamage;
};

PreferencesStore& PreferencesStore::shared() {
    // Never destroyed: other threads may still read preferences while the process exits.
    static PreferencesStore* store = new PreferencesStore();
    return *store;
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
    if (state == nullptr) {
        return false;
    }
    if (!state->pending.empty()) {
        if (!writePending(*state)) {
            return false;
        }
        state->pending.clear();
    }
    state->file.invalidate();
    return true;
}

PreferencesStore::Domain* PreferencesStore::domainFor(std::string_view domain,
                                                      std::string_view user) {
    if (!isValidComponent(domain) || domain.size() + kExtension.size() > NAME_MAX) {
        logCFormat("Preferences: invalid domain name \"%s\"", std::string(domain).c_str());
        return nullptr;
    }
    if (!isValidComponent(user)) {
        logCFormat("Preferences: invalid user name \"%s\"", std::string(user).c_str());
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
    std::string path = directory + "/" + std::string(domain) + std::string(kExtension);
    auto& slot = users_[std::string(user)][std::string(domain)];
    slot = std::make_unique<Domain>(std::move(directory), std::move(path));
    return slot.get();
}

bool PreferencesStore::writePending(Domain& domain) {
    if (!makeDirectories(domain.directory)) {
        return false;
    }
    // The domain file is replaced by rename, so the lock is on the directory that holds it.
    io::UniqueFd directoryFd(::open(domain.directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!directoryFd) {
        logFailure("open directory", domain.directory, errno);
        return false;
    }
    ExclusiveLock lock(directoryFd.get());
    if (!lock.locked()) {
        logFailure("lock directory", domain.directory, errno);
        return false;
    }
    auto target = writeTarget(domain.path);
    if (!target) {
        return false;
    }

    // Read afresh under the lock: another process may have written other keys since.
    plist::Dictionary contents;
    struct stat info {};
    if (::stat(target->c_str(), &info) == 0) {
        if (!S_ISREG(info.st_mode)) {
            logCFormat("Preferences: %s is not a regular file", target->c_str());
            return false;
        }
        plist::Refusal refusal;
        auto current = plist::readFile(*target, &refusal);
        if (!current && refusal.error != 0) {
            logFailure("read", *target, refusal.error);
            return false;
        }
        if (current && current->isDictionary()) {
            contents = std::move(*current->asDictionary());
        } else {
            logDamage(domain, current ? kNotADictionary : refusal);
        }
    } else if (errno != ENOENT) {
        logFailure("examine", *target, errno);
        return false;
    }

    for (const auto& [key, value] : domain.pending) {
        if (value) {
            contents.insert_or_assign(key, *value);
        } else if (auto existing = contents.find(key); existing != contents.end()) {
            contents.erase(existing);
        }
    }
    std::string bytes = plist::serialize(plist::Value(std::move(contents)));
    if (bytes.empty()) {
        logCFormat("Preferences: cannot encode the values for %s", domain.path.c_str());
        return false;
    }
    return replaceFile(*target, bytes);
}

void PreferencesStore::logDamage(Domain& domain, const plist::Refusal& refusal) {
    auto version = versionOf(domain.path);
    if (version && domain.loggedDamage == version) {
        return;
    }
    domain.loggedDamage = version;
    logPropertyListRefusal(domain.path, refusal, "reading it as empty");
}

}  // namespace tavrix::device
