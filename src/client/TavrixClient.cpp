#include "client/TavrixClient.h"

#include <systemd/sd-event.h>

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
    PropertiesHandler propertiesHandler;
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

int onPropertiesChanged(sd_bus_message* message, void* userdata, sd_bus_error* /*error*/) {
    auto* target = static_cast<NotificationSubscription::Target*>(userdata);
    const char* interface = nullptr;
    plist::Dictionary changed;
    if (sd_bus_message_read_basic(message, 's', &interface) <= 0 || interface == nullptr ||
        std::strcmp(interface, kStatusInterface) != 0 ||
        bus::readDictionary(message, changed) < 0) {
        return 0;
    }
    try {
        ++target->deliveries->count;
        target->propertiesHandler(changed);
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

[[noreturn]] void failCall(const char* member, const std::string& reason,
                           ErrorCategory category = ErrorCategory::Failed,
                           const std::string& errorName = {}) {
    throw ClientError(std::string(member) + " failed: " + reason, category, errorName);
}

// Throws unless reply is a normal answer with the expected signature.
void checkReply(const char* member, sd_bus_message* reply, const char* signature) {
    const sd_bus_error* error = sd_bus_message_get_error(reply);
    if (error != nullptr && sd_bus_error_is_set(error)) {
        const std::string name = error->name != nullptr ? error->name : "";
        std::string text = name;
        if (error->message != nullptr && *error->message != '\0') {
            text += std::string(": ") + error->message;
        }
        failCall(member, text, categoryOfError(name, -EIO), name);
    }
    if (sd_bus_message_has_signature(reply, signature) <= 0) {
        const char* actual = sd_bus_message_get_signature(reply, 1);
        failCall(member,
                 std::string("malformed reply: signature \"") + (actual != nullptr ? actual : "") +
                     "\", expected \"" + signature + "\"",
                 ErrorCategory::MalformedReply);
    }
}

bool readBoolean(const char* member, sd_bus_message* reply) {
    int flag = 0;
    int r = sd_bus_message_read_basic(reply, 'b', &flag);
    if (r < 0) {
        failCall(member, "malformed reply: " + errnoText(r), ErrorCategory::MalformedReply);
    }
    return flag != 0;
}

std::optional<plist::Value> readValue(const char* member, sd_bus_message* reply) {
    std::optional<plist::Value> value;
    int r = bus::readOptionalValue(reply, value);
    if (r < 0) {
        failCall(member, "malformed reply: " + errnoText(r), ErrorCategory::MalformedReply);
    }
    return value;
}

plist::Dictionary readDictionaryReply(const char* member, sd_bus_message* reply) {
    plist::Dictionary dictionary;
    int r = bus::readDictionary(reply, dictionary);
    if (r < 0) {
        failCall(member, "malformed reply: " + errnoText(r), ErrorCategory::MalformedReply);
    }
    return dictionary;
}

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
        checkReply(member_, reply.get(), replySignature);
        return reply;
    }

    bool sendForBoolean(sd_bus* bus) const { return readBoolean(member_, send(bus, "b").get()); }

    [[noreturn]] void fail(const std::string& reason,
                           ErrorCategory category = ErrorCategory::Failed,
                           const std::string& errorName = {}) const {
        failCall(member_, reason, category, errorName);
    }

    const char* member() const { return member_; }

  private:
    const char* member_;
    BusMessagePtr message_;
};

// What an asynchronous call's reply goes to; owned by its sd-bus slot.
struct AsyncContext {
    std::function<void(sd_bus_message*)> onReply;
    std::shared_ptr<Deliveries> deliveries;
};

int onAsyncReply(sd_bus_message* reply, void* userdata, sd_bus_error* /*error*/) {
    auto* context = static_cast<AsyncContext*>(userdata);
    try {
        context->onReply(reply);
    } catch (...) {
        if (!context->deliveries->failure) {
            context->deliveries->failure = std::current_exception();
        }
    }
    return 0;
}

}  // namespace

struct PendingCall::Slot {
    bus::BusSlotPtr slot;
};

PendingCall::PendingCall() = default;
PendingCall::PendingCall(PendingCall&&) noexcept = default;
PendingCall& PendingCall::operator=(PendingCall&& other) noexcept {
    if (this != &other) {
        reset();
        slot_ = std::move(other.slot_);
    }
    return *this;
}
PendingCall::~PendingCall() {
    reset();
}
void PendingCall::reset() noexcept {
    slot_.reset();
}

