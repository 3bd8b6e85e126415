// The file-system object of the bundle manager, the payload unpacker and the installer: existence,
// directory creation, removal, listing, copy and move with merge, permissions and ownership.
// It keeps no state; callers create one on the stack around a group of operations. Operations
// answer 0 for success, else an errno value (5 and 17 as documented below). Nothing here logs.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace tavrix {

class FileSystemHelper {
  public:
    FileSystemHelper() = default;
    FileSystemHelper(const FileSystemHelper&) = delete;
    FileSystemHelper& operator=(const FileSystemHelper&) = delete;

    // True when something exists at path (symbolic links followed).
    bool fileExists(const std::string& path) const;

    // Creates a directory whose permissions are mode (not reduced by the umask); with
    // withIntermediates missing parents are created too and an existing directory is accepted.
    [[nodiscard]] int createDirectory(const std::string& path, mode_t mode, bool withIntermediates) const;

    // Removes a file, a symbolic link or a whole tree.
    int removeItem(const std::string& path) const;

    // The entries of the directory, one level, in the kernel's order: bare names, or path + "/" +
    // name with fullPaths. On success list is replaced; on failure it is left as it was.
    int listDirectory(const std::string& path, std::vector<std::string>& list,
                      bool fullPaths) const;

    // transferItem with the process's own uid and gid, in copy or move mode.
    int copyItem(const std::string& source, const std::string& destination) const;
    int moveItem(const std::string& source, const std::string& destination) const;
    // transferItem in move mode.
    int moveItemWithOwner(const std::string& source, const std::string& destination, uid_t uid,
                          gid_t gid) const;

    // Copies (copy true) or moves source to destination, first giving the source (not following a
    // symbolic link) the owner uid:gid, best effort:
    // - destination missing: a plain copy or move; the failure's errno (5 without one) or 0;
    // - destination a directory: source goes to destination/<last component of source>, merged
    //   entry by entry into a directory already there (a non-directory there is replaced); 0;
    // - destination something else: 17 when source is a directory, else it is replaced; 0.
    // -1 when the source cannot be examined.
    int transferItem(const std::string& source, const std::string& destination, uid_t uid,
                     gid_t gid, bool copy) const;

    // Non-recursive: chmod's result (0 or -1). Recursive: as setAttributesRecursively.
    int setPermissions(const std::string& path, mode_t mode, bool recursive) const;
    // Non-recursive: chown's result (0 or -1). Recursive: as setAttributesRecursively.
    int setOwner(const std::string& path, uid_t uid, gid_t gid, bool recursive) const;

    // Copies sourceDirectory/name to destinationDirectory/name (transferItem with the process's
    // own uid and gid), first creating destinationDirectory (0755, with intermediates) when
    // missing; -1 when that fails.
    int copyFileBetweenDirectories(const std::string& sourceDirectory,
                                   const std::string& destinationDirectory,
                                   const std::string& name) const;
};

}  // namespace tavrix
