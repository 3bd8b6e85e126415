#include "io/Directory.h"

#include <dirent.h>
#include <fcntl.h>
#include <stdio.h>
#include <sys/file.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <vector>

#include "io/FileIO.h"
#include "io/Paths.h"
#include "io/Random.h"

namespace tavrix::io {
namespace {

constexpr int kOpenFlags = O_RDONLY | O_DIRECTORY | O_CLOEXEC;
// A temporary younger than this may be one another writer has just made.
constexpr long kTemporaryGraceSeconds = 5;
// Enough tries that a directory crowded with other users' look-alike names cannot stop a write.
constexpr int kTemporaryNameAttempts = 100;

// A temporary name nobody can predict, so that nobody can plant something there first.
std::string temporaryName() {
    static constexpr char kAlphabet[] =
        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
    unsigned char random[12] = {};
    fillRandom(random, sizeof random);
    std::string name = kAtomicWritePrefix;
    for (unsigned char byte : random) {
        name += kAlphabet[byte % (sizeof kAlphabet - 1)];
    }
    return name;
}

// Removes the temporary entry unless it was renamed into place.
class TemporaryEntry {
  public:
    TemporaryEntry(int directory, std::string name)
        : directory_(directory), name_(std::move(name)) {}
    ~TemporaryEntry() {
        if (!name_.empty()) {
            ::unlinkat(directory_, name_.c_str(), 0);
        }
    }
    TemporaryEntry(const TemporaryEntry&) = delete;
    TemporaryEntry& operator=(const TemporaryEntry&) = delete;

    const char* name() const { return name_.c_str(); }
    void keep() { name_.clear(); }

