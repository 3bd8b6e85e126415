#include "util/FileSystemHelper.h"

#include <sys/stat.h>
#include <unistd.h>

#include "io/Paths.h"
#include "util/FileSystemUtilities.h"

namespace tavrix {
namespace {

void giveOwner(const std::string& path, uid_t uid, gid_t gid) {
    if (::lchown(path.c_str(), uid, gid) != 0) {
        // Best effort: the transfer goes ahead with the owner the source has.
    }
}

}  // namespace

bool FileSystemHelper::fileExists(const std::string& path) const {
    struct stat info {};
    return ::stat(path.c_str(), &info) == 0;
}

int FileSystemHelper::createDirectory(const std::string& path, mode_t mode,
                                      bool withIntermediates) const {
    return createDirectoryAt(path, mode, withIntermediates);
}

int FileSystemHelper::removeItem(const std::string& path) const {
    return removeItemTree(path);
}

int FileSystemHelper::listDirectory(const std::string& path, std::vector<std::string>& list,
                                    bool fullPaths) const {
    std::vector<std::string> names;
    if (int error = readDirectoryNames(path, names)) {
        return error;
    }
    list.clear();
    for (const std::string& name : names) {
        list.push_back(fullPaths ? path + "/" + name : name);
    }
    return 0;
}

int FileSystemHelper::copyItem(const std::string& source, const std::string& destination) const {
    return transferItem(source, destination, ::getuid(), ::getgid(), true);
}

int FileSystemHelper::moveItem(const std::string& source, const std::string& destination) const {
    return transferItem(source, destination, ::getuid(), ::getgid(), false);
}

int FileSystemHelper::moveItemWithOwner(const std::string& source, const std::string& destination,
                                        uid_t uid, gid_t gid) const {
    return transferItem(source, destination, uid, gid, false);
}

int FileSystemHelper::transferItem(const std::string& source, const std::string& destination,
                                   uid_t uid, gid_t gid, bool copy) const {
    struct stat sourceInfo {};
    if (::stat(source.c_str(), &sourceInfo) != 0) {
        return -1;
    }
    switch (itemKind(destination)) {
        case ItemKind::Missing: {
            giveOwner(source, uid, gid);
            // The primitives answer EIO themselves for a failure without an errno.
            return copy ? copyItemTree(source, destination) : moveItemTree(source, destination);
        }
        case ItemKind::Directory: {
            std::string target = destination + "/" + io::lastPathComponent(source);
            if (itemKind(target) == ItemKind::Other) {
                removeItemTree(target);
            }
            giveOwner(source, uid, gid);
            mergeItemInto(source, target, copy);
            return 0;
        }
        case ItemKind::Other:
            break;
    }
    if (S_ISDIR(sourceInfo.st_mode)) {
        return kExistsErrorCode;
    }
    removeItemTree(destination);
    giveOwner(source, uid, gid);
    mergeItemInto(source, destination, copy);
    return 0;
}

int FileSystemHelper::setPermissions(const std::string& path, mode_t mode, bool recursive) const {
    return recursive ? setAttributesRecursively(path, Permissions{mode})
                     : ::chmod(path.c_str(), mode);
}

int FileSystemHelper::setOwner(const std::string& path, uid_t uid, gid_t gid,
                               bool recursive) const {
    return recursive ? setAttributesRecursively(path, Ownership{uid, gid})
                     : ::chown(path.c_str(), uid, gid);
}

int FileSystemHelper::copyFileBetweenDirectories(const std::string& sourceDirectory,
                                                 const std::string& destinationDirectory,
                                                 const std::string& name) const {
    if (!fileExists(destinationDirectory) &&
        createDirectoryAt(destinationDirectory, 0755, true) != 0) {
        return -1;
    }
    return transferItem(sourceDirectory + "/" + name, destinationDirectory + "/" + name, ::getuid(),
                        ::getgid(), true);
}

}  // namespace tavrix
