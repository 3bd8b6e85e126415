#include "util/FileURL.h"

#include <unistd.h>

#include <cstdlib>
#include <memory>
#include <string_view>

namespace tavrix {
namespace {

constexpr std::string_view kFileScheme = "file://";
constexpr std::string_view kLocalHost = "localhost";

bool isKeptAsIs(unsigned char c) {
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' ||
           c == '.' || c == '_' || c == '~' || c == '/';
}

int hexDigitValue(char c) {
    if (c >= '0' && c <= '9') {
        return c - '0';
    }
    if (c >= 'a' && c <= 'f') {
        return c - 'a' + 10;
    }
    if (c >= 'A' && c <= 'F') {
        return c - 'A' + 10;
    }
    return -1;
}

std::optional<std::string> currentDirectory() {
    std::unique_ptr<char, decltype(&std::free)> directory(::getcwd(nullptr, 0), &std::free);
    if (!directory) {
        return std::nullopt;
    }
    return std::string(directory.get());
}

}  // namespace

std::optional<std::string> fileURLFromPath(const std::string& path) {
    if (path.empty() || path.find('\0') != std::string::npos) {
        return std::nullopt;
    }
    std::string absolute = path;
    if (path.front() != '/') {
        std::optional<std::string> directory = currentDirectory();
        if (!directory) {
            return std::nullopt;
        }
        absolute = *directory + "/" + path;
    }
    static constexpr char kHex[] = "0123456789ABCDEF";
    std::string url(kFileScheme);
    for (char c : absolute) {
        auto byte = static_cast<unsigned char>(c);
        if (isKeptAsIs(byte)) {
            url += c;
        } else {
            url += '%';
            url += kHex[byte >> 4];
            url += kHex[byte & 0x0F];
        }
    }
    return url;
}

std::optional<std::string> pathFromFileURL(const std::string& url) {
    std::string_view rest(url);
    if (!rest.starts_with(kFileScheme)) {
        return std::nullopt;
    }
    rest.remove_prefix(kFileScheme.size());
    if (rest.starts_with(kLocalHost)) {
        rest.remove_prefix(kLocalHost.size());
    }
    if (!rest.starts_with('/')) {
        return std::nullopt;
    }
    std::string path;
    path.reserve(rest.size());
    for (std::size_t i = 0; i < rest.size(); ++i) {
        if (rest[i] != '%') {
            path += rest[i];
            continue;
        }
        if (i + 2 >= rest.size()) {
            return std::nullopt;
        }
        int high = hexDigitValue(rest[i + 1]);
        int low = hexDigitValue(rest[i + 2]);
        if (high < 0 || low < 0 || (high == 0 && low == 0)) {
            return std::nullopt;
        }
        path += static_cast<char>(high * 16 + low);
        i += 2;
    }
    return path;
}

}  // namespace tavrix