  private:
    int directory_;
    std::string name_;
};

// A rename that fails with EEXIST instead of replacing; file systems without that flag get a
// plain rename after checking that nothing is there.
int renameWithoutReplacing(int directory, const char* from, const char* to) {
    if (::renameat2(directory, from, directory, to, RENAME_NOREPLACE) == 0) {
        return 0;
    }
    if (errno != EINVAL && errno != ENOSYS) {
        return errno;
    }
    struct stat existing {};
    if (::fstatat(directory, to, &existing, AT_SYMLINK_NOFOLLOW) == 0) {
        return EEXIST;
    }
    return ::renameat(directory, from, directory, to) == 0 ? 0 : errno;
}

bool isValidName(std::string_view name) {
    return !name.empty() && name != "." && name != ".." &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

}  // namespace

bool isTrustedOwner(uid_t owner) {
    return owner == 0 || isOwnUser(owner);
}

bool isOwnUser(uid_t owner) {
    return owner == ::geteuid();
}

Result<> checkProtected(const struct stat& directory) {
    if (!S_ISDIR(directory.st_mode)) {
        return Failure{"it is not a directory"};
    }
    if (!isTrustedOwner(directory.st_uid)) {
        return Failure{"it belongs to user " + std::to_string(directory.st_uid)};
    }
    if ((directory.st_mode & (S_IWGRP | S_IWOTH)) != 0 && (directory.st_mode & S_ISVTX) == 0) {
        return Failure{"others may write in it and it is not sticky"};
    }
    return {};
}

Directory::Directory(UniqueFd fd, std::string path, const struct stat& status)
    : fd_(std::move(fd)), path_(std::move(path)), status_(status) {}

std::optional<Directory> Directory::open(const std::string& path, LastLink lastLink, int* error) {
    UniqueFd fd(::open(path.empty() ? "." : path.c_str(),
                       kOpenFlags | (lastLink == LastLink::Refuse ? O_NOFOLLOW : 0)));
    struct stat status {};
    if (!fd || ::fstat(fd.get(), &status) != 0) {
        // O_NOFOLLOW with O_DIRECTORY reports a link as "not a directory".
        *error = errno == ENOTDIR && lastLink == LastLink::Refuse ? ELOOP : errno;
        return std::nullopt;
    }
    return Directory(std::move(fd), path, status);
}

std::optional<Directory> Directory::openChild(std::string_view name, int* error) const {
    if (!isValidName(name)) {
        *error = EINVAL;
        return std::nullopt;
    }
    const std::string child(name);
    UniqueFd fd(::openat(fd_.get(), child.c_str(), kOpenFlags | O_NOFOLLOW));
    struct stat status {};
    if (!fd || ::fstat(fd.get(), &status) != 0) {
        int failure = errno;
        struct stat entry {};
        if (failure == ENOTDIR &&
            ::fstatat(fd_.get(), child.c_str(), &entry, AT_SYMLINK_NOFOLLOW) == 0 &&
            S_ISLNK(entry.st_mode)) {
            failure = ELOOP;
        }
        *error = failure;
        return std::nullopt;
    }
    return Directory(std::move(fd), pathOf(name), status);
}

std::string Directory::pathOf(std::string_view name) const {
    if (path_.empty() || path_.back() == '/') {
        return path_ + std::string(name);
    }
    return path_ + "/" + std::string(name);
}

int Directory::writeFile(std::string_view name, mode_t mode, bool replace,
                         const std::function<int(int fd)>& fill) const {
    if (!isValidName(name)) {
        return EISDIR;
    }
    UniqueFd file;
    std::string temporary;
    for (int attempt = 0; !file && attempt < kTemporaryNameAttempts; ++attempt) {
        temporary = temporaryName();
        file.reset(::openat(fd_.get(), temporary.c_str(),
                            O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
        if (!file && errno != EEXIST) {
            return errno;
        }
    }
    if (!file) {
        return EEXIST;
    }
    TemporaryEntry entry(fd_.get(), temporary);
    // Held while the file is written, so that a clean-up of abandoned temporaries (by another
    // process with the same prefix) can tell this one is in use.
    ::flock(file.get(), LOCK_EX | LOCK_NB);
    if (int error = fill(file.get()); error != 0) {
        return error;
    }
    if (::fchmod(file.get(), mode) != 0 || ::fsync(file.get()) != 0) {
        return errno;
    }
    if (::close(file.release()) != 0) {
        return errno;
    }
    const std::string target(name);
    if (replace) {
        if (::renameat(fd_.get(), entry.name(), fd_.get(), target.c_str()) != 0) {
            return errno;
        }
    } else if (int error = renameWithoutReplacing(fd_.get(), entry.name(), target.c_str());
               error != 0) {
        return error;
    }
    entry.keep();
    // The rename is durable only once the directory is flushed; a failure there leaves the new
    // file in place, so it does not count against the write.
    ::fsync(fd_.get());
    return 0;
}

int Directory::writeFile(std::string_view name, mode_t mode, bool replace,
                         std::string_view bytes) const {
    return writeFile(name, mode, replace, [bytes](int fd) { return writeAll(fd, bytes); });
}

int Directory::replaceSymlink(std::string_view name, const std::string& target) const {
    if (!isValidName(name)) {
        return EINVAL;
    }
    std::string temporary;
    int error = EEXIST;
    for (int attempt = 0; error == EEXIST && attempt < kTemporaryNameAttempts; ++attempt) {
        temporary = temporaryName();
        error = ::symlinkat(target.c_str(), fd_.get(), temporary.c_str()) == 0 ? 0 : errno;
    }
    if (error != 0) {
        return error;
    }
    TemporaryEntry entry(fd_.get(), temporary);
    const std::string link(name);
    if (::renameat(fd_.get(), entry.name(), fd_.get(), link.c_str()) != 0) {
        // A plain remove would take an empty directory; one that holds something stays.
        if ((errno != EISDIR && errno != ENOTEMPTY && errno != EEXIST) ||
            ::unlinkat(fd_.get(), link.c_str(), AT_REMOVEDIR) != 0 ||
            ::renameat(fd_.get(), entry.name(), fd_.get(), link.c_str()) != 0) {
            return errno;
        }
    }
    entry.keep();
    ::fsync(fd_.get());
    return 0;
}

UniqueFd Directory::openOwnFile(std::string_view name, int* error) const {
    if (!isValidName(name)) {
        *error = EINVAL;
        return UniqueFd();
    }
    // Without O_NONBLOCK, opening a FIFO would wait for a writer for ever.
    UniqueFd file(::openat(fd_.get(), std::string(name).c_str(),
                           O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    struct stat status {};
    if (!file || ::fstat(file.get(), &status) != 0) {
        *error = errno;
        return UniqueFd();
    }
    if (!S_ISREG(status.st_mode)) {
        *error = EINVAL;
        return UniqueFd();
    }
    if (!isTrustedOwner(status.st_uid)) {
        *error = EPERM;
        return UniqueFd();
    }
    return file;
}

std::optional<struct stat> Directory::entryStatus(std::string_view name) const {
    struct stat status {};
    if (!isValidName(name)) {
        errno = EINVAL;
        return std::nullopt;
    }
    if (::fstatat(fd_.get(), std::string(name).c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
        return std::nullopt;
    }
    return status;
}

int Directory::removeEntry(std::string_view name) const {
    if (!isValidName(name)) {
        return EINVAL;
    }
    const std::string entry(name);
    if (::unlinkat(fd_.get(), entry.c_str(), 0) == 0) {
        return 0;
    }
    if (errno != EISDIR) {
        return errno;
    }
    return ::unlinkat(fd_.get(), entry.c_str(), AT_REMOVEDIR) == 0 ? 0 : errno;
}

int Directory::flushTree(std::string_view name) const {
    if (!isValidName(name)) {
        return EINVAL;
    }
    const std::string entry(name);
    // A link, a FIFO, a socket or a device node has no data of its own to flush (fsync refuses
    // them) and is flushed with the directory that holds it; a device is never opened.
    struct stat entryStatus {};
    if (::fstatat(fd_.get(), entry.c_str(), &entryStatus, AT_SYMLINK_NOFOLLOW) != 0) {
        return errno;
    }
    if (!S_ISREG(entryStatus.st_mode) && !S_ISDIR(entryStatus.st_mode)) {
        return 0;
    }
    UniqueFd fd(::openat(fd_.get(), entry.c_str(),
                         O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd) {
        // Replaced by a link since: that is flushed with the directory too.
        return errno == ELOOP ? 0 : errno;
    }
    struct stat status {};
    if (::fstat(fd.get(), &status) != 0) {
        return errno;
    }
    if (S_ISDIR(status.st_mode)) {
        // The listing reads from its own descriptor, so that fd stays for the flush below.
        UniqueFd listingFd(::openat(fd.get(), ".", kOpenFlags));
        std::unique_ptr<DIR, int (*)(DIR*)> listing(
            listingFd ? ::fdopendir(listingFd.get()) : nullptr, &::closedir);
        if (!listing) {
            return errno;
        }
        listingFd.release();  // the listing owns it now
        const Directory directory(std::move(fd), pathOf(name), status);
        std::vector<std::string> names;
        errno = 0;
        while (const dirent* child = ::readdir(listing.get())) {
            const std::string_view childName(child->d_name);
            if (childName != "." && childName != "..") {
                names.emplace_back(childName);
            }
        }
        if (errno != 0) {
            return errno;
        }
        for (const std::string& child : names) {
            if (int error = directory.flushTree(child); error != 0) {
                return error;
            }
        }
        return ::fsync(directory.fd()) == 0 ? 0 : errno;
    }
    return ::fsync(fd.get()) == 0 ? 0 : errno;
}

int Directory::renameEntry(std::string_view from, std::string_view to) const {
    if (!isValidName(from) || !isValidName(to)) {
        return EINVAL;
    }
    if (::renameat(fd_.get(), std::string(from).c_str(), fd_.get(), std::string(to).c_str()) != 0) {
        return errno;
    }
    ::fsync(fd_.get());
    return 0;
}

int Directory::exchangeEntries(std::string_view a, std::string_view b) const {
    if (!isValidName(a) || !isValidName(b)) {
        return EINVAL;
    }
    if (::renameat2(fd_.get(), std::string(a).c_str(), fd_.get(), std::string(b).c_str(),
                    RENAME_EXCHANGE) != 0) {
        return errno;
    }
    ::fsync(fd_.get());
    return 0;
}

UniqueFd openOwnFile(const std::string& path, int* error) {
    auto directory = Directory::open(parentDirectory(path), Directory::LastLink::Refuse, error);
    if (!directory) {
        return UniqueFd();
    }
    if (!checkProtected(directory->status())) {
        *error = EPERM;
        return UniqueFd();
    }
    return directory->openOwnFile(lastPathComponent(path), error);
}

bool isAbandonedTemporary(const Directory& directory, std::string_view name) {
    if (!std::string_view(name).starts_with(kAtomicWritePrefix)) {
        return false;
    }
    auto entry = directory.entryStatus(name);
    if (!entry || entry->st_uid != ::geteuid()) {
        return false;
    }
    if (S_ISREG(entry->st_mode)) {
        UniqueFd file(::openat(directory.fd(), std::string(name).c_str(),
                               O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
        // A writer still holds it.
        if (file && ::flock(file.get(), LOCK_EX | LOCK_NB) != 0) {
            return false;
        }
    }
    // A link, or a file made a moment ago and not yet locked by its writer, stays a while.
    timespec now{};
    ::clock_gettime(CLOCK_REALTIME, &now);
    return now.tv_sec - entry->st_mtim.tv_sec > kTemporaryGraceSeconds;
}

}  // namespace tavrix::io
