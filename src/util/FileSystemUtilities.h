// Small synchronous file-system utilities shared by the bundle manager, the payload unpacker and
// the over-the-air installer, plus a few conversions. Error codes are 0 for success, else an errno
// value; 5 (EIO) and 17 (EEXIST) are the two fixed codes some operations answer on their own.
// Nothing here logs.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "plist/Value.h"

namespace tavrix {

// The fixed codes: an I/O error (also "failed without an errno") and "already exists".
inline constexpr int kIOErrorCode = 5;
inline constexpr int kExistsErrorCode = 17;

// ---- Primitive tree operations (what FileSystemHelper and mergeItemInto are built on) ----

// What lies at a path: symbolic links are followed, and a dangling link counts as Other.
enum class ItemKind { Missing, Directory, Other };
ItemKind itemKind(const std::string& path);

// The names in a directory, one level, in the order the kernel gives them ("." and ".." left
// out). 0, or the errno of the failure with names left as they were.
int readDirectoryNames(const std::string& path, std::vector<std::string>& names);

// Creates a directory. mode, when given, is set on the new directory itself (umask does not
// apply); without it the directory gets 0777 less the umask. withIntermediates creates missing
// parents (always with the umask default) and accepts an existing directory. 0 or errno.
int createDirectoryAt(const std::string& path, std::optional<mode_t> mode, bool withIntermediates);

// Removes a file, a symbolic link (not its target) or a whole tree, opening up directories that
// lack write permission when that is what stops it. 0 or errno (ENOENT when nothing is there).
int removeItemTree(const std::string& path);

// Gives every directory in the tree at path (links not followed) read, write and search
// permission for its owner. Best effort.
void makeDirectoriesWritable(const std::string& path);

// What copying the tree at path takes on disk, rounded up to whole 4 KiB blocks per entry.
std::uint64_t diskBytesOfTree(const std::string& path);

// Copies source to destination, which must not exist (EEXIST otherwise): regular files with their
// content and mode, directories with everything in them, symbolic links as links. A failure part
// way leaves what was copied so far. 0 or errno.
int copyItemTree(const std::string& source, const std::string& destination);

// Moves source to destination, which must not exist (EEXIST otherwise): a rename that never
// replaces, or across file systems a copy followed by removing the source. 0 or errno.
int moveItemTree(const std::string& source, const std::string& destination);

// The bytes an unprivileged writer may still use on the file system holding path, or nothing
// when it cannot be examined.
std::optional<std::uint64_t> availableBytesAt(const std::string& path);
// The size of the file system holding path, in bytes, or nothing when it cannot be read.
std::optional<std::uint64_t> capacityBytesAt(const std::string& path);

// ---- Merging and attributes ----

// Copies (copy true) or moves source to destination. When destination already exists and source
// is a directory, the tree is merged entry by entry: an existing non-directory is replaced by a
// non-directory of the source, directories are merged, entries only in destination stay. In move
// mode the emptied source directory is removed at the end. Failures of single entries do not stop
// the merge.
void mergeItemInto(const std::string& source, const std::string& destination, bool copy);

// Attributes that setAttributesRecursively applies: permission bits, or an owner and group.
struct Permissions {
    mode_t mode = 0;
};
struct Ownership {
    uid_t uid = 0;
    gid_t gid = 0;
};
using FileAttributes = std::variant<Permissions, Ownership>;

// Applies attributes to path and, when it is a directory, to everything below it (children before
// their directory; symbolic links below path are never followed: their owner is changed on the
// link itself and permissions are left alone). 5 when path does not exist; otherwise the errno of
// the last failure below path, or the failure on path itself, or 0.
int setAttributesRecursively(const std::string& path, const FileAttributes& attributes);

// Creates every missing prefix of path that ends in "/" (mkdir 0777 under the umask, then chown
// to uid:gid and chmod to mode); the last component is created only when path ends with "/".
// Paths longer than 1022 characters are followed only that far. 0, or errno of a failing mkdir.
int makeDirectoryPath(const std::string& path, uid_t uid, gid_t gid, mode_t mode);

// ---- Conversions ----

// Orders two numbers (Integer or Real values, compared exactly, NaN before every other number).
// The same object or two missing values give 0; a missing a gives -1; a missing b gives 1. A value
// that is not a number counts as missing.
int compareNumbersNullsFirst(const plist::Value* a, const plist::Value* b);

// The command name of the running process pid, or nothing when there is no such process.
std::optional<std::string> copyProcessNameForPID(pid_t pid);

// Where copyCStringFromString takes memory from when the caller's buffer is too small.
struct CStringAllocator {
    void* (*allocate)(std::size_t size) = std::malloc;
    void (*deallocate)(void* pointer) = std::free;
};

enum class StringEncoding { Utf8 };

// The string as a NUL-terminated C string. When buffer is given, *inOutLength holds its capacity
// (non-zero) and the string with its NUL fits, the string is written there and buffer is
// answered; otherwise a copy is allocated from allocator (the caller frees it with
// allocator.deallocate). When inOutLength is given it receives the string's length without the
// NUL. When allocating fails: the buffer emptied (first byte NUL) or null, with length 0.
char* copyCStringFromString(const CStringAllocator& allocator, std::string_view string,
                            char* buffer, std::size_t* inOutLength,
                            StringEncoding encoding = StringEncoding::Utf8);

// The property-list dictionary in the file at path, or nothing when the file is missing, damaged
// or holds something other than a dictionary.
std::optional<plist::Value> loadDictionaryAtPath(const std::string& path);

}  // namespace tavrix
