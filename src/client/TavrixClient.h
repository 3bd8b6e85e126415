// The client side of tavrixservicesd: synchronous calls of the five operations over D-Bus and
// delivery of the notifications that daemon instances post.
//
// A TavrixClient is one bus connection, used from one thread at a time; a moved-from client may
// only be destroyed or assigned to. Every failure (no bus,
// a daemon that cannot be activated, an error reply, a reply of the wrong shape) throws a
// ClientError whose what() is one line naming the operation and the reason.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

#include "plist/Value.h"

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
