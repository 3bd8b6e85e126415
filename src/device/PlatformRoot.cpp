#include "device/PlatformRoot.h"

#include <cstdlib>

namespace tavrix::device {

const std::string& platformRoot() {
    static const std::string root = [] {
        const char* configured = std::getenv("TAVRIX_ROOT");
        std::string value = configured == nullptr ? "" : configured;
        while (!value.empty() && value.back() == '/') {
            value.pop_back();
        }
        return value;
    }();
    return root;
}

std::string resolvePathUnder(std::string_view root, std::string_view absolutePath) {
    while (!root.empty() && root.back() == '/') {
        root.remove_suffix(1);
    }
    std::string path(root);
    if (absolutePath.empty() || absolutePath.front() != '/') {
        path += '/';
    }
    path += absolutePath;
    return path;
}

std::string resolvePath(std::string_view absolutePath) {
    return resolvePathUnder(platformRoot(), absolutePath);
}

}  // namespace tavrix::device
