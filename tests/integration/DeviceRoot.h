// A device image in a temporary directory: the root the daemon runs under (TAVRIX_ROOT), its
// runtime directory, and the files the tests prepare or inspect. Removed when the object goes.
#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

#include "TestSupport.h"
#include "plist/Value.h"

namespace tavrix::integration {

class DeviceRoot {
  public:
    // etc/passwd holds "mobile" with the test's own uid and gid (home /var/mobile); the device
    // table says there is no cellular radio.
    DeviceRoot();
    DeviceRoot(const DeviceRoot&) = delete;
    DeviceRoot& operator=(const DeviceRoot&) = delete;

    // The temporary directory holding everything (the root, the run directory, the bus files).
    const std::filesystem::path& base() const { return base_.path(); }
    std::filesystem::path root() const { return base() / "root"; }
    std::filesystem::path runtimeDirectory() const { return base() / "run"; }
    // absolutePath of the device, under the root.
    std::filesystem::path path(std::string_view absolutePath) const;

    void setCellularRadio(bool present);

    // The daemon's own preferences (com.zandor.tavrixservices of the mobile user).
    void writeDaemonPreferences(const plist::Dictionary& values);
    std::optional<plist::Value> readDaemonPreferences() const;
    // The behavior settings domain (com.zandor.tavrix of the mobile user).
    void writeBehaviorSettings(const plist::Dictionary& values);

    // The keep-alive flag file's text, or nothing when it does not exist.
    std::optional<std::string> keepAliveFlag() const;
    void setKeepAliveFlag(std::string_view text);

  private:
    // Replaces the file in one step, so that the daemon never reads half of it and its cache
    // sees a new file.
    void writePropertyList(std::string_view absolutePath, const plist::Dictionary& values);

    test::TempDir base_;
};

}  // namespace tavrix::integration
