#include "bus/HandedPayload.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "io/FileIO.h"

namespace tavrix::bus {
namespace {

using Bytes = std::vector<std::uint8_t>;

Failure tooLarge(std::size_t limit) {
    return {"the bundle is larger than " + std::to_string(limit) + " bytes"};
}

Failure cannotRead(const char* what, int error) {
    return {std::string(what) + std::strerror(error)};
}

// From the start with pread, so that the client's offset neither matters nor moves.
Result<Bytes> readRegularFile(int fd, std::size_t size, std::size_t limit) {
    // One byte more than it claims tells a file that grew since fstat.
    Bytes bytes(size + 1, 0);
    std::size_t filled = 0;
    while (filled < bytes.size()) {
        ssize_t got =
            ::pread(fd, bytes.data() + filled, bytes.size() - filled, static_cast<off_t>(filled));
        if (got < 0 && errno == EINTR) {
            continue;
        }
        if (got < 0) {
            return cannotRead("cannot read the bundle: ", errno);
        }
        if (got == 0) {
            break;
        }
        filled += static_cast<std::size_t>(got);
        if (filled == bytes.size() && filled <= limit) {
            bytes.resize(std::min(filled + (1 << 16), limit + 1));
        }
    }
    if (filled > limit) {
        return tooLarge(limit);
    }
    bytes.resize(filled);
    return bytes;
}

}  // namespace

Result<Bytes> readHandedPayload(int fd, std::size_t limit) {
    struct stat info {};
    if (::fstat(fd, &info) != 0) {
        return cannotRead("cannot inspect the descriptor: ", errno);
    }
    const int flags = ::fcntl(fd, F_GETFL);
    if (flags < 0 || (flags & O_ACCMODE) == O_WRONLY) {
        return Failure{"the descriptor is not open for reading"};
    }
    if (S_ISREG(info.st_mode)) {
        if (info.st_size < 0 || static_cast<std::uint64_t>(info.st_size) > limit) {
            return tooLarge(limit);
        }
        return readRegularFile(fd, static_cast<std::size_t>(info.st_size), limit);
    }
    if (!S_ISFIFO(info.st_mode)) {
        return Failure{"the descriptor must be a regular file or a pipe"};
    }
    // A writer that never finishes must not hold the daemon: what the pipe holds is read without
    // waiting, and it must end there. The flag is the pipe's, shared with the client's copy,
    // which only ever writes.
    if ((flags & O_NONBLOCK) == 0 && ::fcntl(fd, F_SETFL, flags | O_NONBLOCK) != 0) {
        return cannotRead("cannot read the pipe without blocking: ", errno);
    }
    std::string text;
    const int error = io::readAll(fd, text, limit);
    if (error == EFBIG) {
        return tooLarge(limit);
    }
    if (error == EAGAIN) {
        return Failure{
            "the pipe is still open for writing: write the whole bundle and close it before the "
            "call"};
    }
    if (error != 0) {
        return cannotRead("cannot read the bundle: ", error);
    }
    return Bytes(text.begin(), text.end());
}

}  // namespace tavrix::bus
