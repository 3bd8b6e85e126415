#include "daemon/TXManagerServer.h"

#include <signal.h>
#include <sys/epoll.h>
#include <time.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <thread>

#include "bus/NotificationCenter.h"
#include "bus/ServiceManager.h"
#include "bus/TXTransactionManager.h"
#include "catalog/AssetCatalogService.h"
#include "daemon/StatusProperties.h"
#include "daemon/TXManager.h"
#include "daemon/TXManagerStatus.h"
#include "daemon/UpdateCheckScheduler.h"
#include "device/TXUtility.h"
#include "util/ContainExceptions.h"
#include "util/Log.h"
#include "util/SharedInstance.h"

namespace tavrix {
namespace {

constexpr const char* kMinimumLaunchTransaction = "TXMinimumLaunchTransaction";
constexpr const char* kAddClientTransaction = "TXAddClientTransaction";
constexpr const char* kDaemonStartedNotification = "TXDaemonStartedNotification";

enum ServerLogStyle { kServerLogStyleVerbose = 1, kServerLogStyleQuiet = 2 };

ServerLogStyle serverLogStyle() {
    return kServerLogStyleVerbose;
}

// Connection handlers must run where the client list lives.
void assertMainThread(std::thread::id mainThread, const char* method) {
    if (std::this_thread::get_id() != mainThread) {
        logCFormat(LogPriority::Warning, "Assertion failure in %s, %s:%d: %s\n", method,
                   "daemon/TXManagerServer_Daemon", 135, "Must be invoked on the main thread");
        std::abort();
    }
}

template <typename Handler, typename... Arguments>
void reply(const Handler& handler, Arguments&&... arguments) {
    if (handler) {
        handler(std::forward<Arguments>(arguments)...);
    }
}

std::string transactionStatus(const std::set<std::string>& open) {
    std::string status = "Serving; open transactions: " + std::to_string(open.size());
    for (const std::string& name : open) {
        status += " " + name;
    }
    return status;
}

}  // namespace

TXManagerServer& TXManagerServer::sharedInstance() {
    return SharedInstance<TXManagerServer>::current().instance([] {
        return std::unique_ptr<TXManagerServer>(
            new TXManagerServer(TXTransactionManager::sharedInstance(),
                                bus::ServiceManager::shared(), StatusPublisher::shared()));
    });
}

TXManagerServer::TXManagerServer(TXTransactionManager& transactions,
                                 bus::ServiceManager& serviceManager, StatusPublisher& status)
    : _transactions(transactions),
      _serviceManager(serviceManager),
      _status(status),
      _listener(kTXServiceName, *this) {}

TXManager& TXManagerServer::manager() {
    if (_manager == nullptr) {
        _manager = &TXManager::sharedInstance();
    }
    return *_manager;
}

int TXManagerServer::runUntilIdleExit() {
    _mainThread = std::this_thread::get_id();
    _transactions.setKeepAliveClearable(false);

    if (serverLogStyle() == kServerLogStyleVerbose) {
        plist::Value state(_transactions.isKeepAliveEnabled() ? "ENABLED" : "DISABLED");
        logObjectFormat("Starting the server: keepAlive = %@", &state);
    } else if (serverLogStyle() == kServerLogStyleQuiet) {
        logObjectFormat("Starting the server.");
    }

    // Before the name: a daemon that could never hold the lock must not serve at all.
    const auto lock = _serviceManager.tryLockInstance();
    if (lock == bus::ServiceManager::InstanceLock::Unusable) {
        return 1;
    }
    // A daemon that cannot serve leaves with a failure, so that the service manager's restart
    // policy and the caller see it.
    if (!_startServing()) {
        return 1;
    }
    bus::setNotificationBus(_listener.bus());

    if (lock == bus::ServiceManager::InstanceLock::Held) {
        _startActing();
        _serviceManager.notifyReady(transactionStatus(_transactions.openTransactions()));
    } else {
        // The previous daemon is still finishing its work: serve, and act once it has ended.
        logCFormat("Another daemon is still finishing its work; waiting for it to end\n");
        if (!_armLockRetry()) {
            return 1;
        }
        _serviceManager.notifyReady("Waiting for the previous daemon to end");
    }
    _run();
    return 0;
}

void TXManagerServer::endServing() {
    _status.detach();
    if (_holdsInstanceLock) {
        _transactions.clearKeepAliveIfNecessary(true);
    }
    bus::setNotificationBus(nullptr);
}

void TXManagerServer::_startActing() {
    _holdsInstanceLock = true;
    _lockRetryTimer.reset();

    logObjectFormat("Notifying observers of start");
    _notifyServerStart();

    _transactions.setKeepAliveClearable(true);
    _transactions.clearKeepAliveIfNecessary(false);

    UpdateCheckScheduler::sharedInstance();

    // In arrival order, as if they had just come.
    std::vector<DeferredCall> deferred = std::move(_deferredCalls);
    _deferredCalls.clear();
    for (DeferredCall& call : deferred) {
        containExceptions("A kept call", [&] {
            sd_bus_message* message = call.message.get();
            sd_bus_error error = SD_BUS_ERROR_NULL;
            int r = sd_bus_message_rewind(message, 1);
            if (r >= 0) {
                r = call.handler(message, this, &error);
            }
            if (r < 0 || sd_bus_error_is_set(&error)) {
                if (sd_bus_error_is_set(&error)) {
                    sd_bus_reply_method_error(message, &error);
                } else {
                    sd_bus_reply_method_errno(message, r, nullptr);
                }
            }
            sd_bus_error_free(&error);
        });
    }
}

bool TXManagerServer::_armLockRetry() {
    sd_event_source* timer = nullptr;
    const int r = sd_event_add_time_relative(
        _event.get(), &timer, CLOCK_MONOTONIC,
        std::chrono::duration_cast<std::chrono::microseconds>(kLockRetryInterval).count(), 0,
        &TXManagerServer::_onLockRetry, this);
    _lockRetryTimer.reset(timer);
    if (r < 0) {
        logCFormat(LogPriority::Warning, "Cannot set up the instance lock timer: %s\n",
                   std::strerror(-r));
        return false;
    }
    return true;
}

int TXManagerServer::_onLockRetry(sd_event_source* source, uint64_t, void* userdata) {
    auto& server = *static_cast<TXManagerServer*>(userdata);
    containExceptions("Waiting for the instance lock", [&] {
        if (server._serviceManager.tryLockInstance() == bus::ServiceManager::InstanceLock::Held) {
            logCFormat("The previous daemon has ended; acting\n");
            server._startActing();
            server._serviceManager.notifyStatus("Serving");
            return;
        }
        server._refuseDeferredCalls(std::chrono::steady_clock::now() - kLockPatience);
        uint64_t now = 0;
        sd_event_now(sd_event_source_get_event(source), CLOCK_MONOTONIC, &now);
        sd_event_source_set_time(
            source,
            now +
                std::chrono::duration_cast<std::chrono::microseconds>(kLockRetryInterval).count());
        sd_event_source_set_enabled(source, SD_EVENT_ONESHOT);
    });
    return 0;
}

int TXManagerServer::deferUntilLocked(sd_bus_message* message, sd_bus_message_handler_t handler,
                                      int (*refuse)(sd_bus_message*)) {
    if (_finishing) {
        refuse(message);
        return 1;
    }
    _deferredCalls.push_back(DeferredCall{bus::BusMessagePtr(sd_bus_message_ref(message)), handler,
                                          refuse, std::chrono::steady_clock::now()});
    return 1;
}

void TXManagerServer::_refuseDeferredCalls(std::chrono::steady_clock::time_point cutoff) {
    auto firstKept = std::partition(_deferredCalls.begin(), _deferredCalls.end(),
                                    [&](const DeferredCall& call) { return call.since < cutoff; });
    std::vector<DeferredCall> refused(std::make_move_iterator(_deferredCalls.begin()),
                                      std::make_move_iterator(firstKept));
    _deferredCalls.erase(_deferredCalls.begin(), firstKept);
    for (DeferredCall& call : refused) {
        logCFormat("A call waited too long for the previous daemon to end; answering no\n");
        call.refuse(call.message.get());
    }
}

bool TXManagerServer::_startServing() {
    sd_event* event = nullptr;
    if (sd_event_default(&event) < 0) {
        logCFormat(LogPriority::Warning, "Cannot create the main event loop\n");
        return false;
    }
    _event.reset(event);

    // SIGTERM and SIGINT finish the run loop like an idle exit; main() blocked them.
    auto onSignal = [](sd_event_source*, const signalfd_siginfo*, void* userdata) -> int {
        containExceptions("Leaving on a signal",
                          [userdata] { static_cast<TXManagerServer*>(userdata)->_finish(); });
        return 0;
    };
    // Transactions closed on other threads wake the loop, so that it looks at idleness again.
    // A transaction that closed ended some work, which may have changed the status.
    auto onWake = [](sd_event_source*, int, uint32_t, void* userdata) -> int {
        containExceptions("Looking at idleness again", [userdata] {
            auto& server = *static_cast<TXManagerServer*>(userdata);
            server._serviceManager.consumeWake();
            server._status.markStale();
        });
        return 0;
    };
    sd_event_source* terminate = nullptr;
    sd_event_source* interrupt = nullptr;
    int r = sd_event_add_signal(event, &terminate, SIGTERM, onSignal, this);
    _terminateSource.reset(terminate);
    if (r >= 0) {
        r = sd_event_add_signal(event, &interrupt, SIGINT, onSignal, this);
        _interruptSource.reset(interrupt);
    }
    const int wakeFd = _serviceManager.wakeFd();
    if (r >= 0 && wakeFd >= 0) {
        sd_event_source* wake = nullptr;
        r = sd_event_add_io(event, &wake, wakeFd, EPOLLIN, onWake, this);
        _wakeSource.reset(wake);
    }
    if (r < 0) {
        logCFormat(LogPriority::Warning, "Cannot set up the main event loop: %s\n",
                   std::strerror(-r));
        return false;
    }

    if (!_listener.resume(event, kTXServiceObjectPath,
                          {{kTXServiceInterface, managerServerVTable()},
                           {kTXStatusInterface, statusVTable()},
                           {bus::kNotificationInterface, notificationCenterVTable()}},
                          this)) {
        return false;
    }
    // A bus that goes away (its daemon restarted or killed) brings no more calls: leave as on
    // SIGTERM, finishing the work under way, rather than idle until the grace runs out.
    auto onMessage = [](sd_bus_message* message, void* userdata, sd_bus_error*) -> int {
        if (sd_bus_message_is_signal(message, "org.freedesktop.DBus.Local", "Disconnected") > 0) {
            containExceptions("Leaving without a bus", [userdata] {
                logCFormat("The bus connection is gone; leaving\n");
                static_cast<TXManagerServer*>(userdata)->_finish();
            });
        }
        return 0;
    };
    sd_bus_slot* disconnect = nullptr;
    if (sd_bus_add_filter(_listener.bus(), &disconnect, onMessage, this) >= 0) {
        _disconnectFilter.reset(disconnect);
    }
    // Without announcements the properties still answer; that is no reason not to serve.
    _status.attach(event, _listener.bus(), kTXServiceObjectPath,
                   [this] { return _holdsInstanceLock; });

    _transactions.beginTransaction(kMinimumLaunchTransaction);
    auto endLaunchTransaction = [](sd_event_source*, uint64_t, void* self) -> int {
        containExceptions("Ending the launch transaction", [self] {
            static_cast<TXManagerServer*>(self)->_transactions.endTransaction(
                kMinimumLaunchTransaction);
        });
        return 0;
    };
    sd_event_source* launch = nullptr;
    r = sd_event_add_time_relative(event, &launch, CLOCK_MONOTONIC, kMinimumLaunchSeconds * 1000000,
                                   0, endLaunchTransaction, this);
    _launchTimer.reset(launch);
    if (r < 0) {
        logCFormat(LogPriority::Warning, "Cannot set up the launch timer: %s\n", std::strerror(-r));
        return false;
    }
    return true;
}

void TXManagerServer::_run() {
    using namespace std::chrono;
    const auto slice = duration_cast<microseconds>(duration<double>(kRunLoopSliceSeconds));
    std::string lastStatus;
    // A pass lasts its whole slice whatever it handles; each event only wakes the loop within it.
    auto passEnd = steady_clock::now() + slice;
    for (;;) {
        const auto now = steady_clock::now();
        microseconds timeout =
            std::max(microseconds(0), duration_cast<microseconds>(passEnd - now));
        if (_finishing) {
            // Work started by an answered call (a download, an install) ends before the process.
            const int open = _serviceManager.openTransactionCount();
            if (open == 0) {
                break;
            }
            if (now >= _drainDeadline) {
                logCFormat("Leaving with %d transactions still open after waiting %lld s\n", open,
                           static_cast<long long>(kDrainLimit.count()));
                break;
            }
            timeout = std::min(
                timeout, duration_cast<microseconds>(_drainDeadline - now) + microseconds(1000));
        } else if (_holdsInstanceLock && _serviceManager.isIdle()) {
            // (A daemon waiting for the lock stays: the previous one is about to end.)
            // Nothing open, keep-alive clear, and no activity (a call included) for the grace.
            const auto deadline = _serviceManager.lastActivity() + _serviceManager.idleGrace();
            if (now >= deadline) {
                _finish();
                continue;  // look again: the calls answered while leaving may have started work
            }
            timeout =
                std::min(timeout, duration_cast<microseconds>(deadline - now) + microseconds(1000));
        }
        int r = sd_event_run(_event.get(), static_cast<uint64_t>(timeout.count()));
        if (r < 0) {
            logCFormat(LogPriority::Warning, "The main event loop failed: %s\n", std::strerror(-r));
            break;
        }
        std::set<std::string> open = _transactions.openTransactions();
        if (steady_clock::now() >= passEnd) {
            passEnd = steady_clock::now() + slice;
            if (!open.empty()) {
                plist::Array names(open.begin(), open.end());
                plist::Value set(std::move(names));
                logObjectFormat("Tavrix daemon continuing to run - transactions: %@", &set);
            }
        }
        std::string status = transactionStatus(open);
        if (status != lastStatus) {
            _serviceManager.notifyStatus(status);
            lastStatus = std::move(status);
        }
    }
}

void TXManagerServer::_finish() {
    if (_finishing) {
        return;
    }
    _finishing = true;
    _drainDeadline = std::chrono::steady_clock::now() + kDrainLimit;
    _serviceManager.notifyStopping();
    // The launch transaction only guards a fresh daemon against idleness; leaving on a signal
    // does not wait for it.
    _launchTimer.reset();
    _transactions.endTransaction(kMinimumLaunchTransaction);
    // While the name is still ours: subscribers match on it.
    _status.publish();
    _listener.releaseNameAndDrain();
    // Leaving without ever holding the lock: the kept calls get their "no" now.
    _lockRetryTimer.reset();
    _refuseDeferredCalls(std::chrono::steady_clock::time_point::max());
}

void TXManagerServer::_notifyServerStart() {
    bus::postNotification(kDaemonStartedNotification);
}

bool TXManagerServer::shouldAcceptNewConnection(bus::ServiceListener& listener,
                                                const bus::PeerConnection& connection) {
    _transactions.beginTransaction(kAddClientTransaction);
    addClient(std::make_shared<TXManagerServerClient>(
        connection.uniqueName, connection.pid, listener.watchConnection(connection.uniqueName)));
    _transactions.endTransaction(kAddClientTransaction);
    return true;
}

bool TXManagerServer::isAcceptedConnection(const std::string& uniqueName) const {
    return _clientForConnection(uniqueName) != nullptr;
}

void TXManagerServer::connectionInvalidated(const std::string& uniqueName) {
    assertMainThread(_mainThread, "shouldAcceptNewConnection");
    if (auto client = _clientForConnection(uniqueName)) {
        removeClient(client);
    }
}

void TXManagerServer::addClient(std::shared_ptr<TXManagerServerClient> client) {
    std::optional<plist::Value> identifier;
    if (client->identifier()) {
        identifier.emplace(*client->identifier());
    }
    _clients.push_back(std::move(client));
    logObjectFormat("Added client: %@, count: %u", identifier ? &*identifier : nullptr,
                    static_cast<unsigned>(_clients.size()));
}

void TXManagerServer::removeClient(const std::shared_ptr<TXManagerServerClient>& client) {
    auto it = std::find(_clients.begin(), _clients.end(), client);
    if (it == _clients.end()) {
        return;
    }
    client->invalidate();
    std::optional<plist::Value> identifier;
    if (client->identifier()) {
        identifier.emplace(*client->identifier());
    }
    _clients.erase(it);
    logObjectFormat("Removed client: %@, count: %u", identifier ? &*identifier : nullptr,
                    static_cast<unsigned>(_clients.size()));
}

std::vector<std::shared_ptr<const TXManagerServerClient>> TXManagerServer::clients() const {
    return {_clients.begin(), _clients.end()};
}

std::shared_ptr<TXManagerServerClient> TXManagerServer::_clientForConnection(
    const std::string& uniqueName) const {
    if (uniqueName.empty()) {
        return nullptr;
    }
    for (const auto& client : _clients) {
        if (client->connection() == uniqueName) {
            return client;
        }
    }
    return nullptr;
}

std::shared_ptr<TXManagerServerClient> TXManagerServer::_clientForCurrentConnection() const {
    return _clientForConnection(_listener.currentConnection());
}

void TXManagerServer::setTavrixID(const std::string& tavrixID,
                                  const std::optional<plist::Data>& bundle,
                                  const std::function<void(bool)>& replyHandler) {
    plist::Value id(tavrixID);
    logObjectFormat("Handling Set Tavrix ID with %@", &id);
    reply(replyHandler, manager().setTavrixID(tavrixID, bundle));
}

void TXManagerServer::setTavrixIDWithBundle(
    const std::string& tavrixID, const plist::Data& bundle,
    const std::function<void(bool, const PayloadOutcome&)>& replyHandler) {
    plist::Value id(tavrixID);
    logObjectFormat("Handling Set Tavrix ID with %@", &id);
    PayloadOutcome payload;
    const bool accepted = manager().setTavrixID(tavrixID, bundle, &payload);
    reply(replyHandler, accepted, payload);
}

void TXManagerServer::isTavrixBundleSupported(const std::function<void(bool)>& replyHandler) {
    // The first call of a daemon that holds the lock does the start-up work (TXManager's creation);
    // one that waits for the lock answers from the preferences alone.
    reply(replyHandler, _holdsInstanceLock ? manager().isTavrixBundleSupported()
                                           : TXManager::isTavrixBundleSupported());
}

void TXManagerServer::copyTavrixValue(
    const std::string& key, const std::function<void(std::optional<plist::Value>)>& replyHandler) {
    plist::Value keyValue(key);
    logObjectFormat("Handling Copy Tavrix Value for key %@", &keyValue);
    reply(replyHandler,
          _holdsInstanceLock ? manager().copyTavrixValue(key) : TXManager::copyTavrixValue(key));
}

void TXManagerServer::checkForTavrixBundleUpdate(const std::function<void(bool)>& replyHandler) {
    reply(replyHandler, manager().checkForTavrixBundleUpdate());
}

void TXManagerServer::setClientType(std::int32_t /*type: deliberately not kept*/,
                                    const std::function<void(bool)>& result) {
    result(_clientForCurrentConnection() != nullptr);
}

void TXManagerServer::getStatus(const std::function<void(plist::Dictionary)>& replyHandler) {
    reply(replyHandler, copyDaemonStatus(_holdsInstanceLock));
}

}  // namespace tavrix
