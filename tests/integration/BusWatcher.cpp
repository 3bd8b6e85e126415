#include "BusWatcher.h"

#include <stdexcept>

namespace tavrix::integration {
namespace {

using Clock = std::chrono::steady_clock;

constexpr const char* kOwnerChangedMatch =
    "type='signal',sender='org.freedesktop.DBus',interface='org.freedesktop.DBus',"
    "member='NameOwnerChanged',arg0='com.zandor.tavrixservicesd'";
constexpr const char* kPostedMatch =
    "type='signal',interface='com.zandor.NotificationCenter',member='Posted'";

void check(int result, const char* what) {
    if (result < 0) {
        throw std::runtime_error(std::string(what) + " failed: " + std::to_string(-result));
    }
}

}  // namespace

bus::BusPtr connectToBus(const std::string& address) {
    sd_bus* raw = nullptr;
    check(sd_bus_new(&raw), "sd_bus_new");
    bus::BusPtr bus(raw);
    check(sd_bus_set_address(bus.get(), address.c_str()), "sd_bus_set_address");
    check(sd_bus_set_bus_client(bus.get(), 1), "sd_bus_set_bus_client");
    check(sd_bus_start(bus.get()), "sd_bus_start");
    return bus;
}

BusWatcher::BusWatcher(const std::string& address) : bus_(connectToBus(address)) {
    sd_bus_slot* slot = nullptr;
    check(sd_bus_add_match(bus_.get(), &slot, kOwnerChangedMatch, &onNameOwnerChanged, this),
          "sd_bus_add_match");
    ownerSlot_.reset(slot);
    check(sd_bus_add_match(bus_.get(), &slot, kPostedMatch, &onPosted, this), "sd_bus_add_match");
    postedSlot_.reset(slot);

    // Asked after subscribing, so that no change falls between the answer and the signals.
    bus::BusError error;
    sd_bus_message* reply = nullptr;
    if (sd_bus_call_method(bus_.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus",
                           "org.freedesktop.DBus", "GetNameOwner", error.get(), &reply, "s",
                           kDaemonBusName) >= 0) {
        bus::BusMessagePtr owned(reply);
        const char* owner = nullptr;
        if (sd_bus_message_read(reply, "s", &owner) >= 0 && owner != nullptr) {
            owner_ = owner;
        }
    }
}

bool BusWatcher::waitUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout) {
    const auto deadline = Clock::now() + timeout;
    for (;;) {
        int processed = 0;
        while ((processed = sd_bus_process(bus_.get(), nullptr)) > 0) {
        }
        if (done()) {
            return true;
        }
        auto left = std::chrono::duration_cast<std::chrono::microseconds>(deadline - Clock::now());
        if (processed < 0 || left.count() <= 0) {
            return false;
        }
        sd_bus_wait(bus_.get(), static_cast<std::uint64_t>(left.count()));
    }
}

bool BusWatcher::waitForNameOwner(std::chrono::milliseconds timeout) {
    return waitUntil([this] { return !owner_.empty(); }, timeout);
}

bool BusWatcher::waitForNoNameOwner(std::chrono::milliseconds timeout) {
    return waitUntil([this] { return owner_.empty(); }, timeout);
}

std::optional<pid_t> BusWatcher::ownerPid() {
    bus::BusError error;
    sd_bus_message* reply = nullptr;
    if (sd_bus_call_method(bus_.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus",
                           "org.freedesktop.DBus", "GetConnectionUnixProcessID", error.get(),
                           &reply, "s", kDaemonBusName) < 0) {
        return std::nullopt;
    }
    bus::BusMessagePtr owned(reply);
    std::uint32_t pid = 0;
    if (sd_bus_message_read(reply, "u", &pid) < 0) {
        return std::nullopt;
    }
    return static_cast<pid_t>(pid);
}

int BusWatcher::notificationCount(const std::string& name) const {
    auto found = notifications_.find(name);
    return found == notifications_.end() ? 0 : found->second;
}

bool BusWatcher::waitForNotification(const std::string& name, int count,
                                     std::chrono::milliseconds timeout) {
    return waitUntil([&] { return notificationCount(name) >= count; }, timeout);
}

int BusWatcher::onNameOwnerChanged(sd_bus_message* message, void* self, sd_bus_error*) {
    auto* watcher = static_cast<BusWatcher*>(self);
    const char* name = nullptr;
    const char* oldOwner = nullptr;
    const char* newOwner = nullptr;
    if (sd_bus_message_read(message, "sss", &name, &oldOwner, &newOwner) < 0) {
        return 0;
    }
    watcher->owner_ = newOwner;
    if (*oldOwner != '\0' && *newOwner == '\0') {
        ++watcher->releases_;
    }
    return 0;
}

int BusWatcher::onPosted(sd_bus_message* message, void* self, sd_bus_error*) {
    const char* name = nullptr;
    if (sd_bus_message_read(message, "s", &name) >= 0) {
        ++static_cast<BusWatcher*>(self)->notifications_[name];
    }
    return 0;
}

}  // namespace tavrix::integration
