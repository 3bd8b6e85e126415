#include "client/TavrixClient.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <exception>
#include <utility>

#include "bus/BusHandles.h"
#include "bus/BusValueCodec.h"

namespace tavrix::client {

using bus::BusError;
using bus::BusMessagePtr;
using bus::BusPtr;

namespace {

constexpr std::chrono::milliseconds kPredicatePollInterval{100};

std::string errnoText(int negativeErrno) {
    return std::strerror(-negativeErrno);
}

// "name: message" of an error reply, or the errno text when the failure was local.
std::string describeFailure(const BusError& error, int r) {
    if (!error.isSet()) {
        return errnoText(r);
    }
    std::string text = error.name();
    if (*error.message() != '\0') {
        text += ": ";
        text += error.message();
    }
    return text;
}

ErrorCategory categoryOfError(const std::string& name, int r) {
    if (name.empty()) {
        return r == -ETIMEDOUT ? ErrorCategory::Timeout : ErrorCategory::Connection;
    }
    if (name == SD_BUS_ERROR_ACCESS_DENIED) {
        return ErrorCategory::AccessDenied;
    }
    if (name == SD_BUS_ERROR_INVALID_ARGS) {
        return ErrorCategory::InvalidArguments;
    }
    if (name == SD_BUS_ERROR_NO_REPLY || name == SD_BUS_ERROR_TIMEOUT ||
        name == "org.freedesktop.DBus.Error.TimedOut") {
        return ErrorCategory::Timeout;
    }
    if (name == SD_BUS_ERROR_SERVICE_UNKNOWN || name == SD_BUS_ERROR_NAME_HAS_NO_OWNER ||
        name.starts_with("org.freedesktop.DBus.Error.Spawn.")) {
        return ErrorCategory::ServiceUnavailable;
    }
    return ErrorCategory::Failed;
}

uint64_t toMicroseconds(std::chrono::steady_clock::duration duration) {
    auto micros = std::chrono::duration_cast<std::chrono::microseconds>(duration).count();
    return micros > 0 ? static_cast<uint64_t>(micros) : 0;
}

// Notifications delivered so far and a handler's exception waiting to be rethrown; shared by the
// client and its subscriptions, which may outlive one another.
struct Deliveries {
    std::size_t count = 0;
    std::exception_ptr failure;
};

}  // namespace

ClientError::ClientError(const std::string& what, ErrorCategory category,
                         const std::string& errorName)
    : std::runtime_error(what),
      category_(category),
      errorName_(std::make_shared<const std::string>(errorName)) {}

struct NotificationSubscription::Target {
    NotificationHandler handler;
    CheckFinishedHandler checkHandler;
    std::shared_ptr<Deliveries> deliveries;
    // Last, so that it is released before what it points to.
    bus::BusSlotPtr slot;
};

NotificationSubscription::NotificationSubscription() = default;
NotificationSubscription::NotificationSubscription(NotificationSubscription&&) noexcept = default;
NotificationSubscription& NotificationSubscription::operator=(
    NotificationSubscription&& other) noexcept {
    if (this != &other) {
        reset();
        target_ = std::move(other.target_);
    }
    return *this;
}
NotificationSubscription::~NotificationSubscription() {
    reset();
}

void NotificationSubscription::reset() noexcept {
    target_.reset();
}

struct TavrixClient::State {
    BusPtr bus;
    std::shared_ptr<Deliveries> deliveries = std::make_shared<Deliveries>();
};

namespace {

// Runs inside sd_bus_process, a C frame: nothing may be thrown through it.
int onPosted(sd_bus_message* message, void* userdata, sd_bus_error* /*error*/) {
    auto* target = static_cast<NotificationSubscription::Target*>(userdata);
    const char* name = nullptr;
    // Anyone may send a signal that matches; one without a name is no notification.
    if (sd_bus_message_read_basic(message, 's', &name) <= 0 || name == nullptr) {
        return 0;
    }
    try {
        ++target->deliveries->count;
        target->handler(name);
    } catch (...) {
        if (!target->deliveries->failure) {
            target->deliveries->failure = std::current_exception();
        }
    }
    return 0;
}

int onCheckFinished(sd_bus_message* message, void* userdata, sd_bus_error* /*error*/) {
    auto* target = static_cast<NotificationSubscription::Target*>(userdata);
    const char* outcome = nullptr;
    const char* reason = nullptr;
    if (sd_bus_message_read(message, "ss", &outcome, &reason) <= 0) {
        return 0;
    }
    try {
        ++target->deliveries->count;
        target->checkHandler(outcome, reason);
    } catch (...) {
        if (!target->deliveries->failure) {
            target->deliveries->failure = std::current_exception();
        }
    }
    return 0;
}

// Waits until the bus has given the connection its unique name, so that a bus that cannot be
// reached fails here and not at the first call.
void finishConnecting(const BusPtr& bus, const std::string& where) {
    const char* name = nullptr;
    int r = sd_bus_get_unique_name(bus.get(), &name);
    if (r < 0) {
        throw ClientError("cannot connect to " + where + ": " + errnoText(r),
                          ErrorCategory::Connection);
    }
}

}  // namespace

TavrixClient::TavrixClient(std::unique_ptr<State> state) : state_(std::move(state)) {}
TavrixClient::TavrixClient(TavrixClient&&) noexcept = default;
TavrixClient& TavrixClient::operator=(TavrixClient&&) noexcept = default;
TavrixClient::~TavrixClient() = default;

TavrixClient TavrixClient::connectToSystemBus() {
    sd_bus* raw = nullptr;
    int r = sd_bus_open_system(&raw);
    BusPtr bus(raw);
    if (r < 0) {
        throw ClientError("cannot connect to the system bus: " + errnoText(r),
                          ErrorCategory::Connection);
    }
    finishConnecting(bus, "the system bus");
    auto state = std::make_unique<State>();
    state->bus = std::move(bus);
    return TavrixClient(std::move(state));
}

TavrixClient TavrixClient::connectToAddress(const std::string& address) {
    // sd-bus skips what it cannot parse and then reports a refused connection.
    if (address.find(':') == std::string::npos) {
        throw ClientError("cannot connect to " + address +
                          ": not a D-Bus address (such as unix:path=/run/dbus/system_bus_socket)");
    }
    sd_bus* raw = nullptr;
    int r = sd_bus_new(&raw);
    BusPtr bus(raw);
    if (r < 0) {
        throw ClientError("cannot create a bus connection: " + errnoText(r));
    }
    r = sd_bus_set_address(bus.get(), address.c_str());
    if (r >= 0) {
        r = sd_bus_set_bus_client(bus.get(), 1);
    }
    if (r >= 0) {
        r = sd_bus_start(bus.get());
    }
    if (r < 0) {
        throw ClientError("cannot connect to " + address + ": " + errnoText(r),
                          ErrorCategory::Connection);
    }
    finishConnecting(bus, address);
    auto state = std::make_unique<State>();
    state->bus = std::move(bus);
    return TavrixClient(std::move(state));
}

namespace {

// One method call of the server interface: builds the call, sends it and checks the reply.
class Call {
  public:
    Call(sd_bus* bus, const char* member, const char* interface = kServerInterface)
        : member_(member) {
        sd_bus_message* raw = nullptr;
        int r =
            sd_bus_message_new_method_call(bus, &raw, kServiceName, kObjectPath, interface, member);
        message_.reset(raw);
        check(r, "cannot create the call");
    }

