// The test's own connection to the private bus: it follows who owns the daemon's name and which
// notifications were posted, and answers the bus's questions about the owner. Everything waits
// on the bus itself, never on the clock alone.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <map>
#include <optional>
#include <string>

#include "bus/BusHandles.h"

namespace tavrix::integration {

inline constexpr const char* kDaemonBusName = "com.zandor.tavrixservicesd";

// A new client connection to the bus at address; throws std::runtime_error when it fails.
bus::BusPtr connectToBus(const std::string& address);

class BusWatcher {
  public:
    explicit BusWatcher(const std::string& address);

    // Handles what has arrived, then waits for more until done() holds or the timeout passes.
    bool waitUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout);

    bool waitForNameOwner(std::chrono::milliseconds timeout);
    bool waitForNoNameOwner(std::chrono::milliseconds timeout);
    // The daemon's unique name, "" while the name has no owner.
    const std::string& nameOwner() const { return owner_; }
    // How often the name was released since the watcher started.
    int nameReleaseCount() const { return releases_; }

    // The process that owns the daemon's name now.
    std::optional<pid_t> ownerPid();

    int notificationCount(const std::string& name) const;
    bool waitForNotification(const std::string& name, int count, std::chrono::milliseconds timeout);

  private:
    static int onNameOwnerChanged(sd_bus_message* message, void* self, sd_bus_error*);
    static int onPosted(sd_bus_message* message, void* self, sd_bus_error*);

    bus::BusPtr bus_;
    bus::BusSlotPtr ownerSlot_;
    bus::BusSlotPtr postedSlot_;
    std::string owner_;
    int releases_ = 0;
    std::map<std::string, int> notifications_;
};

}  // namespace tavrix::integration
