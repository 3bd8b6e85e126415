#include "daemon/StatusProperties.h"

#include <cmath>
#include <cstring>

#include "daemon/TXManager.h"
#include "daemon/TXManagerServer.h"
#include "daemon/TXManagerStatus.h"
#include "update/ActivityRecord.h"
#include "util/ContainExceptions.h"
#include "util/Log.h"
#include "util/SharedInstance.h"
#include "util/Utf8.h"

namespace tavrix {
namespace {

// Seconds from 1970 to the property lists' reference date, 2001-01-01.
constexpr double kReferenceDateFromUnixEpoch = 978307200.0;

// One property: its D-Bus type and where the status view keeps its value.
struct StatusProperty {
    const char* name;
    const char* type;   // "s", "b" or "t"
    const char* key;    // in the status view
    const char* field;  // in that key's dictionary, or null
};

constexpr StatusProperty kDaemonVersionProperty = {"DaemonVersion", "s", kStatusDaemonVersionKey,
                                                   nullptr};
// The properties that change, in the order introspection lists them.
constexpr StatusProperty kChangingProperties[] = {
    {"BehaviorID", "s", kStatusBehaviorIDKey, nullptr},
    {"Supported", "b", kStatusSupportedKey, nullptr},
    {"WhyNotSupported", "s", kStatusWhyNotSupportedKey, nullptr},
    {"LinkedBundlePath", "s", kStatusLinkedBundleKey, "Path"},
    {"LinkedBundleIdentifier", "s", kStatusLinkedBundleKey, "Identifier"},
    {"LinkedBundleVersion", "s", kStatusLinkedBundleKey, "Version"},
    {"LinkedBundleOverlayType", "s", kStatusLinkedBundleKey, "OverlayType"},
    {"LinkedBundleCarrierFile", "s", kStatusLinkedBundleKey, "CarrierFile"},
    {"SystemBundleVersion", "s", kStatusSystemBundleVersionKey, nullptr},
    {"UserBundleVersion", "s", kStatusUserBundleVersionKey, nullptr},
    {"NextUpdateCheckUSec", "t", kStatusNextUpdateCheckKey, nullptr},
    {"LastCheckUSec", "t", kLastCheckKey, kActivityTimeKey},
    {"LastCheckOutcome", "s", kLastCheckKey, kActivityOutcomeKey},
    {"LastCheckReason", "s", kLastCheckKey, kActivityReasonKey},
    {"LastPayloadUSec", "t", kLastPayloadKey, kActivityTimeKey},
    {"LastPayloadExtracted", "b", kLastPayloadKey, kActivityExtractedKey},
    {"LastPayloadReason", "s", kLastPayloadKey, kActivityReasonKey},
};

const StatusProperty* propertyNamed(const char* name) {
    if (std::strcmp(name, kDaemonVersionProperty.name) == 0) {
        return &kDaemonVersionProperty;
    }
    for (const StatusProperty& property : kChangingProperties) {
        if (std::strcmp(name, property.name) == 0) {
            return &property;
        }
    }
    return nullptr;
}

const plist::Value* valueOf(const plist::Dictionary& status, const StatusProperty& property) {
    auto found = status.find(property.key);
    if (found == status.end() || property.field == nullptr) {
        return found == status.end() ? nullptr : &found->second;
    }
    const plist::Dictionary* entry = found->second.asDictionary();
    if (entry == nullptr) {
        return nullptr;
    }
    auto inner = entry->find(property.field);
    return inner == entry->end() ? nullptr : &inner->second;
}

bool sameValue(const plist::Value* a, const plist::Value* b) {
    return a == nullptr ? b == nullptr : b != nullptr && *a == *b;
}

int appendProperty(sd_bus_message* reply, const StatusProperty& property,
                   const plist::Value* value) {
    switch (property.type[0]) {
        case 'b': {
            const bool* flag = value != nullptr ? value->asBoolean() : nullptr;
            return sd_bus_message_append(reply, "b", flag != nullptr && *flag ? 1 : 0);
        }
        case 't': {
            const plist::Date* date = value != nullptr ? value->asDate() : nullptr;
            double micros = 0;
            if (date != nullptr) {
                micros = std::round(
                    (date->secondsSinceReferenceDate + kReferenceDateFromUnixEpoch) * 1e6);
            }
            // Before 1970 or beyond the type: no time to tell.
            const bool fits = std::isfinite(micros) && micros > 0 && micros < 1.8e19;
            return sd_bus_message_append(reply, "t", fits ? static_cast<std::uint64_t>(micros) : 0);
        }
        default: {
            // sd-bus refuses text that is not UTF-8 (a path may hold any bytes): that reads "".
            const std::string* text = value != nullptr ? value->asString() : nullptr;
            const bool sendable = text != nullptr && isValidUtf8(*text);
            return sd_bus_message_append(reply, "s", sendable ? text->c_str() : "");
        }
    }
}

void onActivity(const char* key, const std::string& outcome, const std::string& reason) {
    StatusPublisher& publisher = StatusPublisher::shared();
    if (std::strcmp(key, kLastCheckKey) == 0 && outcome != kCheckDownloading) {
        publisher.noteCheckFinished(outcome, reason);
    } else {
        publisher.markStale();
    }
}

}  // namespace

StatusPublisher& StatusPublisher::shared() {
    return SharedInstance<StatusPublisher>::current().instance(
        [] { return std::unique_ptr<StatusPublisher>(new StatusPublisher()); });
}

bool StatusPublisher::attach(sd_event* event, sd_bus* bus, const char* path,
                             std::function<bool()> holdsInstanceLock) {
    bus_ = bus;
    path_ = path;
    holdsInstanceLock_ = std::move(holdsInstanceLock);
    io::WakeEvent wakeEvent = io::WakeEvent::create();
    sd_event_source* raw = nullptr;
    int r =
        wakeEvent ? sd_event_add_io(event, &raw, wakeEvent.fd(), EPOLLIN, onWake, this) : -errno;
    source_.reset(raw);
    // Before the next call is handled, so that announcements keep the order of what caused them.
    if (r >= 0) {
        r = sd_event_source_set_priority(raw, SD_EVENT_PRIORITY_NORMAL - 1);
    }
    if (r < 0) {
        logCFormat(LogPriority::Warning, "Cannot announce status changes: %s\n", std::strerror(-r));
        return false;
    }
    {
        std::lock_guard lock(pendingLock_);
        wakeEvent_ = std::move(wakeEvent);
    }
    setActivityObserver(onActivity);
    return true;
}

void StatusPublisher::detach() {
    setActivityObserver(nullptr);
    publish();
    {
        std::lock_guard lock(pendingLock_);
        wakeEvent_ = io::WakeEvent();
    }
    source_.reset();
    bus_ = nullptr;
}

void StatusPublisher::wake() {
    stale_ = true;
    std::lock_guard lock(pendingLock_);
    wakeEvent_.raise();
}

void StatusPublisher::markStale() {
    wake();
}

void StatusPublisher::noteCheckFinished(const std::string& outcome, const std::string& reason) {
    {
        std::lock_guard lock(pendingLock_);
        finishedChecks_.emplace_back(outcome, reason);
    }
    wake();
}

int StatusPublisher::onWake(sd_event_source*, int, uint32_t, void* userdata) noexcept {
    auto* publisher = static_cast<StatusPublisher*>(userdata);
    {
        std::lock_guard lock(publisher->pendingLock_);
        publisher->wakeEvent_.consume();
    }
    containExceptions("Announcing the status",
                      [userdata] { static_cast<StatusPublisher*>(userdata)->publish(); });
    return 0;
}

void StatusPublisher::publish() {
    std::vector<std::pair<std::string, std::string>> finished;
    {
        std::lock_guard lock(pendingLock_);
        finished.swap(finishedChecks_);
    }
    stale_ = false;
    if (bus_ == nullptr) {
        return;
    }
    if (TXManager::exists()) {
        plist::Dictionary status = copyDaemonStatus(holdsInstanceLock());
        std::vector<const char*> changed;
        for (const StatusProperty& property : kChangingProperties) {
            if (!announced_ ||
                !sameValue(valueOf(status, property), valueOf(*announced_, property))) {
                changed.push_back(property.name);
            }
        }
        announced_ = std::move(status);
        if (!changed.empty()) {
            changed.push_back(nullptr);
            int r = sd_bus_emit_properties_changed_strv(bus_, path_, kTXStatusInterface,
                                                        const_cast<char**>(changed.data()));
            if (r < 0) {
                logCFormat(LogPriority::Warning, "Cannot announce the changed status: %s\n",
                           std::strerror(-r));
            }
        }
    }
    // After the properties, so that a client woken by the signal reads the check's outcome.
    for (const auto& [outcome, reason] : finished) {
        const std::string sendable = isValidUtf8(reason) ? reason : "";
        int r = sd_bus_emit_signal(bus_, path_, kTXStatusInterface, kUpdateCheckFinishedSignal,
                                   "ss", outcome.c_str(), sendable.c_str());
        if (r < 0) {
            logCFormat(LogPriority::Warning, "Cannot announce the end of an update check: %s\n",
                       std::strerror(-r));
        }
    }
}

const plist::Dictionary& StatusPublisher::statusForCall(sd_bus_message* reply) {
    const char* destination = sd_bus_message_get_destination(reply);
    std::uint64_t cookie = 0;
    sd_bus_message_get_reply_cookie(reply, &cookie);
    std::pair<std::string, std::uint64_t> call(destination != nullptr ? destination : "", cookie);
    // GetAll asks for every property with the same reply: one read answers them all.
    if (cookie == 0 || call != readFor_) {
        readForCall_ = copyDaemonStatus(holdsInstanceLock());
        readFor_ = std::move(call);
        if (!announced_ && !stale_) {
            announced_ = readForCall_;  // what this client now knows needs no announcement
        } else {
            for (const StatusProperty& property : kChangingProperties) {
                if (!sameValue(valueOf(readForCall_, property), valueOf(*announced_, property))) {
                    markStale();  // changed where no one told: announce it from the loop
                    break;
                }
            }
        }
    }
    return readForCall_;
}

int StatusPublisher::getProperty(sd_bus*, const char*, const char*, const char* name,
                                 sd_bus_message* reply, void* /*userdata*/,
                                 sd_bus_error* error) noexcept {
    int result = -ENOMEM;
    containExceptions("Reading a status property", [&] {
        StatusPublisher& publisher = shared();
        const StatusProperty* property = propertyNamed(name);
        if (property == nullptr) {
            result = sd_bus_error_setf(error, SD_BUS_ERROR_UNKNOWN_PROPERTY,
                                       "No status property %s", name);
            return;
        }
        std::uint8_t type = 0;
        sd_bus_message_get_type(reply, &type);
        // A PropertiesChanged carries what publish() compared; a call gets a fresh read.
        const plist::Dictionary& status = type == SD_BUS_MESSAGE_SIGNAL && publisher.announced_
                                              ? *publisher.announced_
                                              : publisher.statusForCall(reply);
        result = appendProperty(reply, *property, valueOf(status, *property));
    });
    return result;
}

const sd_bus_vtable* StatusPublisher::vtable(sd_bus_message_handler_t getStatus) {
    static const std::vector<sd_bus_vtable> table = [getStatus] {
        std::vector<sd_bus_vtable> entries;
        const sd_bus_vtable start = SD_BUS_VTABLE_START(0);
        entries.push_back(start);
        // Anyone may read the status (the bus policy says so); it changes nothing.
        const sd_bus_vtable method =
            SD_BUS_METHOD_WITH_NAMES("GetStatus", "", , "a{sv}", SD_BUS_PARAM(status), getStatus,
                                     SD_BUS_VTABLE_UNPRIVILEGED);
        entries.push_back(method);
        const sd_bus_vtable version =
            SD_BUS_PROPERTY(kDaemonVersionProperty.name, kDaemonVersionProperty.type, getProperty,
                            0, SD_BUS_VTABLE_PROPERTY_CONST);
        entries.push_back(version);
        for (const StatusProperty& property : kChangingProperties) {
            const sd_bus_vtable entry = SD_BUS_PROPERTY(property.name, property.type, getProperty,
                                                        0, SD_BUS_VTABLE_PROPERTY_EMITS_CHANGE);
            entries.push_back(entry);
        }
        const sd_bus_vtable signal = SD_BUS_SIGNAL_WITH_NAMES(
            kUpdateCheckFinishedSignal, "ss", SD_BUS_PARAM(outcome) SD_BUS_PARAM(reason), 0);
        entries.push_back(signal);
        const sd_bus_vtable end = SD_BUS_VTABLE_END;
        entries.push_back(end);
        return entries;
    }();
    return table.data();
}

}  // namespace tavrix
