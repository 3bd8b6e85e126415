#include "io/FileIO.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <memory>

namespace tavrix::io {
namespace {

constexpr std::size_t kChunkBytes = 1 << 16;

}  // namespace

int writeAll(int fd, std::string_view bytes) {
    while (!bytes.empty()) {
        ssize_t put = ::write(fd, bytes.data(), bytes.size());
        if (put < 0 && errno == EINTR) {
            continue;
        }
        if (put <= 0) {
            return put == 0 ? EIO : errno;
        }
        bytes.remove_prefix(static_cast<std::size_t>(put));
    }
    return 0;
}

int readChunks(int fd, const std::function<int(std::string_view chunk)>& consume) {
    std::unique_ptr<char[]> buffer(new char[kChunkBytes]);
    for (;;) {
        ssize_t got = ::read(fd, buffer.get(), kChunkBytes);
        if (got < 0 && errno == EINTR) {
            continue;
        }
        if (got < 0) {
            return errno;
        }
        if (got == 0) {
            return 0;
        }
        if (int stop = consume(std::string_view(buffer.get(), static_cast<std::size_t>(got)))) {
            return stop;
        }
    }
}

int readAll(int fd, std::string& bytes, std::size_t limit) {
    // A regular file is read in one go into a buffer one byte larger than it claims, which also
    // tells a file that grew since; anything else (sysfs, pipes) grows chunk by chunk.
    std::size_t capacity = kChunkBytes;
    struct stat info {};
    if (::fstat(fd, &info) == 0 && S_ISREG(info.st_mode) && info.st_size > 0) {
        capacity = static_cast<std::size_t>(info.st_size) + 1;
    }
    // One byte past the limit tells "more than limit" from "exactly limit".
    const std::size_t ceiling = limit < SIZE_MAX ? limit + 1 : limit;
    bytes.assign(std::min(capacity, ceiling), '\0');
    std::size_t filled = 0;
    for (;;) {
        if (filled == bytes.size()) {
            if (filled >= ceiling) {
                bytes.clear();
                return EFBIG;
            }
            bytes.resize(std::min(filled + kChunkBytes, ceiling));
        }
        ssize_t got = ::read(fd, bytes.data() + filled, bytes.size() - filled);
        if (got < 0 && errno == EINTR) {
            continue;
        }
        if (got < 0) {
            const int error = errno;
            bytes.clear();
            return error;
        }
        if (got == 0) {
            break;
        }
        filled += static_cast<std::size_t>(got);
    }
    bytes.resize(filled);
    return 0;
}

UniqueFd openFile(const std::string& path, int flags, mode_t mode) {
    int fd = -1;
    do {
        fd = ::open(path.c_str(), flags | O_CLOEXEC, mode);
    } while (fd < 0 && errno == EINTR);
    return UniqueFd(fd);
}

}  // namespace tavrix::io
