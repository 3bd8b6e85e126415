#include "DeviceRoot.h"

#include <unistd.h>

#include <fstream>
#include <stdexcept>

#include "TestSupport.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::integration {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kDeviceTable = "/etc/tavrix/DeviceInfo.plist";
constexpr std::string_view kDaemonPreferences =
    "/var/mobile/Library/Preferences/com.zandor.tavrixservices.plist";
constexpr std::string_view kBehaviorSettings =
    "/var/mobile/Library/Preferences/com.zandor.tavrix.plist";

// Everything the device information service is asked for, so that no answer comes from the
// machine running the tests.
plist::Dictionary deviceTable(bool cellularRadio) {
    return {
        {"contains-cellular-radio", cellularRadio},
        {"wi-fi", true},
        {"DeviceClass", "Tablet"},
        {"ProductType", "Tablet7,1"},
        {"ProductVersion", "9.1"},
        {"BuildVersion", "13B100"},
        {"ReleaseType", "User"},
        {"HWModelStr", "T71AP"},
        {"SerialNumber", "TESTSERIAL01"},
    };
}

}  // namespace

DeviceRoot::DeviceRoot() {
    // Other users reach the bus socket in here (the policy tests run clients as nobody).
    fs::permissions(base(), fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                                fs::perms::others_read | fs::perms::others_exec);

    test::writeText(path("/etc/passwd"),
                    "root:x:0:0:root:/root:/bin/sh\nmobile:x:" + std::to_string(::getuid()) + ":" +
                        std::to_string(::getgid()) +
                        ":Mobile User:/var/mobile:/usr/sbin/nologin\n");
    fs::create_directories(path("/var/mobile/Library/Preferences"));
    fs::create_directories(runtimeDirectory());
    setCellularRadio(false);
}

fs::path DeviceRoot::path(std::string_view absolutePath) const {
    return root() / fs::path(absolutePath).relative_path();
}

void DeviceRoot::setCellularRadio(bool present) {
    writePropertyList(kDeviceTable, deviceTable(present));
}

void DeviceRoot::writeDaemonPreferences(const plist::Dictionary& values) {
    writePropertyList(kDaemonPreferences, values);
}

std::optional<plist::Value> DeviceRoot::readDaemonPreferences() const {
    return plist::readFile(path(kDaemonPreferences).string());
}

void DeviceRoot::writeBehaviorSettings(const plist::Dictionary& values) {
    writePropertyList(kBehaviorSettings, values);
}

std::optional<std::string> DeviceRoot::keepAliveFlag() const {
    std::ifstream in(runtimeDirectory() / "keep-alive", std::fstream::binary);
    if (!in) {
        return std::nullopt;
    }
    std::string text(std::istreambuf_iterator<char>(in), {});
    while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) {
        text.pop_back();
    }
    return text;
}

void DeviceRoot::setKeepAliveFlag(std::string_view text) {
    test::writeText(runtimeDirectory() / "keep-alive", std::string(text));
}

void DeviceRoot::writePropertyList(std::string_view absolutePath, const plist::Dictionary& values) {
    fs::path target = path(absolutePath);
    fs::create_directories(target.parent_path());
    fs::path temporary = target;
    temporary += ".new";
    if (!plist::writeFile(temporary.string(), plist::Value(values))) {
        throw std::runtime_error("cannot write " + temporary.string());
    }
    fs::rename(temporary, target);
}

}  // namespace tavrix::integration
