#include "util/FileSystemUtilities.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <memory>
#include <system_error>

#include "io/AtomicFile.h"
#include "io/FileIO.h"
#include "io/Paths.h"
#include "io/UniqueFd.h"
#include "plist/PropertyListFormat.h"
#include "util/PropertyListFile.h"

namespace tavrix {
namespace {

// errno after a failed call; EIO for the rare failure that sets none.
int lastError() {
    return errno != 0 ? errno : kIOErrorCode;
}

std::string joinPath(const std::string& directory, const std::string& name) {
    return directory + "/" + name;
}

// The copy appears under its final name complete, with the source's mode, or not at all: a full
// disk or a crash part way must never leave a truncated file that looks installed.
int copyFileContents(const std::string& source, const std::string& destination, mode_t mode) {
    io::UniqueFd in(::open(source.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!in) {
        return lastError();
    }
    return io::createFileAtomicallyWith(destination, mode & 07777, [&in](int out) {
        return io::readChunks(in.get(),
                              [out](std::string_view chunk) { return io::writeAll(out, chunk); });
    });
}

int copySymbolicLink(const std::string& source, const std::string& destination) {
    auto target = io::readLinkTarget(source);
    if (!target) {
        return lastError();
    }
    return ::symlink(target->c_str(), destination.c_str()) == 0 ? 0 : lastError();
}

int copyEntry(const std::string& source, const std::string& destination, const struct stat& info) {
    if (S_ISREG(info.st_mode)) {
        return copyFileContents(source, destination, info.st_mode);
    }
    if (S_ISLNK(info.st_mode)) {
        return copySymbolicLink(source, destination);
    }
    if (!S_ISDIR(info.st_mode)) {
        return ENOTSUP;
    }
    // Names first, so that copying a directory into itself does not copy the copy.
    std::vector<std::string> names;
    if (int error = readDirectoryNames(source, names)) {
        return error;
    }
    // Owner-only until filled, so that a read-only source directory can still be copied.
    if (::mkdir(destination.c_str(), 0700) != 0) {
        return lastError();
    }
    for (const std::string& name : names) {
        std::string from = joinPath(source, name);
        struct stat child {};
        if (::lstat(from.c_str(), &child) != 0) {
            return lastError();
        }
        if (int error = copyEntry(from, joinPath(destination, name), child)) {
            return error;
        }
    }
    return ::chmod(destination.c_str(), info.st_mode & 07777) == 0 ? 0 : lastError();
}

bool entryExists(const std::string& path) {
    struct stat info {};
    return ::lstat(path.c_str(), &info) == 0;
}

int transfer(const std::string& source, const std::string& destination, bool copy) {
    return copy ? copyItemTree(source, destination) : moveItemTree(source, destination);
}

bool isRealDirectory(const std::string& path) {
    struct stat info {};
    return ::lstat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

// Merges the entries of sourceRoot/sub into destinationRoot/sub, parents before children; a
// directory that could be transferred whole is not entered. Keeps the first failure in firstError.
void mergeEntries(const std::string& sourceRoot, const std::string& destinationRoot,
                  const std::string& sub, bool copy, int& firstError) {
    std::string sourceDirectory = sub.empty() ? sourceRoot : joinPath(sourceRoot, sub);
    std::string destinationDirectory =
        sub.empty() ? destinationRoot : joinPath(destinationRoot, sub);
    std::vector<std::string> names;
    if (readDirectoryNames(sourceDirectory, names) != 0 || names.empty()) {
        return;
    }
    createDirectoryAt(destinationDirectory, std::nullopt, true);
    for (const std::string& name : names) {
        std::string s = joinPath(sourceDirectory, name);
        std::string d = joinPath(destinationDirectory, name);
        if (itemKind(d) == ItemKind::Other && itemKind(s) == ItemKind::Other) {
            removeItemTree(d);
        }
        int error = transfer(s, d, copy);
        if (error == 0) {
            continue;
        }
        if (firstError == 0) {
            firstError = error;
        }
        if (isRealDirectory(s)) {
            mergeEntries(sourceRoot, destinationRoot, sub.empty() ? name : joinPath(sub, name),
                         copy, firstError);
        }
    }
}

int applyAttributes(const std::string& path, const FileAttributes& attributes, bool followLinks) {
    if (const auto* owner = std::get_if<Ownership>(&attributes)) {
        return followLinks ? ::chown(path.c_str(), owner->uid, owner->gid)
                           : ::lchown(path.c_str(), owner->uid, owner->gid);
    }
    if (!followLinks) {
        struct stat info {};
        if (::lstat(path.c_str(), &info) != 0) {
            return -1;
        }
        if (S_ISLNK(info.st_mode)) {
            // Links have no permissions of their own here; never change their target.
            return 0;
        }
    }
    return ::chmod(path.c_str(), std::get<Permissions>(attributes).mode);
}

// Applies attributes to everything below directory, children before their directory. Each
// failure that carries an errno replaces remembered.
void applyAttributesBelow(const std::string& directory, const FileAttributes& attributes,
                          int& remembered) {
    std::vector<std::string> names;
    if (int error = readDirectoryNames(directory, names)) {
        remembered = error;
        return;
    }
    for (const std::string& name : names) {
        std::string path = joinPath(directory, name);
        if (isRealDirectory(path)) {
            applyAttributesBelow(path, attributes, remembered);
        }
        errno = 0;
        if (applyAttributes(path, attributes, false) != 0 && errno != 0) {
            remembered = errno;
        }
    }
}

// a <=> b for an integer and a real, exactly; NaN orders before every number.
int compareIntegerWithReal(const plist::Integer& a, double b) {
    if (std::isnan(b)) {
        return 1;
    }
    if (b >= 0x1p64) {
        return -1;
    }
    if (b < -0x1p63) {
        return 1;
    }
    // The whole part fits the integer's own type once the other's range is ruled out (no
    // 128-bit integers on 32-bit processors).
    const double whole = std::trunc(b);
    if (a.isLargeUnsigned()) {
        if (whole < 0) {
            return 1;
        }
        const auto wholeUnsigned = static_cast<std::uint64_t>(whole);
        if (a.unsignedValue() != wholeUnsigned) {
            return a.unsignedValue() < wholeUnsigned ? -1 : 1;
        }
    } else {
        if (whole >= 0x1p63) {
            return -1;
        }
        const auto wholeSigned = static_cast<std::int64_t>(whole);
        if (a.signedValue() != wholeSigned) {
            return a.signedValue() < wholeSigned ? -1 : 1;
        }
    }
    double fraction = b - whole;
    return fraction > 0 ? -1 : (fraction < 0 ? 1 : 0);
}

template <typename T>
int threeWay(const T& a, const T& b) {
    return a < b ? -1 : (b < a ? 1 : 0);
}

bool isNumber(const plist::Value* value) {
    return value != nullptr && (value->asInteger() != nullptr || value->asReal() != nullptr);
}

}  // namespace

ItemKind itemKind(const std::string& path) {
    struct stat info {};
    if (::stat(path.c_str(), &info) == 0) {
        return S_ISDIR(info.st_mode) ? ItemKind::Directory : ItemKind::Other;
    }
    return entryExists(path) ? ItemKind::Other : ItemKind::Missing;
}

int readDirectoryNames(const std::string& path, std::vector<std::string>& names) {
    std::unique_ptr<DIR, int (*)(DIR*)> directory(::opendir(path.c_str()), ::closedir);
    if (!directory) {
        return lastError();
    }
    std::vector<std::string> found;
    for (;;) {
        errno = 0;
        const dirent* entry = ::readdir(directory.get());
        if (entry == nullptr) {
            if (errno != 0) {
                return errno;
            }
            break;
        }
        if (std::strcmp(entry->d_name, ".") != 0 && std::strcmp(entry->d_name, "..") != 0) {
            found.emplace_back(entry->d_name);
        }
    }
    names = std::move(found);
    return 0;
}

int createDirectoryAt(const std::string& path, std::optional<mode_t> mode, bool withIntermediates) {
    if (withIntermediates) {
        if (itemKind(path) == ItemKind::Directory) {
            return 0;
        }
        std::string parent = io::parentDirectory(path);
        if (!parent.empty() && itemKind(parent) != ItemKind::Directory) {
            if (int error = createDirectoryAt(parent, std::nullopt, true)) {
                return error;
            }
        }
    }
    if (::mkdir(path.c_str(), mode.value_or(0777)) != 0) {
        int error = lastError();
        // Made by someone else in the meantime.
        return withIntermediates && error == EEXIST && itemKind(path) == ItemKind::Directory
                   ? 0
                   : error;
    }
    if (mode && ::chmod(path.c_str(), *mode) != 0) {
        return lastError();
    }
    return 0;
}

int removeItemTree(const std::string& path) {
    if (!entryExists(path)) {
        return lastError();
    }
    std::error_code error;
    std::filesystem::remove_all(path, error);
    if (error == std::errc::permission_denied || error == std::errc::operation_not_permitted) {
        // A directory extracted without write permission must not keep its entries (and leave
        // the next tree mixed into them): open every directory up, then try again.
        makeDirectoriesWritable(path);
        error.clear();
        std::filesystem::remove_all(path, error);
    }
    return error.value();
}

namespace {

// count blocks of the file system holding path, in bytes.
template <typename Count>
std::optional<std::uint64_t> fileSystemBytesAt(const std::string& path, Count count) {
    struct statvfs info {};
    if (::statvfs(path.c_str(), &info) != 0) {
        return std::nullopt;
    }
    // Block counts are in fragment-size units; older kernels leave that zero.
    auto unit = static_cast<std::uint64_t>(info.f_frsize > 0 ? info.f_frsize : info.f_bsize);
    std::uint64_t bytes = 0;
    if (__builtin_mul_overflow(unit, static_cast<std::uint64_t>(count(info)), &bytes)) {
        return UINT64_MAX;
    }
    return bytes;
}

}  // namespace

std::optional<std::uint64_t> availableBytesAt(const std::string& path) {
    return fileSystemBytesAt(path, [](const struct statvfs& info) { return info.f_bavail; });
}

std::optional<std::uint64_t> capacityBytesAt(const std::string& path) {
    return fileSystemBytesAt(path, [](const struct statvfs& info) { return info.f_blocks; });
}

void makeDirectoriesWritable(const std::string& path) {
    struct stat info {};
    if (::lstat(path.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
        return;
    }
    // Before listing: a directory without read or search permission cannot be listed.
    if ((info.st_mode & S_IRWXU) != S_IRWXU) {
        ::chmod(path.c_str(), (info.st_mode & 07777) | S_IRWXU);
    }
    std::vector<std::string> names;
    if (readDirectoryNames(path, names) != 0) {
        return;
    }
    for (const std::string& name : names) {
        makeDirectoriesWritable(joinPath(path, name));
    }
}

std::uint64_t diskBytesOfTree(const std::string& path) {
    constexpr std::uint64_t kBlock = 4096;
    struct stat info {};
    if (::lstat(path.c_str(), &info) != 0) {
        return 0;
    }
    // Whole blocks, as a file system allocates them; a directory or link takes at least one.
    std::uint64_t bytes = std::max<std::uint64_t>(
                              (static_cast<std::uint64_t>(info.st_size) + kBlock - 1) / kBlock, 1) *
                          kBlock;
    if (S_ISDIR(info.st_mode)) {
        std::vector<std::string> names;
        if (readDirectoryNames(path, names) == 0) {
            for (const std::string& name : names) {
                bytes += diskBytesOfTree(joinPath(path, name));
            }
        }
    }
    return bytes;
}

int copyItemTree(const std::string& source, const std::string& destination) {
    struct stat info {};
    if (::lstat(source.c_str(), &info) != 0) {
        return lastError();
    }
    if (entryExists(destination)) {
        return EEXIST;
    }
    return copyEntry(source, destination, info);
}

int moveItemTree(const std::string& source, const std::string& destination) {
    if (::renameat2(AT_FDCWD, source.c_str(), AT_FDCWD, destination.c_str(), RENAME_NOREPLACE) ==
        0) {
        return 0;
    }
    int error = lastError();
    if (error == EINVAL || error == ENOSYS) {
        // A file system without no-replace renames: check, then rename.
        if (entryExists(destination)) {
            return EEXIST;
        }
        if (::rename(source.c_str(), destination.c_str()) == 0) {
            return 0;
        }
        error = lastError();
    }
    if (error != EXDEV) {
        return error;
    }
    if (entryExists(destination)) {
        return EEXIST;
    }
    if (int copyError = copyItemTree(source, destination)) {
        removeItemTree(destination);
        return copyError;
    }
    return removeItemTree(source);
}

void mergeItemInto(const std::string& source, const std::string& destination, bool copy) {
    if (transfer(source, destination, copy) == 0) {
        return;
    }
    if (itemKind(source) == ItemKind::Other) {
        return;
    }
    // The first failure is kept for inspection only; the merge has no result.
    int firstError = 0;
    mergeEntries(source, destination, "", copy, firstError);
    // Fails in copy mode (the source is not empty), as intended; removes the emptied source
    // otherwise.
    ::rmdir(source.c_str());
}

int setAttributesRecursively(const std::string& path, const FileAttributes& attributes) {
    struct stat info {};
    if (::stat(path.c_str(), &info) != 0) {
        return kIOErrorCode;
    }
    int remembered = 0;
    if (S_ISDIR(info.st_mode)) {
        applyAttributesBelow(path, attributes, remembered);
    }
    errno = 0;
    if (applyAttributes(path, attributes, true) == 0) {
        return remembered;
    }
    return errno != 0 ? errno : remembered;
}

int makeDirectoryPath(const std::string& path, uid_t uid, gid_t gid, mode_t mode) {
    std::string prefix;
    for (std::size_t i = 0; i < path.size(); ++i) {
        if (i >= 1022) {
            return 0;
        }
        prefix += path[i];
        struct stat info {};
        if (path[i] != '/' || ::stat(prefix.c_str(), &info) == 0) {
            continue;
        }
        if (::mkdir(prefix.c_str(), 0777) != 0) {
            return errno;
        }
        // Owner and mode are best effort: the directory exists either way.
        if (::chown(prefix.c_str(), uid, gid) != 0) {
        }
        if (::chmod(prefix.c_str(), mode) != 0) {
        }
    }
    return 0;
}

int compareNumbersNullsFirst(const plist::Value* a, const plist::Value* b) {
    if (!isNumber(a)) {
        a = nullptr;
    }
    if (!isNumber(b)) {
        b = nullptr;
    }
    if (a == b) {
        return 0;
    }
    if (a == nullptr) {
        return -1;
    }
    if (b == nullptr) {
        return 1;
    }
    const plist::Integer* ai = a->asInteger();
    const plist::Integer* bi = b->asInteger();
    if (ai != nullptr && bi != nullptr) {
        if (ai->isLargeUnsigned() || bi->isLargeUnsigned()) {
            if (ai->isLargeUnsigned() && bi->isLargeUnsigned()) {
                return threeWay(ai->unsignedValue(), bi->unsignedValue());
            }
            return ai->isLargeUnsigned() ? 1 : -1;
        }
        return threeWay(ai->signedValue(), bi->signedValue());
    }
    if (ai != nullptr) {
        return compareIntegerWithReal(*ai, *b->asReal());
    }
    if (bi != nullptr) {
        return -compareIntegerWithReal(*bi, *a->asReal());
    }
    double ar = *a->asReal();
    double br = *b->asReal();
    if (std::isnan(ar) || std::isnan(br)) {
        return std::isnan(ar) ? (std::isnan(br) ? 0 : -1) : 1;
    }
    return threeWay(ar, br);
}

std::optional<std::string> copyProcessNameForPID(pid_t pid) {
    if (pid <= 0) {
        return std::nullopt;
    }
    // The kernel's process table, not a file of the device root.
    Result<std::string> name = plist::readFileBytes("/proc/" + std::to_string(pid) + "/comm");
    if (!name) {
        return std::nullopt;
    }
    if (!name->empty() && name->back() == '\n') {
        name->pop_back();
    }
    return std::move(*name);
}

char* copyCStringFromString(const CStringAllocator& allocator, std::string_view string,
                            char* buffer, std::size_t* inOutLength, StringEncoding) {
    // Strings are UTF-8 already: converting is copying the bytes.
    std::size_t capacity = inOutLength != nullptr ? *inOutLength : 0;
    char* answer = nullptr;
    if (buffer != nullptr && capacity != 0 && string.size() < capacity) {
        answer = buffer;
    } else {
        answer = static_cast<char*>(allocator.allocate(string.size() + 1));
    }
    if (answer == nullptr) {
        if (buffer != nullptr && capacity != 0) {
            buffer[0] = '\0';
        }
        if (inOutLength != nullptr) {
            *inOutLength = 0;
        }
        return buffer != nullptr && capacity != 0 ? buffer : nullptr;
    }
    std::memcpy(answer, string.data(), string.size());
    answer[string.size()] = '\0';
    if (inOutLength != nullptr) {
        *inOutLength = string.size();
    }
    return answer;
}

std::optional<plist::Value> loadDictionaryAtPath(const std::string& path) {
    // Says nothing about a file it cannot read, as none of these utilities logs.
    Result<plist::Value> value = plist::readFile(path);
    if (!value || !value->isDictionary()) {
        return std::nullopt;
    }
    return std::move(*value);
}

}  // namespace tavrix
