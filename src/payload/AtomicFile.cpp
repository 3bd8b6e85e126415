#include "payload/AtomicFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "util/UniqueFd.h"

namespace tavrix::payload {
namespace {

// Removes the temporary file unless it was renamed into place; keeps errno as the failure left it.
class TemporaryFile {
  public:
    explicit TemporaryFile(std::string path) : path_(std::move(path)) {}
    ~TemporaryFile() {
        if (!path_.empty()) {
            int saved = errno;
            ::unlink(path_.c_str());
            errno = saved;
        }
    }
    TemporaryFile(const TemporaryFile&) = delete;
    TemporaryFile& operator=(const TemporaryFile&) = delete;

    const std::string& path() const { return path_; }
    void keep() { path_.clear(); }

  private:
    std::string path_;
};

bool writeAll(int fd, const unsigned char* bytes, std::size_t size) {
    while (size > 0) {
        ssize_t put = ::write(fd, bytes, size);
        if (put < 0 && errno == EINTR) {
            continue;
        }
        if (put <= 0) {
            if (put == 0) {
                errno = EIO;
            }
            return false;
        }
        bytes += put;
        size -= static_cast<std::size_t>(put);
    }
    return true;
}

std::string directoryOf(const std::string& path) {
    auto slash = path.find_last_of('/');
    if (slash == std::string::npos) {
        return ".";
    }
    return slash == 0 ? "/" : path.substr(0, slash);
}

}  // namespace

bool writeFileAtomically(const std::string& path, const void* bytes, std::size_t size,
                         mode_t mode) {
    if (path.empty() || path.back() == '/') {
        errno = EISDIR;
        return false;
    }
    std::string directory = directoryOf(path);
    // A fixed short name, so that a file name near the length limit still gets a temporary.
    std::string pattern = directory + "/.tavrix-write-XXXXXX";
    UniqueFd fd(::mkostemp(pattern.data(), O_CLOEXEC));
    if (!fd) {
        return false;
    }
    TemporaryFile temporary(pattern);
    if (!writeAll(fd.get(), static_cast<const unsigned char*>(bytes), size) ||
        ::fchmod(fd.get(), mode) != 0 || ::fsync(fd.get()) != 0 || ::close(fd.release()) != 0) {
        return false;
    }
    if (::rename(temporary.path().c_str(), path.c_str()) != 0) {
        return false;
    }
    temporary.keep();
    // The rename itself is durable only once the directory is flushed; a failure there leaves
    // the new file in place, so it does not count against the write.
    UniqueFd directoryFd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (directoryFd) {
        ::fsync(directoryFd.get());
    }
    return true;
}

}  // namespace tavrix::payload
