#include "daemon/TXManagerServer.h"

#include <signal.h>
#include <time.h>

#include <algorithm>
#include <cstdlib>
#include <thread>

#include "daemon/TXManager.h"
#include "daemon/TXTransactionManager.h"
#include "platform/NotificationCenter.h"
#include "platform/ServiceManager.h"
#include "update/UpdateCheckScheduler.h"
#include "util/Log.h"

namespace tavrix {
namespace {

constexpr const char* kMinimumLaunchTransaction = "TXMinimumLaunchTransaction";
constexpr const char* kAddClientTransaction = "TXAddClientTransaction";
constexpr const char* kDaemonStartedNotification = "TXDaemonStartedNotification";

enum ServerLogStyle { kServerLogStyleVerbose = 1, kServerLogStyleQuiet = 2 };

ServerLogStyle serverLogStyle() {
    return kServerLogStyleVerbose;
}

std::thread::id mainThreadId;

// Connection handlers must run where the client list lives.
void assertMainThread(const char* method) {
    if (std::this_thread::get_id() != mainThreadId) {
        logCFormat("Assertion failure in %s, %s:%d: %s\n", method, "daemon/TXManagerServer_Daemon",
                   135, "Must be invoked on the main thread");
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
    static TXManagerServer* server = new TXManagerServer();
    return *server;
}

TXManagerServer::TXManagerServer() : _listener(kTXServiceName, *this) {}

TXManager& TXManagerServer::manager() {
    if (_manager == nullptr) {
        _manager = &TXManager::sharedInstance();
    }
    return *_manager;
}

void TXManagerServer::runUntilIdleExit() {
    mainThreadId = std::this_thread::get_id();
    auto& transactions = TXTransactionManager::sharedInstance();
    auto& serviceManager = platform::ServiceManager::shared();
    transactions.setKeepAliveClearable(false);

    if (serverLogStyle() == kServerLogStyleVerbose) {
        plist::Value state(transactions.isKeepAliveEnabled() ? "ENABLED" : "DISABLED");
        logObjectFormat("Starting the server: keepAlive = %@", &state);
    } else if (serverLogStyle() == kServerLogStyleQuiet) {
        logObjectFormat("Starting the server.");
    }

    sd_event* event = nullptr;
    if (sd_event_default(&event) < 0) {
        logCFormat("Cannot create the main event loop\n");
        return;
    }
    _event.reset(event);

    // SIGTERM and SIGINT finish the run loop like an idle exit; main() blocked them.
    auto onSignal = [](sd_event_source*, const signalfd_siginfo*, void* userdata) -> int {
        static_cast<TXManagerServer*>(userdata)->_finish();
        return 0;
    };
    sd_event_source* source = nullptr;
    if (sd_event_add_signal(event, &source, SIGTERM, onSignal, this) >= 0) {
        _terminateSource.reset(source);
    }
    source = nullptr;
    if (sd_event_add_signal(event, &source, SIGINT, onSignal, this) >= 0) {
        _interruptSource.reset(source);
    }

    _listener.resume(event, kTXServiceObjectPath,
                     {{kTXServiceInterface, managerServerVTable()},
                      {platform::kNotificationInterface, notificationCenterVTable()}},
                     this);
    platform::setNotificationBus(_listener.bus());

    transactions.beginTransaction(kMinimumLaunchTransaction);
    auto endLaunchTransaction = [](sd_event_source*, uint64_t, void*) -> int {
        TXTransactionManager::sharedInstance().endTransaction(kMinimumLaunchTransaction);
        return 0;
    };
    source = nullptr;
    if (sd_event_add_time_relative(event, &source, CLOCK_MONOTONIC, kMinimumLaunchSeconds * 1000000,
                                   0, endLaunchTransaction, nullptr) >= 0) {
        _launchTimer.reset(source);
    }

    logObjectFormat("Notifying observers of start");
    _notifyServerStart();

    transactions.setKeepAliveClearable(true);
    transactions.clearKeepAliveIfNecessary(false);

    UpdateCheckScheduler::sharedInstance();

    serviceManager.notifyReady(transactionStatus(transactions.openTransactions()));
    _run();

    transactions.clearKeepAliveIfNecessary(true);
    platform::setNotificationBus(nullptr);
}

void TXManagerServer::_run() {
    using namespace std::chrono;
    auto& serviceManager = platform::ServiceManager::shared();
    auto& transactions = TXTransactionManager::sharedInstance();
    const auto slice = duration_cast<microseconds>(duration<double>(kRunLoopSliceSeconds));
    std::string lastStatus;
    for (;;) {
        // One "is idle" predicate decides the exit: nothing open, keep-alive clear, and no
        // activity for the grace period.
        microseconds timeout = slice;
        if (!_finishing && serviceManager.isIdle()) {
            auto deadline = serviceManager.lastActivity() + serviceManager.idleGrace();
            auto now = steady_clock::now();
            if (now >= deadline) {
                _finish();
            } else {
                timeout = std::min(
                    slice, duration_cast<microseconds>(deadline - now) + microseconds(1000));
            }
        }
        int r = sd_event_run(_event.get(), static_cast<uint64_t>(timeout.count()));
        if (r < 0 || sd_event_get_state(_event.get()) == SD_EVENT_FINISHED) {
            break;
        }
        std::set<std::string> open = transactions.openTransactions();
        if (r == 0 && !open.empty()) {
            plist::Array names(open.begin(), open.end());
            plist::Value set(std::move(names));
            logObjectFormat("Tavrix daemon continuing to run - transactions: %@", &set);
        }
        std::string status = transactionStatus(open);
        if (status != lastStatus) {
            serviceManager.notifyStatus(status);
            lastStatus = std::move(status);
        }
    }
}

void TXManagerServer::_finish() {
    if (_finishing) {
        return;
    }
    _finishing = true;
    platform::ServiceManager::shared().notifyStopping();
    _listener.releaseNameAndDrain();
    sd_event_exit(_event.get(), 0);
}

void TXManagerServer::_notifyServerStart() {
    platform::postNotification(kDaemonStartedNotification);
}

bool TXManagerServer::shouldAcceptNewConnection(platform::ServiceListener&,
                                                const platform::PeerConnection& connection) {
    auto& transactions = TXTransactionManager::sharedInstance();
    transactions.beginTransaction(kAddClientTransaction);
    addClient(std::make_unique<TXManagerServerClient>(connection.uniqueName, connection.pid,
                                                      connection.commandName));
    transactions.endTransaction(kAddClientTransaction);
    return true;
}

void TXManagerServer::connectionInvalidated(const std::string& uniqueName) {
    assertMainThread("shouldAcceptNewConnection");
    auto it = std::find_if(_clients.begin(), _clients.end(),
                           [&](const auto& client) { return client->connection() == uniqueName; });
    if (it != _clients.end()) {
        removeClient(it->get());
    }
}

void TXManagerServer::addClient(std::unique_ptr<TXManagerServerClient> client) {
    std::optional<plist::Value> identifier;
    if (client->identifier()) {
        identifier.emplace(*client->identifier());
    }
    _clients.push_back(std::move(client));
    logObjectFormat("Added client: %@, count: %u", identifier ? &*identifier : nullptr,
                    static_cast<unsigned>(_clients.size()));
}

void TXManagerServer::removeClient(TXManagerServerClient* client) {
    auto it = std::find_if(_clients.begin(), _clients.end(),
                           [&](const auto& owned) { return owned.get() == client; });
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

std::vector<const TXManagerServerClient*> TXManagerServer::clients() const {
    std::vector<const TXManagerServerClient*> copy;
    for (const auto& client : _clients) {
        copy.push_back(client.get());
    }
    return copy;
}

TXManagerServerClient* TXManagerServer::_clientForCurrentConnection() {
    const std::string& current = _listener.currentConnection();
    if (current.empty()) {
        return nullptr;
    }
    for (const auto& client : _clients) {
        if (client->connection() == current) {
            return client.get();
        }
    }
    return nullptr;
}

void TXManagerServer::setTavrixID(const std::string& tavrixID,
                                  const std::optional<plist::Data>& bundle,
                                  const std::function<void(bool)>& replyHandler) {
    plist::Value id(tavrixID);
    logObjectFormat("Handling Set Tavrix ID with %@", &id);
    reply(replyHandler, manager().setTavrixID(tavrixID, bundle));
}

void TXManagerServer::isTavrixBundleSupported(const std::function<void(bool)>& replyHandler) {
    reply(replyHandler, manager().isTavrixBundleSupported());
}

void TXManagerServer::copyTavrixValue(
    const std::string& key, const std::function<void(std::optional<plist::Value>)>& replyHandler) {
    plist::Value keyValue(key);
    logObjectFormat("Handling Copy Tavrix Value for key %@", &keyValue);
    reply(replyHandler, manager().copyTavrixValue(key));
}

void TXManagerServer::checkForTavrixBundleUpdate(const std::function<void(bool)>& replyHandler) {
    reply(replyHandler, manager().checkForTavrixBundleUpdate());
}

void TXManagerServer::setClientType(std::int32_t /*type: deliberately not kept*/,
                                    const std::function<void(bool)>& result) {
    result(_clientForCurrentConnection() != nullptr);
}

}  // namespace tavrix
