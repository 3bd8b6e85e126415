// Owners of the sd-bus and sd-event C handles. Wrap a handle the moment a call hands it out, so
// that every early return releases it.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <memory>

namespace tavrix::bus {

namespace detail {

// Deleters as types, so that the owners stay the size of a pointer.
struct BusUnref {
    // Flushes what is still queued (replies in particular) before the connection closes.
    void operator()(sd_bus* bus) const noexcept { sd_bus_flush_close_unref(bus); }
};
struct BusMessageUnref {
    void operator()(sd_bus_message* message) const noexcept { sd_bus_message_unref(message); }
};
struct BusSlotUnref {
    void operator()(sd_bus_slot* slot) const noexcept { sd_bus_slot_unref(slot); }
};
struct EventUnref {
    void operator()(sd_event* event) const noexcept { sd_event_unref(event); }
};
struct EventSourceUnref {
    // Disabling first keeps a source that someone else still references from firing again.
    void operator()(sd_event_source* source) const noexcept {
        sd_event_source_disable_unref(source);
    }
};

}  // namespace detail

using BusPtr = std::unique_ptr<sd_bus, detail::BusUnref>;
using BusMessagePtr = std::unique_ptr<sd_bus_message, detail::BusMessageUnref>;
using BusSlotPtr = std::unique_ptr<sd_bus_slot, detail::BusSlotUnref>;
using EventPtr = std::unique_ptr<sd_event, detail::EventUnref>;
using EventSourcePtr = std::unique_ptr<sd_event_source, detail::EventSourceUnref>;

// An sd_bus_error that frees its name and message when it goes.
class BusError {
  public:
    BusError() = default;
    BusError(BusError&& other) noexcept { sd_bus_error_move(&error_, &other.error_); }
    BusError& operator=(BusError&& other) noexcept {
        if (this != &other) {
            sd_bus_error_free(&error_);
            sd_bus_error_move(&error_, &other.error_);
        }
        return *this;
    }
    BusError(const BusError&) = delete;
    BusError& operator=(const BusError&) = delete;
    ~BusError() { sd_bus_error_free(&error_); }

    // For the sd-bus calls that fill in an error.
    sd_bus_error* get() { return &error_; }
    const sd_bus_error* get() const { return &error_; }

    bool isSet() const { return sd_bus_error_is_set(&error_) > 0; }
    // The error's name and message; empty texts when unset.
    const char* name() const { return error_.name != nullptr ? error_.name : ""; }
    const char* message() const { return error_.message != nullptr ? error_.message : ""; }

  private:
    sd_bus_error error_ = SD_BUS_ERROR_NULL;
};

}  // namespace tavrix::bus
