// The listener for the daemon's named service on D-Bus. It owns the bus connection (attached to
// the main event loop), exports one object, owns the well-known name, and turns bus peers into
// connections: a peer's first call accepts it (with its pid and command name from its
// credentials), and its leaving the bus invalidates it.
#pragma once

#include <sys/types.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <initializer_list>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/BusHandles.h"

namespace tavrix::platform {

struct ExportedInterface {
    const char* name;
    const sd_bus_vtable* vtable;
};

struct PeerConnection {
    std::string uniqueName;
    pid_t pid = 0;
    std::optional<std::string> commandName;
};

class ServiceListener {
  public:
    class Delegate {
      public:
        virtual ~Delegate() = default;
        // A peer's first call; a peer not accepted is asked about again on its next call.
        virtual bool shouldAcceptNewConnection(ServiceListener& listener,
                                               const PeerConnection& connection) = 0;
        // The peer left the bus.
        virtual void connectionInvalidated(const std::string& uniqueName) = 0;
    };

    ServiceListener(std::string serviceName, Delegate& delegate);
    ServiceListener(const ServiceListener&) = delete;
    ServiceListener& operator=(const ServiceListener&) = delete;

    // Connects, attaches to the event loop, exports the interfaces at path and owns the name.
    // False (with a log line) when any of it fails.
    bool resume(sd_event* event, const char* path,
                std::initializer_list<ExportedInterface> interfaces, void* userdata);

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
    PeerConnection peerOf(sd_bus_message* message) const;

    std::string serviceName_;
    Delegate& delegate_;
    BusPtr bus_;
    std::vector<BusSlotPtr> objectSlots_;
    BusSlotPtr ownerChangedSlot_;
    std::set<std::string> accepted_;
    std::string current_;
    bool nameOwned_ = false;
};

}  // namespace tavrix::platform
