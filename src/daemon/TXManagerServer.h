// The daemon's server: its life from start to idle exit, the clients it accepted, and the five
// operations of the service interface, each answered through a reply handler. Everything here runs
// on the main thread.
//
// Leaving (idle or SIGTERM) loses nothing: the name is released, the calls already queued are
// answered, then the loop keeps running until the work those calls started (every open
// transaction) has ended, within kDrainLimit; only then are the worker threads stopped and
// joined, before anything they use goes away.
//
// Only the holder of the instance lock (ServiceManager) acts. A daemon started while the previous
// one still drains owns the name and answers the read-only calls at once, but keeps the calls that
// change something until the lock is its own (the previous daemon has ended), within
// kLockPatience; its start-up work (the bundle manager's clean-up, the resume of an interrupted
// install, the bundle match, the update check timer) comes after the lock as well.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "bus/BusHandles.h"
#include "bus/ServiceListener.h"
#include "daemon/TXManager.h"
#include "daemon/TXManagerServerClient.h"
#include "plist/Value.h"

namespace tavrix {

namespace bus {
class ServiceManager;
}
class StatusPublisher;
class TXTransactionManager;

inline constexpr const char* kTXServiceName = "com.zandor.tavrixservicesd";
inline constexpr const char* kTXServiceObjectPath = "/com/zandor/tavrixservicesd";
inline constexpr const char* kTXServiceInterface = "com.zandor.TXManagerServerInterface";
// Read-only, beside the service interface: the status view for operators.
inline constexpr const char* kTXStatusInterface = "com.zandor.TXManagerStatusInterface";

class TXManagerServer : private bus::ServiceListener::Delegate {
  public:
    // How long a fresh daemon holds "TXMinimumLaunchTransaction".
    static constexpr std::uint64_t kMinimumLaunchSeconds = 10;
    // The length of one run-loop pass.
    static constexpr double kRunLoopSliceSeconds = 15.0;
    // How long a leaving daemon waits for open transactions; below systemd's stop timeout, so
    // that it leaves on its own terms.
    static constexpr std::chrono::seconds kDrainLimit{60};
    // How long a call that changes something waits for the instance lock before it is answered
    // "no": below the bus's default call timeout, so that the client gets an answer.
    static constexpr std::chrono::seconds kLockPatience{20};
    // How often a daemon waiting for the instance lock tries it again.
    static constexpr std::chrono::milliseconds kLockRetryInterval{50};

    // The daemon root's server, created on first use.
    static TXManagerServer& sharedInstance();

    TXManager& manager();

    // Serves until the daemon leaves; returns the process's exit status when the run loop has
    // finished: 0, or 1 when the daemon could not start serving (logged).
    int runUntilIdleExit();
    // After the loop, on every way out of it, once the root has stopped the worker threads
    // (which post notifications and status): stops announcing, clears the keep-alive flag of a
    // daemon that acted, and gives up the notification connection.
    void endServing();

    // The service interface. A reply handler is called exactly once before the call returns;
    // the first four accept an empty handler.
    void setTavrixID(const std::string& tavrixID, const std::optional<plist::Data>& bundle,
                     const std::function<void(bool)>& replyHandler);
    // setTavrixID with a bundle, also answering what became of the payload.
    void setTavrixIDWithBundle(
        const std::string& tavrixID, const plist::Data& bundle,
        const std::function<void(bool, const PayloadOutcome&)>& replyHandler);
    void isTavrixBundleSupported(const std::function<void(bool)>& replyHandler);
    void copyTavrixValue(const std::string& key,
                         const std::function<void(std::optional<plist::Value>)>& replyHandler);
    void checkForTavrixBundleUpdate(const std::function<void(bool)>& replyHandler);
    // Answers whether the calling connection is an accepted client; the type is not kept.
    void setClientType(std::int32_t type, const std::function<void(bool)>& result);
    // The status view (TXManagerStatus.h), answered at once.
    void getStatus(const std::function<void(plist::Dictionary)>& replyHandler);

