// The fixture of the integration tests: a device root in a temporary directory, a private bus
// that starts the real daemon on demand, and the test's own connection watching the bus. When a
// test fails, the daemon's log is printed; afterwards the daemon is stopped (it must exit with 0)
// and everything is removed.
#pragma once

#include <gtest/gtest.h>
#include <sys/types.h>

#include <chrono>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "BusWatcher.h"
#include "DeviceRoot.h"
#include "PrivateBus.h"
#include "bus/BusHandles.h"
#include "client/TavrixClient.h"

namespace tavrix::integration {

using namespace std::chrono_literals;

inline constexpr const char* kDaemonObjectPath = "/com/zandor/tavrixservicesd";
inline constexpr const char* kDaemonInterface = "com.zandor.TXManagerServerInterface";

class BusFixture : public ::testing::Test {
  protected:
    void SetUp() override;
    void TearDown() override;

    DeviceRoot& device() { return device_; }
    const std::string& busAddress() const { return bus_->address(); }
    BusWatcher& watcher() { return *watcher_; }

    // A new client of the daemon with a connection of its own.
    client::TavrixClient client() const {
        return client::TavrixClient::connectToAddress(busAddress());
    }
    // A plain bus connection, for calls the client library would not make.
    bus::BusPtr rawConnection() { return connectToBus(busAddress()); }

    bool waitForNameOwner(std::chrono::milliseconds timeout = 10s) {
        return watcher_->waitForNameOwner(timeout);
    }
    bool waitForNoNameOwner(std::chrono::milliseconds timeout = 10s) {
        return watcher_->waitForNoNameOwner(timeout);
    }
    std::optional<pid_t> daemonPid() { return watcher_->ownerPid(); }

    std::string daemonLog() const { return bus_->log(); }
    // The log's lines, in order.
    std::vector<std::string> daemonLogLines() const;
    // How often line appears in the log as a whole line.
    int countLogLines(const std::string& line) const;
    // Waits until line has appeared count times (the log is a file, so this polls it).
    bool waitForLogLine(const std::string& line, std::chrono::milliseconds timeout = 10s,
                        int count = 1) const;

    // The exit status of the daemon process pid once it has ended, or nothing at the timeout.
    std::optional<int> waitForDaemonExit(pid_t pid, std::chrono::milliseconds timeout = 10s) const;
    std::vector<DaemonLaunch> daemonLaunches() const { return bus_->launches(); }
    // Kills the daemon process pid with SIGKILL, as a power cut would end it, and waits for it to
    // end; that daemon is then not expected to exit with 0. False when it did not end.
    bool killDaemon(pid_t pid);

    // Set by a derived fixture's constructor; read by SetUp.
    BusOptions busOptions;

  private:
    // SIGTERM to every daemon still running; each must leave with status 0.
    void stopDaemons();

    DeviceRoot device_;
    std::set<pid_t> killed_;
    std::unique_ptr<PrivateBus> bus_;
    std::unique_ptr<BusWatcher> watcher_;
};

}  // namespace tavrix::integration
