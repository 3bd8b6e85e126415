// The client side of tavrixservicesd: the five operations over D-Bus, synchronous or
// asynchronous, the status view and its properties, and delivery of what the daemon announces
// (notifications, property changes, the end of update checks).
//
// Include it as <tavrix/client/TavrixClient.h> (pkg-config --cflags tavrixclient); it needs C++20.
//
// Threads: a TavrixClient is not thread-safe. Use each one from one thread at a time; clients on
// different threads are independent. Handlers and asynchronous replies run on the thread that
// calls processFor, runUntil or process (or in the sd-event loop the client is attached to),
// never on a thread of the library's own. A moved-from client may only be destroyed or assigned
// to.
//
// Event loops: attach(sd_event*) lets an sd-event loop drive the client; for any other loop
// (GLib, poll), watch fd() for events() until timeout(), then call process().
//
// Errors: every failure (no bus, a daemon that cannot be activated, an error reply, a reply of
// the wrong shape) is a ClientError whose what() is one line naming the operation and the reason,
// with a category() to switch on and the D-Bus errorName() when the daemon or the bus answered.
// Synchronous calls throw it; asynchronous ones hand it to their reply handler.
#pragma once

#if __cplusplus < 202002L
#error "<tavrix/client/TavrixClient.h> needs C++20: compile with -std=c++20 or later"
#endif

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

#include "../plist/Value.h"

// sd-event's loop, for attach(); declared here so that the header needs no systemd headers.
struct sd_event;

namespace tavrix::client {

inline constexpr const char* kServiceName = "com.zandor.tavrixservicesd";
inline constexpr const char* kObjectPath = "/com/zandor/tavrixservicesd";
inline constexpr const char* kServerInterface = "com.zandor.TXManagerServerInterface";
inline constexpr const char* kStatusInterface = "com.zandor.TXManagerStatusInterface";
inline constexpr const char* kNotificationInterface = "com.zandor.NotificationCenter";
inline constexpr const char* kNotificationMember = "Posted";

// Long enough for the bus to activate the daemon and for it to install a bundle.
inline constexpr std::chrono::seconds kCallTimeout{60};

// What kind of failure a ClientError is, for a program to act on.
enum class ErrorCategory {
    Failed,              // the daemon answered with an error of its own, or anything else
    Connection,          // no bus, or the connection to it was lost
    AccessDenied,        // the bus policy refused the call (setting the ID, starting a check)
    ServiceUnavailable,  // the daemon could not be started or reached
    InvalidArguments,    // the daemon refused an argument (a bundle descriptor it cannot take)
    Timeout,             // no answer in time
    MalformedReply,      // an answer of the wrong shape
};

class ClientError : public std::runtime_error {
  public:
    explicit ClientError(const std::string& what, ErrorCategory category = ErrorCategory::Failed,
                         const std::string& errorName = {});

    ErrorCategory category() const noexcept { return category_; }
    // The D-Bus error name ("org.freedesktop.DBus.Error.AccessDenied"), or "" when the failure
    // happened here.
    const std::string& errorName() const noexcept { return *errorName_; }

  private:
    ErrorCategory category_;
    // Shared, so that copying the exception cannot throw.
    std::shared_ptr<const std::string> errorName_;
};

using NotificationHandler = std::function<void(const std::string& name)>;
// The end of an update check: its outcome ("installed", "up-to-date", "catalog-refused", ...) and
// one-line reason.
using CheckFinishedHandler =
    std::function<void(const std::string& outcome, const std::string& reason)>;

// What became of a behavior ID set with a bundle.
struct PayloadResult {
    bool accepted = false;   // false only on a device with a cellular radio
    bool extracted = false;  // the bundle was unpacked into the user bundle
    std::string reason;      // "extracted N bytes into the user bundle", or why not
};

// Keeps a notification handler registered; destroying (or resetting) it unsubscribes.
class NotificationSubscription {
  public:
    // The handler, where deliveries are counted, and the bus registration that points to them.
    struct Target;

    NotificationSubscription();
    NotificationSubscription(NotificationSubscription&&) noexcept;
    NotificationSubscription& operator=(NotificationSubscription&&) noexcept;
    NotificationSubscription(const NotificationSubscription&) = delete;
    NotificationSubscription& operator=(const NotificationSubscription&) = delete;
    ~NotificationSubscription();

    bool active() const { return target_ != nullptr; }
    void reset() noexcept;

  private:
    friend class TavrixClient;

    std::unique_ptr<Target> target_;
};

// The answer of an asynchronous call: a value, or the error that took its place.
template <typename T>
struct AsyncResult {
    std::optional<T> value;
    std::optional<ClientError> error;
    explicit operator bool() const { return value.has_value(); }
};
template <typename T>
using AsyncHandler = std::function<void(AsyncResult<T>)>;

// An asynchronous call in flight; destroying (or resetting) it before the reply cancels the
// call's handler. Keep it until the handler has run.
class PendingCall {
  public:
    struct Slot;

    PendingCall();
    PendingCall(PendingCall&&) noexcept;
    PendingCall& operator=(PendingCall&&) noexcept;
    PendingCall(const PendingCall&) = delete;
    PendingCall& operator=(const PendingCall&) = delete;
    ~PendingCall();