namespace {

// Sends the call; the reply, checked against signature and decoded, or its error goes to
// handler when the connection is processed.
template <typename T, typename Decode>
std::unique_ptr<PendingCall::Slot> startAsync(sd_bus* bus,
                                              const std::shared_ptr<Deliveries>& deliveries,
                                              const Call& call, const char* signature,
                                              Decode decode, AsyncHandler<T> handler) {
    auto context = std::make_unique<AsyncContext>();
    context->deliveries = deliveries;
    context->onReply = [member = call.member(), signature, decode,
                        handler = std::move(handler)](sd_bus_message* reply) {
        AsyncResult<T> result;
        try {
            checkReply(member, reply, signature);
            result.value.emplace(decode(member, reply));
        } catch (const ClientError& error) {
            result.error.emplace(error);
        }
        handler(std::move(result));
    };
    sd_bus_slot* raw = nullptr;
    int r = sd_bus_call_async(bus, &raw, call.message(), onAsyncReply, context.get(),
                              toMicroseconds(kCallTimeout));
    auto slot = std::make_unique<PendingCall::Slot>();
    slot->slot.reset(raw);
    if (r < 0) {
        call.fail("cannot send the call: " + errnoText(r), ErrorCategory::Connection);
    }
    sd_bus_slot_set_destroy_callback(
        raw, [](void* userdata) { delete static_cast<AsyncContext*>(userdata); });
    context.release();  // the slot's now
    return slot;
}

}  // namespace

bool TavrixClient::setTavrixID(const std::string& tavrixID,
                               const std::optional<std::vector<std::uint8_t>>& bundle) {
    Call call(state_->bus.get(), "SetTavrixID");
    call.appendString(tavrixID, "behavior ID");
    call.check(bus::appendOptionalBytes(call.message(), bundle), "cannot encode the bundle");
    return call.sendForBoolean(state_->bus.get());
}

namespace {

PayloadResult readPayloadResult(const char* member, sd_bus_message* reply) {
    int accepted = 0;
    int extracted = 0;
    const char* reason = nullptr;
    int r = sd_bus_message_read(reply, "bbs", &accepted, &extracted, &reason);
    if (r < 0) {
        failCall(member, "malformed reply: " + errnoText(r), ErrorCategory::MalformedReply);
    }
    return {accepted != 0, extracted != 0, reason != nullptr ? reason : ""};
}

}  // namespace

PayloadResult TavrixClient::setTavrixIDWithBundleFile(const std::string& tavrixID, int fd) {
    Call call(state_->bus.get(), "SetTavrixIDWithBundleFD");
    call.appendString(tavrixID, "behavior ID");
    call.check(sd_bus_message_append_basic(call.message(), 'h', &fd), "cannot pass the bundle");
    return readPayloadResult(call.member(), call.send(state_->bus.get(), "bbs").get());
}

PendingCall TavrixClient::setTavrixIDWithBundleFileAsync(const std::string& tavrixID, int fd,
                                                         AsyncHandler<PayloadResult> handler) {
    Call call(state_->bus.get(), "SetTavrixIDWithBundleFD");
    call.appendString(tavrixID, "behavior ID");
    call.check(sd_bus_message_append_basic(call.message(), 'h', &fd), "cannot pass the bundle");
    PendingCall pending;
    pending.slot_ = startAsync<PayloadResult>(state_->bus.get(), state_->deliveries, call, "bbs",
                                              readPayloadResult, std::move(handler));
    return pending;
}

PendingCall TavrixClient::statusAsync(AsyncHandler<plist::Dictionary> handler) {
    Call call(state_->bus.get(), "GetStatus", kStatusInterface);
    PendingCall pending;
    pending.slot_ = startAsync<plist::Dictionary>(state_->bus.get(), state_->deliveries, call,
                                                  "a{sv}", readDictionaryReply, std::move(handler));
    return pending;
}

bool TavrixClient::isTavrixBundleSupported() {
    return Call(state_->bus.get(), "IsTavrixBundleSupported").sendForBoolean(state_->bus.get());
}

