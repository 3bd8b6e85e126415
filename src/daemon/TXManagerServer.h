// The daemon's server: its life from start to idle exit, the clients it accepted, and the five
// operations of the service interface, each answered through a reply handler. Everything here runs
// on the main thread.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "daemon/TXManagerServerClient.h"
#include "platform/BusHandles.h"
#include "platform/ServiceListener.h"
#include "plist/Value.h"

namespace tavrix {

class TXManager;

inline constexpr const char* kTXServiceName = "com.zandor.tavrixservicesd";
inline constexpr const char* kTXServiceObjectPath = "/com/zandor/tavrixservicesd";
inline constexpr const char* kTXServiceInterface = "com.zandor.TXManagerServerInterface";

class TXManagerServer : private platform::ServiceListener::Delegate {
  public:
    // How long a fresh daemon holds "TXMinimumLaunchTransaction".
    static constexpr std::uint64_t kMinimumLaunchSeconds = 10;
    // The length of one run-loop pass.
    static constexpr double kRunLoopSliceSeconds = 15.0;

    // The process's server, created on first use and never destroyed.
    static TXManagerServer& sharedInstance();

    TXManager& manager();

    // The whole life of the daemon; returns when the run loop has finished.
    void runUntilIdleExit();

    // The service interface. A reply handler is called exactly once before the call returns;
    // the first four accept an empty handler.
    void setTavrixID(const std::string& tavrixID, const std::optional<plist::Data>& bundle,
                     const std::function<void(bool)>& replyHandler);
    void isTavrixBundleSupported(const std::function<void(bool)>& replyHandler);
    void copyTavrixValue(const std::string& key,
                         const std::function<void(std::optional<plist::Value>)>& replyHandler);
    void checkForTavrixBundleUpdate(const std::function<void(bool)>& replyHandler);
    // Answers whether the calling connection is an accepted client; the type is not kept.
    void setClientType(std::int32_t type, const std::function<void(bool)>& result);

    void addClient(std::unique_ptr<TXManagerServerClient> client);
    void removeClient(TXManagerServerClient* client);
    std::vector<const TXManagerServerClient*> clients() const;

    platform::ServiceListener& listener() { return _listener; }

  private:
    TXManagerServer();

    // Listener delegate.
    bool shouldAcceptNewConnection(platform::ServiceListener& listener,
                                   const platform::PeerConnection& connection) override;
    void connectionInvalidated(const std::string& uniqueName) override;

    TXManagerServerClient* _clientForCurrentConnection();
    void _run();
    void _notifyServerStart();
    // Releases the name, answers what is queued and finishes the run loop.
    void _finish();

    TXManager* _manager = nullptr;
    std::vector<std::unique_ptr<TXManagerServerClient>> _clients;
    platform::ServiceListener _listener;
    platform::EventPtr _event;
    platform::EventSourcePtr _launchTimer;
    platform::EventSourcePtr _terminateSource;
    platform::EventSourcePtr _interruptSource;
    bool _finishing = false;
};

// The exported interface's method table (TXManagerServer_Daemon.cpp).
const sd_bus_vtable* managerServerVTable();
// The notification interface's table: its one signal, so that introspection shows it.
const sd_bus_vtable* notificationCenterVTable();

}  // namespace tavrix
