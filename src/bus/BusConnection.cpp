#include "bus/BusConnection.h"

#include <cstdlib>

namespace tavrix::bus {

BusPtr openDaemonBus() {
    sd_bus* raw = nullptr;
    const char* starter = std::getenv("DBUS_STARTER_ADDRESS");
    if (starter == nullptr || *starter == '\0') {
        return sd_bus_open_system(&raw) < 0 ? nullptr : BusPtr(raw);
    }
    if (sd_bus_new(&raw) < 0) {
        return nullptr;
    }
    BusPtr bus(raw);
    if (sd_bus_set_address(bus.get(), starter) < 0 || sd_bus_set_bus_client(bus.get(), 1) < 0 ||
        sd_bus_start(bus.get()) < 0) {
        return nullptr;
    }
    return bus;
}

}  // namespace tavrix::bus
