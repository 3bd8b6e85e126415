#include "io/Paths.h"

#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <memory>
#include <vector>

namespace tavrix::io {
namespace {

std::string_view withoutTrailingSlashes(std::string_view path) {
    while (path.size() > 1 && path.back() == '/') {
        path.remove_suffix(1);
    }
    return path;
}

}  // namespace

std::string parentDirectory(std::string_view path) {
    path = withoutTrailingSlashes(path);
    std::size_t slash = path.rfind('/');
    if (slash == std::string_view::npos) {
        return {};
    }
    std::string_view parent = withoutTrailingSlashes(path.substr(0, slash));
    return std::string(parent.empty() ? "/" : parent);
}

std::string lastPathComponent(std::string_view path) {
    path = withoutTrailingSlashes(path);
    std::size_t slash = path.rfind('/');
    return std::string(
        slash == std::string_view::npos || path.size() == 1 ? path : path.substr(slash + 1));
}

std::optional<std::string> readLinkTarget(const std::string& path) {
    std::vector<char> buffer(PATH_MAX);
    for (;;) {
        ssize_t length = ::readlink(path.c_str(), buffer.data(), buffer.size());
        if (length < 0) {
            return std::nullopt;
        }
        // A target that fills the buffer may have been cut: ask again with room to spare.
        if (static_cast<std::size_t>(length) < buffer.size()) {
            return std::string(buffer.data(), static_cast<std::size_t>(length));
        }
        buffer.resize(buffer.size() * 2);
    }
}

PathKind kindOfPath(const std::string& path) {
    struct stat status {};
    if (path.empty() || ::stat(path.c_str(), &status) != 0) {
        return PathKind::Missing;
    }
    return S_ISDIR(status.st_mode)   ? PathKind::Directory
           : S_ISREG(status.st_mode) ? PathKind::RegularFile
                                     : PathKind::Other;
}

std::string realPathOf(const std::string& path) {
    struct FreeDeleter {
        void operator()(char* text) const { std::free(text); }
    };
    // Allocated by realpath itself: a fixed buffer smaller than PATH_MAX is not safe here.
    std::unique_ptr<char, FreeDeleter> resolved(::realpath(path.c_str(), nullptr));
    return resolved ? std::string(resolved.get()) : std::string();
}

}  // namespace tavrix::io
