#include "platform/NotificationCenter.h"

#include <atomic>
#include <thread>

#include "platform/BusConnection.h"
#include "platform/BusHandles.h"

namespace tavrix::platform {
namespace {

std::atomic<sd_bus*> mainBus{nullptr};
std::atomic<std::thread::id> mainThread{};

int emit(sd_bus* bus, const std::string& name) {
    int r = sd_bus_emit_signal(bus, kNotificationPath, kNotificationInterface, kNotificationMember,
                               "s", name.c_str());
    return r < 0 ? r : sd_bus_flush(bus);
}

}  // namespace

void setNotificationBus(sd_bus* bus) {
    mainBus.store(bus);
    mainThread.store(std::this_thread::get_id());
}

bool postNotification(const std::string& name) {
    sd_bus* bus = mainBus.load();
    if (bus != nullptr && mainThread.load() == std::this_thread::get_id()) {
        return emit(bus, name) >= 0;
    }
    BusPtr own = openDaemonBus();
    return own && emit(own.get(), name) >= 0;
}

}  // namespace tavrix::platform