    void addClient(std::shared_ptr<TXManagerServerClient> client);
    void removeClient(const std::shared_ptr<TXManagerServerClient>& client);
    // A copy of the client list; the copy keeps its clients alive.
    std::vector<std::shared_ptr<const TXManagerServerClient>> clients() const;

    bus::ServiceListener& listener() { return _listener; }
    bus::ServiceManager& serviceManager() { return _serviceManager; }
    StatusPublisher& status() { return _status; }

    // True once this process holds the instance lock and may act on bundles.
    bool holdsInstanceLock() const { return _holdsInstanceLock; }
    // Keeps a call that changes something until the instance lock is held, then runs handler on
    // it again; answers it with refuse (its "no" reply) when the lock has not come within
    // kLockPatience or the daemon leaves first. Returns what a method handler returns.
    int deferUntilLocked(sd_bus_message* message, sd_bus_message_handler_t handler,
                         int (*refuse)(sd_bus_message*));

  private:
    // What the server serves with, all of them made before it and ended after it.
    TXManagerServer(TXTransactionManager& transactions, bus::ServiceManager& serviceManager,
                    StatusPublisher& status);

    // Listener delegate.
    bool shouldAcceptNewConnection(bus::ServiceListener& listener,
                                   const bus::PeerConnection& connection) override;
    bool isAcceptedConnection(const std::string& uniqueName) const override;
    void connectionInvalidated(const std::string& uniqueName) override;

    std::shared_ptr<TXManagerServerClient> _clientForConnection(
        const std::string& uniqueName) const;
    std::shared_ptr<TXManagerServerClient> _clientForCurrentConnection() const;
    // Event loop, signal sources, listener and launch timer; false (logged) when any fails.
    bool _startServing();
    void _run();
    void _notifyServerStart();
    // Tries the instance lock again every kLockRetryInterval; answers kept calls whose patience
    // ran out.
    bool _armLockRetry();
    static int _onLockRetry(sd_event_source* source, uint64_t usec, void* userdata);
    // What a daemon does once it holds the instance lock, then the calls kept until then.
    void _startActing();
    // Answers kept calls "no": those kept since before cutoff.
    void _refuseDeferredCalls(std::chrono::steady_clock::time_point cutoff);
    // Releases the name and answers what is queued; _run then waits for open transactions.
    void _finish();

    TXTransactionManager& _transactions;
    bus::ServiceManager& _serviceManager;
    StatusPublisher& _status;
    TXManager* _manager = nullptr;
    std::vector<std::shared_ptr<TXManagerServerClient>> _clients;
    bus::ServiceListener _listener;
    bus::EventPtr _event;
    bus::EventSourcePtr _launchTimer;
    bus::EventSourcePtr _terminateSource;
    bus::EventSourcePtr _interruptSource;
    bus::EventSourcePtr _wakeSource;
    bus::BusSlotPtr _disconnectFilter;
    bus::EventSourcePtr _lockRetryTimer;
    struct DeferredCall {
        bus::BusMessagePtr message;
        sd_bus_message_handler_t handler;
        int (*refuse)(sd_bus_message*);
        std::chrono::steady_clock::time_point since;
    };
    std::vector<DeferredCall> _deferredCalls;
    bool _holdsInstanceLock = false;
    // The thread of the run loop, where the client list lives.
    std::thread::id _mainThread;
    bool _finishing = false;
    std::chrono::steady_clock::time_point _drainDeadline;
};

// The exported interface's method table (TXManagerServer_Daemon.cpp).
const sd_bus_vtable* managerServerVTable();
// The notification interface's table: its one signal, so that introspection shows it.
const sd_bus_vtable* notificationCenterVTable();
// The status interface's table: GetStatus, the properties and the check signal.
const sd_bus_vtable* statusVTable();

}  // namespace tavrix
