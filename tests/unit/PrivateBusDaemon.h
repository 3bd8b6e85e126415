// A private message bus for tests: a dbus-daemon of its own, listening in a temporary directory,
// that allows everything and activates nothing. Stopped when the object goes.
#pragma once

#include <optional>
#include <stdexcept>
#include <string>

#include "DbusDaemonProcess.h"
#include "TestSupport.h"
#include "bus/BusHandles.h"

namespace tavrix::test {

class PrivateBusDaemon {
  public:
    PrivateBusDaemon() {
        // Its complaints (it cannot raise its descriptor limit unprivileged) go beside the socket.
        process_.emplace(writeBusConfiguration(directory_.path(), kOpenBusPolicy),
                         directory_ / "daemon.log");
    }
    PrivateBusDaemon(const PrivateBusDaemon&) = delete;
    PrivateBusDaemon& operator=(const PrivateBusDaemon&) = delete;

    const std::string& address() const { return process_->address(); }

    // A new client connection to this bus, its unique name already assigned.
    bus::BusPtr connect() const {
        sd_bus* raw = nullptr;
        if (sd_bus_new(&raw) < 0) {
            throw std::runtime_error("sd_bus_new failed");
        }
        bus::BusPtr bus(raw);
        const char* name = nullptr;
        if (sd_bus_set_address(bus.get(), address().c_str()) < 0 ||
            sd_bus_set_bus_client(bus.get(), 1) < 0 || sd_bus_start(bus.get()) < 0 ||
            sd_bus_get_unique_name(bus.get(), &name) < 0) {
            throw std::runtime_error("cannot connect to the test bus");
        }
        return bus;
    }
    // An address in the same directory where nothing listens.
    std::string deadAddress() const { return "unix:path=" + (directory_ / "nothing-here"); }

    void stop() { process_->stop(); }

  private:
    TempDir directory_;
    std::optional<DbusDaemonProcess> process_;
};

}  // namespace tavrix::test
