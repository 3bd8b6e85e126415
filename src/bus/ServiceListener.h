// The listener for the daemon's named service on D-Bus. It owns the bus connection (attached to
// the main event loop), exports one object, owns the well-known name, and turns bus peers into
// connections: a peer's first call accepts it (with its pid and command name from its
// credentials), and its leaving the bus invalidates it. Which peers are accepted is the
// delegate's to know; the listener only watches the names it is asked to, so that the bus's other
// comings and goings never wake the daemon.
#pragma once

#include <sys/types.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <initializer_list>
#include <optional>
#include <string>
#include <vector>

#include "bus/BusHandles.h"

namespace tavrix::bus {

struct ExportedInterface {
    const char* name;
    const sd_bus_vtable* vtable;
};

struct PeerConnection {
    std::string uniqueName;
    pid_t pid = 0;
};

class ServiceListener {
  public:
    class Delegate {
      public:
        virtual ~Delegate() = default;
        // A peer's first call; a peer not accepted is asked about again on its next call.
        virtual bool shouldAcceptNewConnection(ServiceListener& listener,
                                               const PeerConnection& connection) = 0;
        // Whether the peer was accepted and has not been invalidated since.
        virtual bool isAcceptedConnection(const std::string& uniqueName) const = 0;
        // A watched peer left the bus (delivered from the loop, never inside a method handler).
        virtual void connectionInvalidated(const std::string& uniqueName) = 0;
    };

    ServiceListener(std::string serviceName, Delegate& delegate);
    ServiceListener(const ServiceListener&) = delete;
    ServiceListener& operator=(const ServiceListener&) = delete;

    // Connects, attaches to the event loop, exports the interfaces at path and owns the name.
    // False (with one log line saying which) when any of it fails: no bus, the name owned by
    // another process, or the connection refusing the set-up.
    bool resume(sd_event* event, const char* path,
                std::initializer_list<ExportedInterface> interfaces, void* userdata);

    // Watches a peer until the returned slot is dropped: once it leaves the bus (or if it already
    // has), the delegate hears connectionInvalidated. Null when the bus refused the watch; the
    // peer is then treated as gone.
    BusSlotPtr watchConnection(const std::string& uniqueName);

    // Called by every method handler first: accepts the sender on its first call and makes it
    // the current connection.
    void beginMessage(sd_bus_message* message);
    // The unique name of the peer whose message is being handled, or empty.
    const std::string& currentConnection() const { return current_; }
    void endMessage() { current_.clear(); }

    // Gives the name up and answers every call that already reached the daemon, so that nothing
    // sent before the release is lost; later calls start a new daemon.
    void releaseNameAndDrain();

    sd_bus* bus() const { return bus_.get(); }

  private:
    static int onNameOwnerChanged(sd_bus_message* message, void* userdata, sd_bus_error* error);
    static int onDepartures(sd_event_source* source, void* userdata);
    PeerConnection peerOf(sd_bus_message* message) const;
    bool hasOwner(const std::string& uniqueName);
    void queueDeparture(const std::string& uniqueName);

    std::string serviceName_;
    Delegate& delegate_;
    BusPtr bus_;
    std::vector<BusSlotPtr> objectSlots_;
    // Departures reach the delegate from this one-shot source, outside any bus callback, so that
    // the delegate may drop the watch that reported them.
    EventSourcePtr departuresSource_;
    std::vector<std::string> departures_;
    std::string current_;
    bool nameOwned_ = false;
};

}  // namespace tavrix::bus
