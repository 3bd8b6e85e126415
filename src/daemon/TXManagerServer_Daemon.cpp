// The service interface on the bus: each handler reads its arguments and checks them, makes the
// sender the current connection (accepting it on its first call), calls the server's operation
// and replies. Calls with a wrong signature never get here: sd-bus answers them with InvalidArgs.
// One wrapper, handled<>, stands around every handler: whatever is thrown below it is logged and
// the call gets its "no" answer (NO, no value, or an error), and the daemon goes on serving.
#include <systemd/sd-bus.h>

#include <cerrno>
#include <cstring>
#include <optional>

#include "bus/BusValueCodec.h"
#include "bus/HandedPayload.h"
#include "bus/NotificationCenter.h"
#include "bus/ServiceManager.h"
#include "daemon/StatusProperties.h"
#include "daemon/TXManagerServer.h"
#include "util/ContainExceptions.h"
#include "util/Log.h"
#include "util/Utf8.h"

namespace tavrix {
namespace {

// The sender is the current connection for as long as its message is handled. A call is activity:
// the idle grace counts from the end of the last one.
class MessageScope {
  public:
    MessageScope(TXManagerServer& server, sd_bus_message* message)
        : listener_(server.listener()), serviceManager_(server.serviceManager()) {
        serviceManager_.noteActivity();
        try {
            listener_.beginMessage(message);
        } catch (...) {
            listener_.endMessage();
            throw;
        }
    }
    ~MessageScope() {
        listener_.endMessage();
        serviceManager_.noteActivity();
    }
    MessageScope(const MessageScope&) = delete;
    MessageScope& operator=(const MessageScope&) = delete;