std::optional<plist::Value> TavrixClient::copyTavrixValue(const std::string& key) {
    Call call(state_->bus.get(), "CopyTavrixValue");
    call.appendString(key, "key");
    return readValue(call.member(), call.send(state_->bus.get(), "av").get());
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

NotificationSubscription TavrixClient::subscribePropertiesChanged(PropertiesHandler handler) {
    auto target = std::make_unique<NotificationSubscription::Target>();
    target->propertiesHandler = std::move(handler);
    target->deliveries = state_->deliveries;
    const std::string rule = std::string("type='signal',sender='") + kServiceName + "',path='" +
                             kObjectPath +
                             "',interface='org.freedesktop.DBus.Properties',member='"
                             "PropertiesChanged',arg0='" +
                             kStatusInterface + "'";
    sd_bus_slot* raw = nullptr;
    int r =
        sd_bus_add_match(state_->bus.get(), &raw, rule.c_str(), onPropertiesChanged, target.get());
    target->slot.reset(raw);
    if (r < 0) {
        throw ClientError("cannot subscribe to property changes: " + errnoText(r));
    }
    NotificationSubscription subscription;
    subscription.target_ = std::move(target);
    return subscription;
}

PendingCall TavrixClient::setTavrixIDAsync(const std::string& tavrixID,
                                           const std::optional<std::vector<std::uint8_t>>& bundle,
                                           AsyncHandler<bool> handler) {
    Call call(state_->bus.get(), "SetTavrixID");
    call.appendString(tavrixID, "behavior ID");
    call.check(bus::appendOptionalBytes(call.message(), bundle), "cannot encode the bundle");
    PendingCall pending;
    pending.slot_ = startAsync<bool>(state_->bus.get(), state_->deliveries, call, "b", readBoolean,
                                     std::move(handler));
    return pending;
}

PendingCall TavrixClient::isTavrixBundleSupportedAsync(AsyncHandler<bool> handler) {
    Call call(state_->bus.get(), "IsTavrixBundleSupported");
    PendingCall pending;
    pending.slot_ = startAsync<bool>(state_->bus.get(), state_->deliveries, call, "b", readBoolean,
                                     std::move(handler));
    return pending;
}

PendingCall TavrixClient::copyTavrixValueAsync(const std::string& key,
                                               AsyncHandler<std::optional<plist::Value>> handler) {
    Call call(state_->bus.get(), "CopyTavrixValue");
    call.appendString(key, "key");
    PendingCall pending;
    pending.slot_ = startAsync<std::optional<plist::Value>>(
        state_->bus.get(), state_->deliveries, call, "av", readValue, std::move(handler));
    return pending;
}

PendingCall TavrixClient::checkForTavrixBundleUpdateAsync(AsyncHandler<bool> handler) {
    Call call(state_->bus.get(), "CheckForTavrixBundleUpdate");
    PendingCall pending;
    pending.slot_ = startAsync<bool>(state_->bus.get(), state_->deliveries, call, "b", readBoolean,
                                     std::move(handler));
    return pending;
}

PendingCall TavrixClient::setClientTypeAsync(std::int32_t type, AsyncHandler<bool> handler) {
    Call call(state_->bus.get(), "SetClientType");
    call.check(sd_bus_message_append_basic(call.message(), 'i', &type), "cannot encode the type");
    PendingCall pending;
    pending.slot_ = startAsync<bool>(state_->bus.get(), state_->deliveries, call, "b", readBoolean,
                                     std::move(handler));
    return pending;
}

PendingCall TavrixClient::propertiesAsync(AsyncHandler<plist::Dictionary> handler) {
    Call call(state_->bus.get(), "GetAll", "org.freedesktop.DBus.Properties");
    call.appendString(kStatusInterface, "interface");
    PendingCall pending;
    pending.slot_ = startAsync<plist::Dictionary>(state_->bus.get(), state_->deliveries, call,
                                                  "a{sv}", readDictionaryReply, std::move(handler));
    return pending;
}

int TavrixClient::fd() const {
    return sd_bus_get_fd(state_->bus.get());
}

short TavrixClient::events() const {
    const int events = sd_bus_get_events(state_->bus.get());
    return static_cast<short>(events < 0 ? 0 : events);
}

std::optional<std::chrono::microseconds> TavrixClient::timeout() const {
    uint64_t until = 0;
    if (sd_bus_get_timeout(state_->bus.get(), &until) < 0 || until == UINT64_MAX) {
        return std::nullopt;
    }
    // An absolute CLOCK_MONOTONIC time, which is what steady_clock counts on Linux.
    const auto now = std::chrono::duration_cast<std::chrono::microseconds>(
        std::chrono::steady_clock::now().time_since_epoch());
    const auto left = std::chrono::microseconds(static_cast<std::int64_t>(until)) - now;
    return std::max(left, std::chrono::microseconds(0));
}

void TavrixClient::process() {
    while (processOnce(std::chrono::steady_clock::duration::zero())) {
    }
}

void TavrixClient::attach(sd_event* event, int priority) {
    int r = sd_bus_attach_event(state_->bus.get(), event, priority);
    if (r < 0) {
        throw ClientError("cannot attach to the event loop: " + errnoText(r));
    }
}

void TavrixClient::detach() {
    sd_bus_detach_event(state_->bus.get());
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
    return readDictionaryReply(call.member(), call.send(state_->bus.get(), "a{sv}").get());
}

plist::Dictionary TavrixClient::properties() {
    Call call(state_->bus.get(), "GetAll", "org.freedesktop.DBus.Properties");
    call.appendString(kStatusInterface, "interface");
    return readDictionaryReply(call.member(), call.send(state_->bus.get(), "a{sv}").get());
}

}  // namespace tavrix::client
