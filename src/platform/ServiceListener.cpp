#include "platform/ServiceListener.h"

#include <cstring>

#include "platform/BusConnection.h"
#include "util/Log.h"

namespace tavrix::platform {

ServiceListener::ServiceListener(std::string serviceName, Delegate& delegate)
    : serviceName_(std::move(serviceName)), delegate_(delegate) {}

bool ServiceListener::resume(sd_event* event, const char* path,
                             std::initializer_list<ExportedInterface> interfaces, void* userdata) {
    bus_ = openDaemonBus();
    if (!bus_) {
        logCFormat("Cannot connect to the bus for %s\n", serviceName_.c_str());
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
        slot = nullptr;
        r = sd_bus_match_signal(bus_.get(), &slot, "org.freedesktop.DBus", "/org/freedesktop/DBus",
                                "org.freedesktop.DBus", "NameOwnerChanged", onNameOwnerChanged,
                                this);
        ownerChangedSlot_.reset(slot);
    }
    // The object is in place before the name is owned, so calls queued for the name find it.
    if (r >= 0) {
        r = sd_bus_request_name(bus_.get(), serviceName_.c_str(), 0);
        nameOwned_ = r >= 0;
    }
    if (r < 0) {
        logCFormat("Cannot serve %s on the bus: %s\n", serviceName_.c_str(), std::strerror(-r));
        return false;
    }
    return true;
}

PeerConnection ServiceListener::peerOf(sd_bus_message* message) const {
    PeerConnection peer;
    const char* sender = sd_bus_message_get_sender(message);
    peer.uniqueName = sender == nullptr ? "" : sender;
    sd_bus_creds* raw = nullptr;
    if (sd_bus_query_sender_creds(
            message, SD_BUS_CREDS_PID | SD_BUS_CREDS_COMM | SD_BUS_CREDS_AUGMENT, &raw) >= 0) {
        pid_t pid = 0;
        const char* comm = nullptr;
        if (sd_bus_creds_get_pid(raw, &pid) >= 0) {
            peer.pid = pid;
        }
        if (sd_bus_creds_get_comm(raw, &comm) >= 0 && comm != nullptr) {
            peer.commandName = comm;
        }
        sd_bus_creds_unref(raw);
    }
    return peer;
}

void ServiceListener::beginMessage(sd_bus_message* message) {
    const char* sender = sd_bus_message_get_sender(message);
    current_ = sender == nullptr ? "" : sender;
    if (current_.empty() || accepted_.count(current_) != 0) {
        return;
    }
    if (delegate_.shouldAcceptNewConnection(*this, peerOf(message))) {
        accepted_.insert(current_);
    }
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
    auto it = listener->accepted_.find(name);
    if (it == listener->accepted_.end()) {
        return 0;
    }
    std::string uniqueName = *it;
    listener->accepted_.erase(it);
    listener->delegate_.connectionInvalidated(uniqueName);
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

}  // namespace tavrix::platform
