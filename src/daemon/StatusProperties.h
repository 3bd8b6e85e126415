// The status view as read-only properties of the status interface, and what announces it:
// PropertiesChanged for the fields that changed and UpdateCheckFinished when a check ends, so
// that a client follows the daemon without polling. Properties are flat and typed as systemd's
// are: text "" and times 0 when there is none, times in microseconds since 1970.
//
// The publisher lives on the main thread, which owns the bus connection. Other threads (downloads,
// installs, the scheduler) only mark it stale or hand it a finished check; an eventfd brings that
// to the loop, which compares the status with what it last announced.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "bus/BusHandles.h"
#include "io/WakeEvent.h"
#include "plist/Value.h"

namespace tavrix {

inline constexpr const char* kUpdateCheckFinishedSignal = "UpdateCheckFinished";

class StatusPublisher {
  public:
    // The daemon root's publisher; it outlives the worker threads that report to it.
    static StatusPublisher& shared();

    // Announces on bus, at path on the status interface, from event's loop. Until
    // holdsInstanceLock() is true, reads leave out what would start the previous daemon's work
    // here. False (logged) when the loop refused the wake-up source; the properties are then
    // still readable.
    bool attach(sd_event* event, sd_bus* bus, const char* path,
                std::function<bool()> holdsInstanceLock);
    // Announces what is pending, then stops announcing.
    void detach();

    // From any thread: the status may have changed; the loop looks and announces the difference.
    void markStale();
    // From any thread: an update check ended (any outcome but "downloading").
    void noteCheckFinished(const std::string& outcome, const std::string& reason);
    // Main thread: announces finished checks and the properties that changed since the last
    // announcement. Reads nothing before the behavior manager exists, so that announcing never
    // starts a bundle match of its own.
    void publish();

    // The status interface's table: GetStatus (answered by getStatus), the properties and the
    // check signal.
    static const sd_bus_vtable* vtable(sd_bus_message_handler_t getStatus);

  private:
    StatusPublisher() = default;
    static int getProperty(sd_bus* bus, const char* path, const char* interface,
                           const char* property, sd_bus_message* reply, void* userdata,
                           sd_bus_error* error) noexcept;
    static int onWake(sd_event_source* source, int fd, uint32_t revents, void* userdata) noexcept;
    // The status a Get or GetAll answers from: read once per call.
    const plist::Dictionary& statusForCall(sd_bus_message* reply);
    void wake();
    // False until attached: nothing is known to be safe to start.
    bool holdsInstanceLock() const { return holdsInstanceLock_ && holdsInstanceLock_(); }

    // Main thread only.
    sd_bus* bus_ = nullptr;
    const char* path_ = nullptr;
    std::function<bool()> holdsInstanceLock_;
    bus::EventSourcePtr source_;
    // What the last PropertiesChanged said; nothing until the status was first read.
    std::optional<plist::Dictionary> announced_;
    std::pair<std::string, std::uint64_t> readFor_;
    plist::Dictionary readForCall_;

    // Set by every wake-up until publish() runs: a read then must not be taken for what was
    // announced, or the announcement on its way would find nothing changed.
    std::atomic<bool> stale_{false};
    // Guards what other threads hand over, and the wake-up they raise.
    std::mutex pendingLock_;
    io::WakeEvent wakeEvent_;
    std::vector<std::pair<std::string, std::string>> finishedChecks_;
};

}  // namespace tavrix
