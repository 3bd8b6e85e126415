#include "platform/AtomicFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "util/UniqueFd.h"

namespace tavrix::platform {
namespace {

std::string directoryOf(const std::string& path) {
    std::size_t slash = path.rfind('/');
    if (slash == std::string::npos) {
        return ".";
    }
    return slash == 0 ? "/" : path.substr(0, slash);
}

int writeAll(int fd, std::string_view bytes) {
    while (!bytes.empty()) {
        ssize_t written = ::write(fd, bytes.data(), bytes.size());
        if (written < 0 && errno == EINTR) {
            continue;
        }
        if (written <= 0) {
            return written == 0 ? EIO : errno;
        }
        bytes.remove_prefix(static_cast<std::size_t>(written));
    }
    return 0;
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

}  // namespace

int replaceFileAtomically(const std::string& path, std::string_view bytes, mode_t mode) {
    const std::string directory = directoryOf(path);
    std::string pattern = path + ".XXXXXX";
    UniqueFd fd(::mkostemp(pattern.data(), O_CLOEXEC));
    if (!fd) {
        return errno;
    }
    TemporaryPath temporary(pattern);
    if (int error = writeAll(fd.get(), bytes); error != 0) {
        return error;
    }
    if (::fchmod(fd.get(), mode) != 0 || ::fsync(fd.get()) != 0) {
        return errno;
    }
    if (::close(fd.release()) != 0) {
        return errno;
    }
    if (::rename(temporary.path().c_str(), path.c_str()) != 0) {
        return errno;
    }
    temporary.keep();
    // The rename itself must reach the disk too.
    UniqueFd directoryFd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!directoryFd || ::fsync(directoryFd.get()) != 0) {
        return errno;
    }
    return 0;
}

}  // namespace tavrix::platform
