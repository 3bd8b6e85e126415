// A dbus-daemon child process for tests: started on a configuration file, its stdout and stderr
// (and so those of the services it activates) appended to a log, its address read from the
// descriptor it prints it on. Stopped (SIGTERM, then SIGKILL after a bounded wait) when the object
// goes.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace tavrix::test {

// Writes directory/bus.conf for a bus listening on directory/socket, with extra (policies,
// service directories) inside; answers the file's path.
std::filesystem::path writeBusConfiguration(const std::filesystem::path& directory,
                                            const std::string& extra);

// The rules of a session bus: everything may be owned, sent and received.
inline constexpr const char* kOpenBusPolicy = R"(  <policy context="default">
    <allow send_destination="*" eavesdrop="true"/>
    <allow eavesdrop="true"/>
    <allow own="*"/>
  </policy>
)";

class DbusDaemonProcess {
  public:
    // environment: the bus's whole environment; without one it inherits the test's. Throws
    // std::runtime_error, with the log, when the bus does not report its address in time.
    DbusDaemonProcess(const std::filesystem::path& configFile, const std::filesystem::path& logFile,
                      const std::optional<std::vector<std::string>>& environment = std::nullopt);
    ~DbusDaemonProcess();
    DbusDaemonProcess(const DbusDaemonProcess&) = delete;
    DbusDaemonProcess& operator=(const DbusDaemonProcess&) = delete;

    const std::string& address() const { return address_; }
    pid_t pid() const { return pid_; }
    // Ends the bus; safe to call twice.
    void stop();

  private:
    pid_t pid_ = -1;
    std::string address_;
};

}  // namespace tavrix::test
