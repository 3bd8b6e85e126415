// A private dbus-daemon for one test, in a temporary directory of its own: it allows everything,
// or denies by default as the system bus does and includes a policy file; given a daemon, it
// starts that on demand by bus activation. The bus's output and the daemon's go to one log; its
// environment has nothing that could point what it starts at another bus or root. Stopped, and
// its directory removed, when the object goes.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "bus/BusHandles.h"

namespace tavrix::test {

struct CommandResult {
    // The exit status, 128 + the signal number when killed, -1 when it could not be started.
    int status = -1;
    std::string output;  // stdout, and stderr unless kept apart
    std::string errors;  // stderr, when kept apart
};
// Runs argv (argv[0] a path) to its end with the test's environment.
CommandResult runCommand(const std::vector<std::string>& argv, bool errorsApart = false);

// Throws std::runtime_error naming what failed when result is an error.
void check(int result, const char* what);

// A new client connection to the bus at address, its unique name assigned; throws
// std::runtime_error when that fails.
bus::BusPtr connectToBus(const std::string& address);

// The daemon the bus starts on demand, and what it runs under.
struct ActivatedDaemon {
    std::filesystem::path binary;
    std::filesystem::path root;              // TAVRIX_ROOT
    std::filesystem::path runtimeDirectory;  // RUNTIME_DIRECTORY
    int idleExitSeconds = 30;                // TAVRIX_IDLE_EXIT_SEC
    // Runs the daemon through this command (setpriv, to start it as another user).
    std::vector<std::string> launchPrefix;
};

// One start of the daemon by the bus, as its launcher recorded it.
struct DaemonLaunch {
    pid_t pid = -1;
    // Once the process has ended: its exit status, 128 + the signal number when killed.
    std::optional<int> exitStatus;
};

class PrivateBus {
  public:
    // Throws std::runtime_error, with the log, when the bus ends before it reports its address.
    explicit PrivateBus(const std::optional<ActivatedDaemon>& daemon = std::nullopt,
                        const std::optional<std::filesystem::path>& policyFile = std::nullopt);
    ~PrivateBus() { stop(); }
    PrivateBus(const PrivateBus&) = delete;
    PrivateBus& operator=(const PrivateBus&) = delete;

    const std::string& address() const { return address_; }
    bus::BusPtr connect() const { return connectToBus(address()); }
    // An address beside the bus where nothing listens.
    std::string deadAddress() const { return "unix:path=" + (directory_ / "nothing-here"); }
    std::string log() const { return readText(directory_ / "bus.log"); }
    // Every daemon start so far, oldest first.
    std::vector<DaemonLaunch> launches() const;
    void stop();

  private:
    TempDir directory_;
    pid_t pid_ = -1;
    std::string address_;
};

}  // namespace tavrix::test
