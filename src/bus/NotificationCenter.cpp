#include "bus/NotificationCenter.h"

#include <cstdint>
#include <mutex>
#include <thread>
#include <vector>

#include "bus/BusConnection.h"
#include "bus/BusHandles.h"
#include "io/WakeEvent.h"
#include "util/ContainExceptions.h"

namespace tavrix::bus {
namespace {

int emit(sd_bus* bus, const std::string& name) {
    int r = sd_bus_emit_signal(bus, kNotificationPath, kNotificationInterface, kNotificationMember,
                               "s", name.c_str());
    return r < 0 ? r : sd_bus_flush(bus);
}

// Subscribers match the sender against the owner of the daemon's name, so every notification
// leaves on the connection that owns it. Other threads may not touch that connection: they hand
// their names to the main loop, which a wake event wakes.
struct MainConnection {
    std::mutex mutex;
    sd_bus* bus = nullptr;
    std::thread::id thread;
    io::WakeEvent wake;
    EventSourcePtr source;
    std::vector<std::string> pending;
};

MainConnection& mainConnection() {
    static MainConnection* connection =
        new MainConnection;  // never destroyed: threads may post late
    return *connection;
}

// Takes what other threads queued; called on the main thread.
std::vector<std::string> takePending(MainConnection& main) {
    std::lock_guard lock(main.mutex);
    main.wake.consume();
    return std::exchange(main.pending, {});
}

int onQueued(sd_event_source* /*source*/, int /*fd*/, uint32_t /*revents*/,
             void* /*userdata*/) noexcept {
    containExceptions("Posting queued notifications", [] {
        MainConnection& main = mainConnection();
        for (const std::string& name : takePending(main)) {
            emit(main.bus, name);
        }
    });
    return 0;
}

}  // namespace

void setNotificationBus(sd_bus* bus) {
    MainConnection& main = mainConnection();
    if (bus == nullptr) {
        // Whatever is still queued goes out before the connection is given up.
        std::vector<std::string> last = takePending(main);
        for (const std::string& name : last) {
            if (main.bus != nullptr) {
                emit(main.bus, name);
            }
        }
        std::lock_guard lock(main.mutex);
        main.source.reset();
        main.wake = io::WakeEvent();
        main.bus = nullptr;
        return;
    }
    std::lock_guard lock(main.mutex);
    main.bus = bus;
    main.thread = std::this_thread::get_id();
    main.wake = io::WakeEvent::create();
    sd_event_source* raw = nullptr;
    if (main.wake && sd_bus_get_event(bus) != nullptr &&
        sd_event_add_io(sd_bus_get_event(bus), &raw, main.wake.fd(), EPOLLIN, onQueued, nullptr) >=
            0) {
        main.source.reset(raw);
    } else {
        main.wake = io::WakeEvent();
    }
}

bool postNotification(const std::string& name) {
    MainConnection& main = mainConnection();
    {
        std::lock_guard lock(main.mutex);
        if (main.bus != nullptr && main.thread == std::this_thread::get_id()) {
            // The main thread is the only user of the connection; the lock only guards the fields.
            return emit(main.bus, name) >= 0;
        }
        if (main.source) {
            main.pending.push_back(name);
            main.wake.raise();
            return true;
        }
    }
    // No daemon connection (tools, tests of the core): a connection of this thread's own.
    BusPtr own = openDaemonBus();
    return own && emit(own.get(), name) >= 0;
}

}  // namespace tavrix::bus
