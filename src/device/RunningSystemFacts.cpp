#include "device/RunningSystemFacts.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <initializer_list>

#include "device/PlatformRoot.h"
#include "io/FileIO.h"
#include "io/UniqueFd.h"

namespace tavrix::device {
namespace {

// Release files and sysfs attributes are small; anything larger is not what we are looking for.
constexpr std::size_t kMaxFileSize = 64 * 1024;

constexpr std::string_view kWhitespace = " \t\r\n\v\f";

std::string_view trim(std::string_view text) {
    auto first = text.find_first_not_of(kWhitespace);
    if (first == std::string_view::npos) {
        return {};
    }
    auto last = text.find_last_not_of(kWhitespace);
    return text.substr(first, last - first + 1);
}

// sysfs reports a size of 4096 for every attribute, so the file is read to its end instead.
std::optional<std::string> readSmallFile(const std::string& path) {
    io::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) {
        return std::nullopt;
    }
    std::string content;
    if (io::readAll(fd.get(), content, kMaxFileSize) != 0) {
        return std::nullopt;
    }
    return content;
}

// A device-tree property or DMI attribute as text: up to the first NUL (device-tree strings end
// with one), without surrounding whitespace. Empty values count as missing.
std::optional<std::string> readAttribute(std::string_view root, std::string_view path) {
    auto content = readSmallFile(resolvePathUnder(root, path));
    if (!content) {
        return std::nullopt;
    }
    std::string_view text(*content);
    text = trim(text.substr(0, text.find('\0')));
    if (text.empty()) {
        return std::nullopt;
    }
    return std::string(text);
}

std::optional<std::string> firstAttribute(std::string_view root,
                                          std::initializer_list<std::string_view> paths) {
    for (std::string_view path : paths) {
        if (auto value = readAttribute(root, path)) {
            return value;
        }
    }
    return std::nullopt;
}

bool isKeyName(std::string_view key) {
    if (key.empty()) {
        return false;
    }
    for (char c : key) {
        bool ok =
            (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '_';
        if (!ok) {
            return false;
        }
    }
    return true;
}

// A quoted value: the text up to the matching quote; in double quotes a backslash escapes the
// shell's special characters. Nothing when the quote is not closed or text follows it.
std::optional<std::string> unquote(std::string_view raw) {
    char quote = raw.front();
    std::string value;
    std::size_t i = 1;
    for (; i < raw.size() && raw[i] != quote; ++i) {
        if (quote == '"' && raw[i] == '\\' && i + 1 < raw.size() &&
            std::string_view("\"\\$`").find(raw[i + 1]) != std::string_view::npos) {
            ++i;
        }
        value += raw[i];
    }
    if (i >= raw.size() || !trim(raw.substr(i + 1)).empty()) {
        return std::nullopt;
    }
    return value;
}

std::optional<std::string> osReleaseValue(std::string_view root, std::string_view key) {
    // /usr/lib/os-release is the fallback the format defines for a missing /etc/os-release.
    for (std::string_view path : {"/etc/os-release", "/usr/lib/os-release"}) {
        auto content = readSmallFile(resolvePathUnder(root, path));
        if (!content) {
            continue;
        }
        auto values = parseOsRelease(*content);
        auto found = values.find(key);
        if (found == values.end() || found->second.empty()) {
            return std::nullopt;
        }
        return found->second;
    }
    return std::nullopt;
}

// Calls visit with each entry of a sysfs class directory until it answers true. Nothing when
// the directory cannot be read, so that a system without it stays "unknown".
template <typename Visit>
std::optional<bool> anyClassEntry(std::string_view root, std::string_view classPath, Visit visit) {
    std::error_code error;
    std::filesystem::directory_iterator entries(resolvePathUnder(root, classPath), error);
    if (error) {
        return std::nullopt;
    }
    for (; entries != std::filesystem::directory_iterator(); entries.increment(error)) {
        if (error) {
            break;
        }
        if (visit(entries->path())) {
            return true;
        }
    }
    return false;
}

// lstat, not stat: phy80211 is a link whose target only matters on a live system.
bool entryExists(const std::filesystem::path& path) {
    struct stat info {};
    return ::lstat(path.c_str(), &info) == 0;
}

std::optional<bool> hasWirelessNetworkDevice(std::string_view root) {
    return anyClassEntry(root, "/sys/class/net", [](const std::filesystem::path& device) {
        return entryExists(device / "wireless") || entryExists(device / "phy80211");
    });
}

bool ueventIsWwan(const std::filesystem::path& device) {
    auto content = readSmallFile((device / "uevent").string());
    if (!content) {
        return false;
    }
    std::string_view text(*content);
    while (!text.empty()) {
        auto end = text.find('\n');
        if (trim(text.substr(0, end)) == "DEVTYPE=wwan") {
            return true;
        }
        text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
    }
    return false;
}

std::optional<bool> hasCellularModem(std::string_view root) {
    auto wwanClass = anyClassEntry(root, "/sys/class/wwan", [](const auto&) { return true; });
    if (wwanClass.value_or(false)) {
        return true;
    }
    auto netDevice = anyClassEntry(root, "/sys/class/net", ueventIsWwan);
    if (netDevice) {
        return netDevice;
    }
    return wwanClass;
}

std::optional<plist::Value> stringAnswer(std::optional<std::string> text) {
    if (!text) {
        return std::nullopt;
    }
    return plist::Value(std::move(*text));
}

std::optional<plist::Value> booleanAnswer(std::optional<bool> flag) {
    if (!flag) {
        return std::nullopt;
    }
    return plist::Value(*flag);
}

constexpr std::string_view kDeviceTreeModel = "/sys/firmware/devicetree/base/model";
constexpr std::string_view kDeviceTreeSerial = "/sys/firmware/devicetree/base/serial-number";
constexpr std::string_view kDmiProductName = "/sys/class/dmi/id/product_name";
constexpr std::string_view kDmiBoardName = "/sys/class/dmi/id/board_name";
constexpr std::string_view kDmiSerial = "/sys/class/dmi/id/product_serial";

}  // namespace

std::map<std::string, std::string, std::less<>> parseOsRelease(std::string_view text) {
    std::map<std::string, std::string, std::less<>> values;
    while (!text.empty()) {
        auto end = text.find('\n');
        std::string_view line = trim(text.substr(0, end));
        text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
        if (line.empty() || line.front() == '#') {
            continue;
        }
        auto equals = line.find('=');
        if (equals == std::string_view::npos || !isKeyName(line.substr(0, equals))) {
            continue;
        }
        std::string_view raw = line.substr(equals + 1);
        std::optional<std::string> value;
        if (!raw.empty() && (raw.front() == '"' || raw.front() == '\'')) {
            value = unquote(raw);
        } else {
            value = std::string(raw);
        }
        if (value) {
            values.insert_or_assign(std::string(line.substr(0, equals)), std::move(*value));
        }
    }
    return values;
}

std::optional<plist::Value> runningSystemAnswer(std::string_view root, std::string_view key) {
    if (key == "ProductVersion") {
        return stringAnswer(osReleaseValue(root, "VERSION_ID"));
    }
    if (key == "BuildVersion") {
        return stringAnswer(osReleaseValue(root, "BUILD_ID"));
    }
    // The product is what the machine is sold as, the hardware model the board inside it; a
    // device tree names only one model, which then stands for both.
    if (key == "ProductType") {
        return stringAnswer(
            firstAttribute(root, {kDeviceTreeModel, kDmiProductName, kDmiBoardName}));
    }
    if (key == "HWModelStr") {
        return stringAnswer(
            firstAttribute(root, {kDeviceTreeModel, kDmiBoardName, kDmiProductName}));
    }
    if (key == "SerialNumber") {
        return stringAnswer(firstAttribute(root, {kDmiSerial, kDeviceTreeSerial}));
    }
    if (key == "wi-fi") {
        return booleanAnswer(hasWirelessNetworkDevice(root));
    }
    if (key == "contains-cellular-radio") {
        return booleanAnswer(hasCellularModem(root));
    }
    return std::nullopt;
}

}  // namespace tavrix::device
