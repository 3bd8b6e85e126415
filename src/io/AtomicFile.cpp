#include "io/AtomicFile.h"

#include <cerrno>

#include "io/Directory.h"
#include "io/FileIO.h"
#include "io/Paths.h"

namespace tavrix::io {
namespace {

int writeAtomically(const std::string& path, mode_t mode, bool replace,
                    const std::function<int(int fd)>& fill) {
    if (path.empty() || path.back() == '/') {
        return EISDIR;
    }
    int error = 0;
    std::optional<Directory> directory =
        Directory::open(parentDirectory(path), Directory::LastLink::Follow, &error);
    if (!directory) {
        return error;
    }
    return directory->writeFile(lastPathComponent(path), mode, replace, fill);
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