    sd_bus_message* message() const { return message_.get(); }

    // Throws when an argument could not be added.
    void check(int r, const char* what) const {
        if (r < 0) {
            fail(std::string(what) + ": " + errnoText(r));
        }
    }

    // D-Bus strings end at the first NUL: refuse one rather than send a shorter text.
    void appendString(const std::string& text, const char* what) const {
        if (text.find('\0') != std::string::npos) {
            fail(std::string(what) + " contains a NUL character");
        }
        check(sd_bus_message_append_basic(message_.get(), 's', text.c_str()),
              (std::string("cannot encode the ") + what).c_str());
    }

    // Sends the call and answers the reply, whose signature must be the expected one.
    BusMessagePtr send(sd_bus* bus, const char* replySignature) const {
        BusError error;
        sd_bus_message* raw = nullptr;
        int r = sd_bus_call(bus, message_.get(), toMicroseconds(kCallTimeout), error.get(), &raw);
        BusMessagePtr reply(raw);
        if (r < 0) {
            fail(describeFailure(error, r), categoryOfError(error.name(), r), error.name());
        }
        if (sd_bus_message_has_signature(reply.get(), replySignature) <= 0) {
            const char* signature = sd_bus_message_get_signature(reply.get(), 1);
            fail(std::string("malformed reply: signature \"") +
                     (signature != nullptr ? signature : "") + "\", expected \"" + replySignature +
                     "\"",
                 ErrorCategory::MalformedReply);
        }
        return reply;
    }

