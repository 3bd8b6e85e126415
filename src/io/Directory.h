// A directory held open by descriptor: the one way to write in a directory. What is created,
// replaced or read in it stays in it whoever renames its path meanwhile, temporary files are
// created exclusively and never through a symbolic link, and entries change by rename only.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "base/Result.h"
#include "io/UniqueFd.h"

namespace tavrix::io {

// What the temporary names of an interrupted write start with, so that start-up can find them.
inline constexpr const char* kAtomicWritePrefix = ".tavrix-write-";

// Root and the process's own user: the only owners whose files and directories are trusted.
bool isTrustedOwner(uid_t owner);
// Whether owner is the user this process runs as.
bool isOwnUser(uid_t owner);

// Fails, saying why, unless a directory is a place for the daemon's own files: owned by a
// trusted user, and writable by others only with the sticky bit, so that nobody else can rename,
// replace or remove what the daemon keeps there.
Result<> checkProtected(const struct stat& directory);

class Directory {
  public:
    enum class LastLink { Follow, Refuse };

    // The directory at path; a symbolic link as its last component is followed or refused
    // (ELOOP). Nothing, with the errno in *error, when it cannot be opened.
    static std::optional<Directory> open(const std::string& path, LastLink lastLink, int* error);

    // The directory name inside this one, never reached through a symbolic link (ELOOP).
    std::optional<Directory> openChild(std::string_view name, int* error) const;

    int fd() const { return fd_.get(); }
    const std::string& path() const { return path_; }
    std::string pathOf(std::string_view name) const;
    // As it was when opened.
    const struct stat& status() const { return status_; }

    // Writes name whole or not at all: fill writes the content into a new temporary file created
    // exclusively in this directory, which is flushed, given mode and renamed over name (without
    // replace, only where nothing is: EEXIST); the directory is flushed after. 0 or an errno.
    int writeFile(std::string_view name, mode_t mode, bool replace,
                  const std::function<int(int fd)>& fill) const;
    int writeFile(std::string_view name, mode_t mode, bool replace, std::string_view bytes) const;

    // Points the symbolic link name at target: made under a temporary name and renamed over
    // whatever is there (an empty directory in the way is removed), so that a reader finds the
    // old link or the new one; the directory is flushed after. 0 or an errno.
    int replaceSymlink(std::string_view name, const std::string& target) const;

    // name opened for reading: a regular file, reached without a symbolic link, owned by a
    // trusted user. Otherwise an empty descriptor and *error: ENOENT, ELOOP (a link), EPERM
    // (another owner), EINVAL (not a regular file) or the errno of the open.
    UniqueFd openOwnFile(std::string_view name, int* error) const;

    // What is at name, links not followed; nothing with errno set.
    std::optional<struct stat> entryStatus(std::string_view name) const;

    // Removes name: a file or link, or an empty directory. 0 or an errno.
    int removeEntry(std::string_view name) const;

    // Flushes every file and directory of the tree at name, deepest first, without following a
    // link: what a writer that does not flush (the archive extractor, a copy) left there is on
    // the disk before the tree is renamed into place. Links, FIFOs, sockets and device nodes are
    // left to their directory's flush, never opened. 0 or an errno.
    int flushTree(std::string_view name) const;

    // Renames from over to, both in this directory, and flushes it. 0 or an errno.
    int renameEntry(std::string_view from, std::string_view to) const;

    // Swaps the entries at a and b, both in this directory, in one step, and flushes it: a
    // reader finds one or the other under each name, never neither. 0 or an errno (ENOENT when
    // either is missing, EINVAL or ENOSYS where the file system cannot swap).
    int exchangeEntries(std::string_view a, std::string_view b) const;

  private:
    Directory(UniqueFd fd, std::string path, const struct stat& status);

    UniqueFd fd_;
    std::string path_;
    struct stat status_ {};
};

// Whether name in directory is a temporary of this process's user that no writer uses any more
// (its writer died): named with kAtomicWritePrefix, not locked by a writer, and not brand new.
bool isAbandonedTemporary(const Directory& directory, std::string_view name);

// The daemon's own file at path: Directory::openOwnFile in path's directory, which must be no
// link and protected (EPERM otherwise).
UniqueFd openOwnFile(const std::string& path, int* error);

}  // namespace tavrix::io
