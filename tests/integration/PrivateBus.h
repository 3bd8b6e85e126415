// A private dbus-daemon for one test: it listens in the device root's temporary directory and
// starts the real daemon on demand from a generated activation file. The bus's stderr and the
// daemon's stderr go to one log file. Stopped when the object goes.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "DbusDaemonProcess.h"
#include "DeviceRoot.h"

namespace tavrix::integration {

struct BusOptions {
    // The daemon's idle grace (TAVRIX_IDLE_EXIT_SEC).
    int idleExitSeconds = 30;
    // With a policy file, the bus denies by default as the system bus does and includes the
    // file; without one it allows everything.
    std::optional<std::filesystem::path> policyFile;
};

// One start of the daemon by the bus, as recorded by its launcher.
struct DaemonLaunch {
    pid_t pid = -1;
    // The exit status once the process has ended (128 + signal number when killed).
    std::optional<int> exitStatus;
};

class PrivateBus {
  public:
    PrivateBus(const DeviceRoot& device, const BusOptions& options);
    ~PrivateBus();
    PrivateBus(const PrivateBus&) = delete;
    PrivateBus& operator=(const PrivateBus&) = delete;

    const std::string& address() const { return process_->address(); }
    const std::filesystem::path& logPath() const { return logPath_; }
    std::string log() const;
    // Every daemon start so far, oldest first.
    std::vector<DaemonLaunch> launches() const;

  private:
    void writeConfiguration(const DeviceRoot& device, const BusOptions& options);
    void start();
    void stop();

    std::filesystem::path directory_;
    std::filesystem::path logPath_;
    std::filesystem::path launchesPath_;
    std::optional<test::DbusDaemonProcess> process_;
};

}  // namespace tavrix::integration