  private:
    bus::ServiceListener& listener_;
    bus::ServiceManager& serviceManager_;
};

// An argument the bus library could not read. For text that is invalid UTF-8 or holds a Unicode
// noncharacter (which D-Bus allows but the library refuses to read): the caller learns which.
int invalidArgument(sd_bus_error* error, int r, const char* argument) {
    if (r == -EBADMSG) {
        return sd_bus_error_setf(error, SD_BUS_ERROR_INVALID_ARGS,
                                 "The %s is not text this service can read: invalid UTF-8 or a "
                                 "Unicode noncharacter",
                                 argument);
    }
    return sd_bus_error_set_errnof(error, r < 0 ? -r : EINVAL, "Malformed arguments");
}

int replyBoolean(sd_bus_message* message, bool answer) {
    return sd_bus_reply_method_return(message, "b", answer ? 1 : 0);
}

// The "no" answer of each kind of call, for a call that failed or waited too long.
int refuseBoolean(sd_bus_message* message) {
    return replyBoolean(message, false);
}
int refuseBundleFD(sd_bus_message* message) {
    return sd_bus_reply_method_return(message, "bbs", 0, 0, "the request failed");
}
int refuseValue(sd_bus_message* message);
int refuseStatus(sd_bus_message* message) {
    return sd_bus_reply_method_errorf(message, SD_BUS_ERROR_FAILED, "The status could not be read");
}

// What a call needs before it may run: nothing (it only reads), or this daemon holding the
// instance lock (it may change bundles, which the previous daemon may still be doing).
enum class Needs { Nothing, InstanceLock };

// The one wrapper around every handler: an exception must not unwind through sd-bus. One thrown
// while the call was handled is logged with the method's name, the call gets its "no" answer,
// and the status properties are looked at again, as the call may have changed what they show.
template <int (*Handler)(sd_bus_message*, void*, sd_bus_error*), int (*Refuse)(sd_bus_message*),
          Needs Requirement = Needs::Nothing>
int handled(sd_bus_message* message, void* userdata, sd_bus_error* error) noexcept {
    int result = 0;
    const char* method = sd_bus_message_get_member(message);
    if (!containExceptions(method != nullptr ? method : "A call", [&] {
            auto& server = *static_cast<TXManagerServer*>(userdata);
            if (Requirement == Needs::InstanceLock && !server.holdsInstanceLock()) {
                result =
                    server.deferUntilLocked(message, handled<Handler, Refuse, Requirement>, Refuse);
            } else {
                result = Handler(message, userdata, error);
            }
        })) {
        containExceptions("A refusal", [&] {
            static_cast<TXManagerServer*>(userdata)->status().markStale();
            result = Refuse(message);
        });
    }
    return result;
}

int handleSetTavrixID(sd_bus_message* message, void* userdata, sd_bus_error* error) {
    auto& server = *static_cast<TXManagerServer*>(userdata);
    const char* tavrixID = nullptr;
    std::optional<std::vector<std::uint8_t>> bundle;
    if (int r = sd_bus_message_read(message, "s", &tavrixID); r < 0) {
        return invalidArgument(error, r, "behavior ID");
    }
    if (bus::readOptionalBytes(message, bundle) < 0) {
        return sd_bus_error_set(error, SD_BUS_ERROR_INVALID_ARGS,
                                "The bundle must be an array of at most one byte array");
    }
    bool answer = false;
    {
        MessageScope scope(server, message);
        server.setTavrixID(tavrixID, bundle, [&](bool accepted) { answer = accepted; });
    }
    server.status().markStale();
    return replyBoolean(message, answer);
}

// The bundle as a descriptor: read here into the bytes SetTavrixID would carry, so that both go
// the same way from there. A descriptor that cannot be read that way is refused before anything
// is stored.
int handleSetTavrixIDWithBundleFD(sd_bus_message* message, void* userdata, sd_bus_error* error) {
    auto& server = *static_cast<TXManagerServer*>(userdata);
    const char* tavrixID = nullptr;
    int fd = -1;
    int r = sd_bus_message_read(message, "sh", &tavrixID, &fd);
    if (r < 0) {
        return invalidArgument(error, r, "behavior ID");
    }
    Result<plist::Data> bundle = bus::readHandedPayload(fd, bus::kMaxHandedPayloadBytes);
    if (!bundle) {
        return sd_bus_error_setf(error, SD_BUS_ERROR_INVALID_ARGS, "Bundle refused: %s",
                                 bundle.reason().c_str());
    }
    bool accepted = false;
    PayloadOutcome payload{false, "the request failed"};
    {
        MessageScope scope(server, message);
        server.setTavrixIDWithBundle(tavrixID, *bundle,
                                     [&](bool wasAccepted, const PayloadOutcome& outcome) {
                                         accepted = wasAccepted;
                                         payload = outcome;
                                     });
    }
    server.status().markStale();
    // An archive's error may quote a member's name, which may be any bytes.
    const char* reason = isValidUtf8(payload.reason) ? payload.reason.c_str() : "(not UTF-8)";
    return sd_bus_reply_method_return(message, "bbs", accepted ? 1 : 0, payload.extracted ? 1 : 0,
                                      reason);
}

int handleIsTavrixBundleSupported(sd_bus_message* message, void* userdata, sd_bus_error*) {
    auto& server = *static_cast<TXManagerServer*>(userdata);
    bool answer = false;
    {
        MessageScope scope(server, message);
        server.isTavrixBundleSupported([&](bool supported) { answer = supported; });
    }
    return replyBoolean(message, answer);
}

bus::BusMessagePtr valueReply(sd_bus_message* call, const std::optional<plist::Value>& value) {
    sd_bus_message* raw = nullptr;
    if (sd_bus_message_new_method_return(call, &raw) < 0) {
        return nullptr;
    }
    bus::BusMessagePtr reply(raw);
    return bus::appendOptionalValue(reply.get(), value) < 0 ? nullptr : std::move(reply);
}

int handleCopyTavrixValue(sd_bus_message* message, void* userdata, sd_bus_error* error) {
    auto& server = *static_cast<TXManagerServer*>(userdata);
    const char* key = nullptr;
    int r = sd_bus_message_read(message, "s", &key);
    if (r < 0) {
        return invalidArgument(error, r, "key");
    }
    std::optional<plist::Value> answer;
    {
        MessageScope scope(server, message);
        server.copyTavrixValue(
            key, [&](std::optional<plist::Value> value) { answer = std::move(value); });
    }
    bus::BusMessagePtr replyMessage = valueReply(message, answer);
    if (!replyMessage && answer) {
        // A setting the bus cannot carry (too deep, or text that is not UTF-8) is answered as no
        // value: every well-formed call gets a normal reply.
        logCFormat(LogPriority::Warning,
                   "The value for key %s cannot be sent over the bus; answering no value\n", key);
        return refuseValue(message);
    }
    if (!replyMessage) {
        return -ENOMEM;
    }
    return sd_bus_send(nullptr, replyMessage.get(), nullptr);
}

int refuseValue(sd_bus_message* message) {
    bus::BusMessagePtr replyMessage = valueReply(message, std::nullopt);
    return replyMessage ? sd_bus_send(nullptr, replyMessage.get(), nullptr) : -ENOMEM;
}

int handleCheckForTavrixBundleUpdate(sd_bus_message* message, void* userdata, sd_bus_error*) {
    auto& server = *static_cast<TXManagerServer*>(userdata);
    bool answer = false;
    {
        MessageScope scope(server, message);
        server.checkForTavrixBundleUpdate([&](bool started) { answer = started; });
    }
    server.status().markStale();
    return replyBoolean(message, answer);
}

int handleSetClientType(sd_bus_message* message, void* userdata, sd_bus_error* error) {
    auto& server = *static_cast<TXManagerServer*>(userdata);
    std::int32_t type = 0;
    int r = sd_bus_message_read(message, "i", &type);
    if (r < 0) {
        return invalidArgument(error, r, "client type");
    }
    bool answer = false;
    {
        MessageScope scope(server, message);
        server.setClientType(type, [&](bool known) { answer = known; });
    }
    return replyBoolean(message, answer);
}

int handleGetStatus(sd_bus_message* message, void* userdata, sd_bus_error* error) {
    auto& server = *static_cast<TXManagerServer*>(userdata);
    plist::Dictionary status;
    {
        MessageScope scope(server, message);
        server.getStatus([&](plist::Dictionary answer) { status = std::move(answer); });
    }
    sd_bus_message* raw = nullptr;
    int r = sd_bus_message_new_method_return(message, &raw);
    bus::BusMessagePtr replyMessage(raw);
    if (r >= 0) {
        r = bus::appendDictionary(replyMessage.get(), status);
    }
    if (r < 0) {
        // A value the bus cannot carry (text that is not UTF-8 in a path).
        logCFormat(LogPriority::Warning, "The status cannot be sent over the bus: %s\n",
                   std::strerror(-r));
        return sd_bus_error_setf(error, SD_BUS_ERROR_FAILED,
                                 "The status cannot be sent over the bus: %s", std::strerror(-r));
    }
    return sd_bus_send(nullptr, replyMessage.get(), nullptr);
}

// Each method as the bus calls it: its handler inside the one wrapper, with its "no" answer and
// what it needs before it runs.
constexpr sd_bus_message_handler_t kSetTavrixID =
    handled<handleSetTavrixID, refuseBoolean, Needs::InstanceLock>;
constexpr sd_bus_message_handler_t kSetTavrixIDWithBundleFD =
    handled<handleSetTavrixIDWithBundleFD, refuseBundleFD, Needs::InstanceLock>;
constexpr sd_bus_message_handler_t kIsTavrixBundleSupported =
    handled<handleIsTavrixBundleSupported, refuseBoolean>;
constexpr sd_bus_message_handler_t kCopyTavrixValue = handled<handleCopyTavrixValue, refuseValue>;
constexpr sd_bus_message_handler_t kCheckForTavrixBundleUpdate =
    handled<handleCheckForTavrixBundleUpdate, refuseBoolean, Needs::InstanceLock>;
constexpr sd_bus_message_handler_t kSetClientType = handled<handleSetClientType, refuseBoolean>;
constexpr sd_bus_message_handler_t kGetStatus = handled<handleGetStatus, refuseStatus>;

const sd_bus_vtable kManagerServerVTable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES("SetTavrixID", "saay", SD_BUS_PARAM(tavrixID) SD_BUS_PARAM(bundle),
                             "b", SD_BUS_PARAM(accepted), kSetTavrixID, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("SetTavrixIDWithBundleFD", "sh",
                             SD_BUS_PARAM(tavrixID) SD_BUS_PARAM(bundle), "bbs",
                             SD_BUS_PARAM(accepted) SD_BUS_PARAM(extracted) SD_BUS_PARAM(reason),
                             kSetTavrixIDWithBundleFD, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("IsTavrixBundleSupported", "", , "b", SD_BUS_PARAM(supported),
                             kIsTavrixBundleSupported, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("CopyTavrixValue", "s", SD_BUS_PARAM(key), "av", SD_BUS_PARAM(value),
                             kCopyTavrixValue, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("CheckForTavrixBundleUpdate", "", , "b", SD_BUS_PARAM(started),
                             kCheckForTavrixBundleUpdate, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("SetClientType", "i", SD_BUS_PARAM(type), "b", SD_BUS_PARAM(known),
                             kSetClientType, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

const sd_bus_vtable kNotificationCenterVTable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_SIGNAL_WITH_NAMES("Posted", "s", SD_BUS_PARAM(name), 0),
    SD_BUS_VTABLE_END,
};

}  // namespace

const sd_bus_vtable* managerServerVTable() {
    return kManagerServerVTable;
}
const sd_bus_vtable* notificationCenterVTable() {
    return kNotificationCenterVTable;
}
const sd_bus_vtable* statusVTable() {
    return StatusPublisher::vtable(kGetStatus);
}

}  // namespace tavrix
