#include "bus/ServiceListener.h"

#include <cerrno>
#include <cstring>

#include "bus/BusConnection.h"
#include "util/ContainExceptions.h"
#include "util/Log.h"

namespace tavrix::bus {

ServiceListener::ServiceListener(std::string serviceName, Delegate& delegate)
    : serviceName_(std::move(serviceName)), delegate_(delegate) {}

bool ServiceListener::resume(sd_event* event, const char* path,
                             std::initializer_list<ExportedInterface> interfaces, void* userdata) {
    bus_ = openDaemonBus();
    if (!bus_) {
        logCFormat(LogPriority::Warning, "Cannot connect to the bus for %s\n",
                   serviceName_.c_str());
        return false;
    }
    int r = sd_bus_attach_event(bus_.get(), event, SD_EVENT_PRIORITY_NORMAL);
    sd_bus_slot* slot = nullptr;
    for (const ExportedInterface& interface : interfaces) {
        if (r < 0) {
            break;
        }
        slot = nullptr;
        r = sd_bus_add_object_vtable(bus_.get(), &slot, path, interface.name, interface.vtable,
                                     userdata);
        objectSlots_.emplace_back(slot);
    }
    if (r >= 0) {
        sd_event_source* source = nullptr;
        r = sd_event_add_defer(event, &source, onDepartures, this);
        departuresSource_.reset(source);
        if (r >= 0) {
            r = sd_event_source_set_enabled(source, SD_EVENT_OFF);
        }
    }
    // The object is in place before the name is owned, so calls queued for the name find it.
    if (r >= 0) {
        r = sd_bus_request_name(bus_.get(), serviceName_.c_str(), 0);
        nameOwned_ = r >= 0;
        if (r == -EEXIST) {
            logCFormat("The name %s is owned by another process on the bus\n",
                       serviceName_.c_str());
            return false;
        }
    }
    if (r < 0) {
        logCFormat(LogPriority::Warning, "Cannot serve %s on the bus: %s\n", serviceName_.c_str(),
                   std::strerror(-r));
        return false;
    }
    return true;
}

PeerConnection ServiceListener::peerOf(sd_bus_message* message) const {
    PeerConnection peer;
    const char* sender = sd_bus_message_get_sender(message);
    peer.uniqueName = sender == nullptr ? "" : sender;
    sd_bus_creds* raw = nullptr;
    if (sd_bus_query_sender_creds(message, SD_BUS_CREDS_PID | SD_BUS_CREDS_AUGMENT, &raw) >= 0) {
        pid_t pid = 0;
        if (sd_bus_creds_get_pid(raw, &pid) >= 0) {
            peer.pid = pid;
        }
        sd_bus_creds_unref(raw);
    }
    return peer;
}

void ServiceListener::beginMessage(sd_bus_message* message) {
    const char* sender = sd_bus_message_get_sender(message);
    current_ = sender == nullptr ? "" : sender;
    if (!current_.empty() && !delegate_.isAcceptedConnection(current_)) {
        delegate_.shouldAcceptNewConnection(*this, peerOf(message));
    }
}

BusSlotPtr ServiceListener::watchConnection(const std::string& uniqueName) {
    // Only this peer's departure: a match on the whole of NameOwnerChanged would wake the daemon
    // for every connection on the bus.
    const std::string match =
        "type='signal',sender='org.freedesktop.DBus',path='/org/freedesktop/DBus',"
        "interface='org.freedesktop.DBus',member='NameOwnerChanged',arg0='" +
        uniqueName + "'";
    sd_bus_slot* raw = nullptr;
    int r = sd_bus_add_match(bus_.get(), &raw, match.c_str(), onNameOwnerChanged, this);
    BusSlotPtr slot(raw);
    if (r < 0) {
        logCFormat(LogPriority::Warning, "Cannot watch the client %s on the bus: %s\n",
                   uniqueName.c_str(), std::strerror(-r));
    }
    // A peer that left before the match was in place sends no signal any more.
    if (r < 0 || !hasOwner(uniqueName)) {
        queueDeparture(uniqueName);
    }
    return slot;
}

bool ServiceListener::hasOwner(const std::string& uniqueName) {
    BusError error;
    sd_bus_message* raw = nullptr;
    int r = sd_bus_call_method(bus_.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus",
                               "org.freedesktop.DBus", "NameHasOwner", error.get(), &raw, "s",
                               uniqueName.c_str());
    BusMessagePtr reply(raw);
    int owned = 0;
    if (r < 0 || sd_bus_message_read(reply.get(), "b", &owned) < 0) {
        return true;  // unknown: the match will still report its departure
    }
    return owned != 0;
}

void ServiceListener::queueDeparture(const std::string& uniqueName) {
    departures_.push_back(uniqueName);
    sd_event_source_set_enabled(departuresSource_.get(), SD_EVENT_ONESHOT);
}

int ServiceListener::onNameOwnerChanged(sd_bus_message* message, void* userdata, sd_bus_error*) {
    auto* listener = static_cast<ServiceListener*>(userdata);
    const char* name = nullptr;
    const char* oldOwner = nullptr;
    const char* newOwner = nullptr;
    if (sd_bus_message_read(message, "sss", &name, &oldOwner, &newOwner) < 0 ||
        newOwner == nullptr || *newOwner != '\0') {
        return 0;
    }
    containExceptions("Noting a client's departure", [&] { listener->queueDeparture(name); });
    return 0;
}

int ServiceListener::onDepartures(sd_event_source*, void* userdata) {
    auto* listener = static_cast<ServiceListener*>(userdata);
    std::vector<std::string> departed;
    departed.swap(listener->departures_);
    for (const std::string& uniqueName : departed) {
        containExceptions("Removing a client",
                          [&] { listener->delegate_.connectionInvalidated(uniqueName); });
    }
    return 0;
}

void ServiceListener::releaseNameAndDrain() {
    if (!bus_) {
        return;
    }
    if (nameOwned_) {
        // Waiting for this reply queues every message the bus routed to us before the release.
        sd_bus_release_name(bus_.get(), serviceName_.c_str());
        nameOwned_ = false;
    }
    while (sd_bus_process(bus_.get(), nullptr) > 0) {
    }
    sd_bus_flush(bus_.get());
}

}  // namespace tavrix::bus