    bool sendForBoolean(sd_bus* bus) const {
        BusMessagePtr reply = send(bus, "b");
        int flag = 0;
        int r = sd_bus_message_read_basic(reply.get(), 'b', &flag);
        if (r < 0) {
            fail("malformed reply: " + errnoText(r), ErrorCategory::MalformedReply);
        }
        return flag != 0;
    }

    [[noreturn]] void fail(const std::string& reason,
                           ErrorCategory category = ErrorCategory::Failed,
                           const std::string& errorName = {}) const {
        throw ClientError(std::string(member_) + " failed: " + reason, category, errorName);
    }

  private:
    const char* member_;
    BusMessagePtr message_;
};

}  // namespace

bool TavrixClient::setTavrixID(const std::string& tavrixID,
                               const std::optional<std::vector<std::uint8_t>>& bundle) {
    Call call(state_->bus.get(), "SetTavrixID");
    call.appendString(tavrixID, "behavior ID");
    call.check(bus::appendOptionalBytes(call.message(), bundle), "cannot encode the bundle");
    return call.sendForBoolean(state_->bus.get());
}

PayloadResult TavrixClient::setTavrixIDWithBundleFile(const std::string& tavrixID, int fd) {
    Call call(state_->bus.get(), "SetTavrixIDWithBundleFD");
    call.appendString(tavrixID, "behavior ID");
    call.check(sd_bus_message_append_basic(call.message(), 'h', &fd), "cannot pass the bundle");
    BusMessagePtr reply = call.send(state_->bus.get(), "bbs");
    int accepted = 0;
    int extracted = 0;
    const char* reason = nullptr;
    int r = sd_bus_message_read(reply.get(), "bbs", &accepted, &extracted, &reason);
    if (r < 0) {
        call.fail("malformed reply: " + errnoText(r));
    }
    return {accepted != 0, extracted != 0, reason != nullptr ? reason : ""};
}

bool TavrixClient::isTavrixBundleSupported() {
    return Call(state_->bus.get(), "IsTavrixBundleSupported").sendForBoolean(state_->bus.get());
}

std::optional<plist::Value> TavrixClient::copyTavrixValue(const std::string& key) {
    Call call(state_->bus.get(), "CopyTavrixValue");
    call.appendString(key, "key");
    BusMessagePtr reply = call.send(state_->bus.get(), "av");
    std::optional<plist::Value> value;
    int r = bus::readOptionalValue(reply.get(), value);
    if (r < 0) {
        call.fail("malformed reply: " + errnoText(r));
    }
    return value;
}

bool TavrixClient::checkForTavrixBundleUpdate() {
    return Call(state_->bus.get(), "CheckForTavrixBundleUpdate").sendForBoolean(state_->bus.get());
}

bool TavrixClient::setClientType(std::int32_t type) {
    Call call(state_->bus.get(), "SetClientType");
    call.check(sd_bus_message_append_basic(call.message(), 'i', &type), "cannot encode the type");
    return call.sendForBoolean(state_->bus.get());
}

NotificationSubscription TavrixClient::subscribe(NotificationHandler handler) {
    auto target = std::make_unique<NotificationSubscription::Target>();
    target->handler = std::move(handler);
    target->deliveries = state_->deliveries;
    // The well-known name as sender: the bus matches it against whoever owns the name when the
    // signal is sent, so every daemon instance is heard and a look-alike from any other peer is
    // not.
    const std::string rule = std::string("type='signal',sender='") + kServiceName +
                             "',interface='" + kNotificationInterface + "',member='" +
                             kNotificationMember + "'";
    sd_bus_slot* raw = nullptr;
    // Synchronous, so that no notification posted after this returns can be missed.
    int r = sd_bus_add_match(state_->bus.get(), &raw, rule.c_str(), onPosted, target.get());
    target->slot.reset(raw);
    if (r < 0) {
        throw ClientError("cannot subscribe to notifications: " + errnoText(r));
    }
    NotificationSubscription subscription;
    subscription.target_ = std::move(target);
    return subscription;
}

NotificationSubscription TavrixClient::subscribeCheckFinished(CheckFinishedHandler handler) {
    auto target = std::make_unique<NotificationSubscription::Target>();
    target->checkHandler = std::move(handler);
    target->deliveries = state_->deliveries;
    const std::string rule = std::string("type='signal',sender='") + kServiceName + "',path='" +
                             kObjectPath + "',interface='" + kStatusInterface +
                             "',member='UpdateCheckFinished'";
    sd_bus_slot* raw = nullptr;
    int r = sd_bus_add_match(state_->bus.get(), &raw, rule.c_str(), onCheckFinished, target.get());
    target->slot.reset(raw);
    if (r < 0) {
        throw ClientError("cannot subscribe to update checks: " + errnoText(r));
    }
    NotificationSubscription subscription;
    subscription.target_ = std::move(target);
    return subscription;
}

bool TavrixClient::processOnce(std::chrono::steady_clock::duration timeout) {
    sd_bus* bus = state_->bus.get();
    int r = sd_bus_process(bus, nullptr);
    if (auto failure = std::exchange(state_->deliveries->failure, nullptr)) {
        std::rethrow_exception(failure);
    }
    if (r < 0) {
        throw ClientError("connection to the bus lost: " + errnoText(r), ErrorCategory::Connection);
    }
    if (r > 0) {
        return true;
    }
    r = sd_bus_wait(bus, toMicroseconds(timeout));
    // A signal interrupting the wait is the caller's business, seen in its next check.
    if (r < 0 && r != -EINTR) {
        throw ClientError("connection to the bus lost: " + errnoText(r), ErrorCategory::Connection);
    }
    return false;
}

bool TavrixClient::processFor(std::chrono::milliseconds duration) {
    const std::size_t before = state_->deliveries->count;
    const auto deadline = std::chrono::steady_clock::now() + duration;
    for (auto now = std::chrono::steady_clock::now(); now < deadline;
         now = std::chrono::steady_clock::now()) {
        processOnce(deadline - now);
    }
    // Whatever is already queued is handled even when the time is up.
    while (processOnce(std::chrono::steady_clock::duration::zero())) {
    }
    return state_->deliveries->count != before;
}

bool TavrixClient::runUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
        if (done()) {
            return true;
        }
        const auto now = std::chrono::steady_clock::now();
        if (now >= deadline) {
            return false;
        }
        processOnce(
            std::min<std::chrono::steady_clock::duration>(deadline - now, kPredicatePollInterval));
    }
}

std::string TavrixClient::uniqueName() const {
    const char* name = nullptr;
    int r = sd_bus_get_unique_name(state_->bus.get(), &name);
    if (r < 0) {
        throw ClientError("cannot read the unique bus name: " + errnoText(r));
    }
    return name;
}

plist::Dictionary TavrixClient::status() {
    Call call(state_->bus.get(), "GetStatus", kStatusInterface);
    BusMessagePtr reply = call.send(state_->bus.get(), "a{sv}");
    plist::Dictionary status;
    int r = bus::readDictionary(reply.get(), status);
    if (r < 0) {
        call.fail("malformed reply: " + errnoText(r));
    }
    return status;
}

plist::Dictionary TavrixClient::properties() {
    Call call(state_->bus.get(), "GetAll", "org.freedesktop.DBus.Properties");
    call.appendString(kStatusInterface, "interface");
    BusMessagePtr reply = call.send(state_->bus.get(), "a{sv}");
    plist::Dictionary properties;
    int r = bus::readDictionary(reply.get(), properties);
    if (r < 0) {
        call.fail("malformed reply: " + errnoText(r));
    }
    return properties;
}

}  // namespace tavrix::client