    void reset() noexcept;

  private:
    friend class TavrixClient;
    std::unique_ptr<Slot> slot_;
};

// Changed status properties by name (values as properties() gives them).
using PropertiesHandler = std::function<void(const plist::Dictionary& changed)>;

class TavrixClient {
  public:
    // The system bus ($DBUS_SYSTEM_BUS_ADDRESS when set).
    static TavrixClient connectToSystemBus();
    // The message bus at a D-Bus address such as "unix:path=/run/test/bus".
    static TavrixClient connectToAddress(const std::string& address);

    TavrixClient(TavrixClient&&) noexcept;
    TavrixClient& operator=(TavrixClient&&) noexcept;
    TavrixClient(const TavrixClient&) = delete;
    TavrixClient& operator=(const TavrixClient&) = delete;
    ~TavrixClient();

    // Sets the behavior ID with an optional packed bundle; false when the daemon refused.
    bool setTavrixID(const std::string& tavrixID,
                     const std::optional<std::vector<std::uint8_t>>& bundle);
    // Sets the behavior ID with the packed bundle the daemon reads from fd: a regular file (read
    // whole from its start) or a pipe whose writer has written everything and closed it. The
    // descriptor stays the caller's. A descriptor the daemon refuses throws, and nothing is set.
    PayloadResult setTavrixIDWithBundleFile(const std::string& tavrixID, int fd);
    bool isTavrixBundleSupported();
    // The behavior setting for key, or nothing when there is none.
    std::optional<plist::Value> copyTavrixValue(const std::string& key);
    // True when an update check was started.
    bool checkForTavrixBundleUpdate();
    // True when the daemon knows this connection as a client.
    bool setClientType(std::int32_t type);

    // Calls handler with the name of every notification that the daemon (any instance of it, and
    // nobody else: the bus checks the sender) posts from now on, while the subscription lives.
    // Handlers run inside processFor and runUntil; an exception a handler throws comes out of
    // those.
    NotificationSubscription subscribe(NotificationHandler handler);
    // Calls handler at the end of every update check from now on (the daemon's
    // UpdateCheckFinished), while the subscription lives; delivered as notifications are.
    NotificationSubscription subscribeCheckFinished(CheckFinishedHandler handler);

    // Calls handler with the status properties that changed, with their new values, every time
    // the daemon announces a change (PropertiesChanged), while the subscription lives.
    NotificationSubscription subscribePropertiesChanged(PropertiesHandler handler);

    // The asynchronous forms: each sends its call and returns at once; handler runs with the
    // answer or the error when the reply has been processed (see Event loops above).
    PendingCall setTavrixIDAsync(const std::string& tavrixID,
                                 const std::optional<std::vector<std::uint8_t>>& bundle,
                                 AsyncHandler<bool> handler);
    PendingCall isTavrixBundleSupportedAsync(AsyncHandler<bool> handler);
    PendingCall copyTavrixValueAsync(const std::string& key,
                                     AsyncHandler<std::optional<plist::Value>> handler);
    PendingCall checkForTavrixBundleUpdateAsync(AsyncHandler<bool> handler);
    PendingCall setClientTypeAsync(std::int32_t type, AsyncHandler<bool> handler);
    PendingCall setTavrixIDWithBundleFileAsync(const std::string& tavrixID, int fd,
                                               AsyncHandler<PayloadResult> handler);
    PendingCall statusAsync(AsyncHandler<plist::Dictionary> handler);
    PendingCall propertiesAsync(AsyncHandler<plist::Dictionary> handler);

    // For an application's own loop: the connection's descriptor, the poll events to wait for
    // on it, and how long at most to wait (nothing: no limit); then process() handles what is
    // ready, running handlers, and rethrows the first exception a handler threw.
    int fd() const;
    short events() const;
    std::optional<std::chrono::microseconds> timeout() const;
    void process();
    // Lets an sd-event loop drive the connection at the given priority until detach() or the
    // client's end. An exception a handler throws there is kept for the next process(),
    // processFor or runUntil to throw.
    void attach(sd_event* event, int priority = 0);
    void detach();

    // Handles incoming messages for the given time; true when a notification was delivered.
    bool processFor(std::chrono::milliseconds duration);
    // Handles incoming messages until done() holds (true) or the timeout passes (false). done()
    // is checked after every message and at least every 100 ms, so that a flag set from a signal
    // handler is seen promptly.
    bool runUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout);

    // This connection's unique name on the bus.
    std::string uniqueName() const;

  private:
    struct State;
    explicit TavrixClient(std::unique_ptr<State> state);

    // Handles one message or waits up to timeout for one; answers whether one was delivered.
    bool processOnce(std::chrono::steady_clock::duration timeout);

    std::unique_ptr<State> state_;

  public:
    // The daemon's status view (see docs/dbus-api.md for its keys).
    plist::Dictionary status();
    // The status properties by name, as the bus carries them: text, booleans, and times as
    // unsigned integers of microseconds since 1970 (0 for none).
    plist::Dictionary properties();
};

}  // namespace tavrix::client
