#include "io/AtomicFile.h"

#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "io/FileIO.h"
#include "io/Paths.h"
#include "io/UniqueFd.h"

namespace tavrix::io {
namespace {

std::string directoryOf(const std::string& path) {
    std::string parent = parentDirectory(path);
    return parent.empty() ? "." : parent;
}

// Removes the temporary file unless it was renamed into place.
class TemporaryPath {
  public:
    explicit TemporaryPath(std::string path) : path_(std::move(path)) {}
    ~TemporaryPath() {
        if (!path_.empty()) {
            ::unlink(path_.c_str());
        }
    }
    TemporaryPath(const TemporaryPath&) = delete;
    TemporaryPath& operator=(const TemporaryPath&) = delete;

    const std::string& path() const { return path_; }
    void keep() { path_.clear(); }

  private:
    std::string path_;
};

// A rename that fails with EEXIST instead of replacing; file systems without that flag get a
// plain rename after checking that nothing is there.
int renameWithoutReplacing(const std::string& from, const std::string& to) {
    if (::renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE) == 0) {
        return 0;
    }
    if (errno != EINVAL && errno != ENOSYS) {
        return errno;
    }
    struct stat existing {};
    if (::lstat(to.c_str(), &existing) == 0) {
        return EEXIST;
    }
    return ::rename(from.c_str(), to.c_str()) == 0 ? 0 : errno;
}

int writeAtomically(const std::string& path, mode_t mode, bool replace,
                    const std::function<int(int fd)>& fill) {
    if (path.empty() || path.back() == '/') {
        return EISDIR;
    }
    const std::string directory = directoryOf(path);
    // A fixed short name, so that a file name near the length limit still gets a temporary.
    std::string pattern = directory + "/" + kAtomicWritePrefix + "XXXXXX";
    UniqueFd fd(::mkostemp(pattern.data(), O_CLOEXEC));
    if (!fd) {
        return errno;
    }
    TemporaryPath temporary(pattern);
    if (int error = fill(fd.get()); error != 0) {
        return error;
    }
    if (::fchmod(fd.get(), mode) != 0 || ::fsync(fd.get()) != 0) {
        return errno;
    }
    if (::close(fd.release()) != 0) {
        return errno;
    }
    if (replace && ::rename(temporary.path().c_str(), path.c_str()) != 0) {
        return errno;
    }
    if (!replace) {
        if (int error = renameWithoutReplacing(temporary.path(), path); error != 0) {
            return error;
        }
    }
    temporary.keep();
    // The rename is durable only once the directory is flushed; a failure there leaves the new
    // file in place, so it does not count against the write.
    UniqueFd directoryFd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (directoryFd) {
        ::fsync(directoryFd.get());
    }
    return 0;
}

}  // namespace

int replaceFileAtomically(const std::string& path, std::string_view bytes, mode_t mode) {
    return writeAtomically(path, mode, /*replace=*/true,
                           [bytes](int fd) { return writeAll(fd, bytes); });
}

int createFileAtomically(const std::string& path, std::string_view bytes, mode_t mode) {
    return writeAtomically(path, mode, /*replace=*/false,
                           [bytes](int fd) { return writeAll(fd, bytes); });
}

int createFileAtomicallyWith(const std::string& path, mode_t mode,
                             const std::function<int(int fd)>& fill) {
    return writeAtomically(path, mode, /*replace=*/false, fill);
}

}  // namespace tavrix::io
