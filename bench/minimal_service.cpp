// The peer of bus_bench: about the least a bus-activated sd-bus service can be. It connects to the
// bus that started it, owns bench.MinimalService, answers Answer() with true and serves until
// SIGTERM. It links libsystemd alone, so its start, speed and memory are those of sd-bus itself.
#include <signal.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "bus/BusHandles.h"

using tavrix::bus::BusPtr;
using tavrix::bus::BusSlotPtr;
using tavrix::bus::EventPtr;
using tavrix::bus::EventSourcePtr;

namespace {

int handleAnswer(sd_bus_message* message, void*, sd_bus_error*) {
    return sd_bus_reply_method_return(message, "b", 1);
}

const sd_bus_vtable kMinimalVTable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("Answer", "", "b", handleAnswer, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

int failed(const char* what, int r) {
    std::fprintf(stderr, "minimal_service: %s: %s\n", what, std::strerror(-r));
    return 1;
}

}  // namespace

int main() {
    // The event loop takes SIGTERM through a signalfd, which needs the signal blocked.
    sigset_t handled;
    sigemptyset(&handled);
    sigaddset(&handled, SIGTERM);
    sigaddset(&handled, SIGINT);
    sigprocmask(SIG_BLOCK, &handled, nullptr);

    // Like the daemon, it serves only the bus that activated it.
    const char* address = std::getenv("DBUS_STARTER_ADDRESS");
    if (address == nullptr || *address == '\0') {
        std::fprintf(stderr, "minimal_service: DBUS_STARTER_ADDRESS is not set\n");
        return 1;
    }

    sd_event* rawEvent = nullptr;
    int r = sd_event_default(&rawEvent);
    if (r < 0) {
        return failed("cannot create the event loop", r);
    }
    EventPtr event(rawEvent);
    sd_event_source* rawSource = nullptr;
    // Without a handler, the signal exits the loop.
    r = sd_event_add_signal(event.get(), &rawSource, SIGTERM, nullptr, nullptr);
    if (r < 0) {
        return failed("cannot watch SIGTERM", r);
    }
    EventSourcePtr terminate(rawSource);
    rawSource = nullptr;
    r = sd_event_add_signal(event.get(), &rawSource, SIGINT, nullptr, nullptr);
    if (r < 0) {
        return failed("cannot watch SIGINT", r);
    }
    EventSourcePtr interrupt(rawSource);

    sd_bus* rawBus = nullptr;
    r = sd_bus_new(&rawBus);
    if (r < 0) {
        return failed("cannot create a bus connection", r);
    }
    BusPtr bus(rawBus);
    if ((r = sd_bus_set_address(bus.get(), address)) < 0 ||
        (r = sd_bus_set_bus_client(bus.get(), 1)) < 0 || (r = sd_bus_start(bus.get())) < 0) {
        return failed("cannot connect to the bus", r);
    }
    r = sd_bus_attach_event(bus.get(), event.get(), SD_EVENT_PRIORITY_NORMAL);
    if (r < 0) {
        return failed("cannot attach the bus to the event loop", r);
    }
    sd_bus_slot* rawSlot = nullptr;
    r = sd_bus_add_object_vtable(bus.get(), &rawSlot, "/bench/Minimal", "bench.Minimal",
                                 kMinimalVTable, nullptr);
    if (r < 0) {
        return failed("cannot export /bench/Minimal", r);
    }
    BusSlotPtr object(rawSlot);
    // The object is in place before the name is owned, so that the call that started us finds it.
    r = sd_bus_request_name(bus.get(), "bench.MinimalService", 0);
    if (r < 0) {
        return failed("cannot own bench.MinimalService", r);
    }

    r = sd_event_loop(event.get());
    if (r < 0) {
        return failed("event loop failed", r);
    }
    return 0;
}
