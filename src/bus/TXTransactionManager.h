// Named transactions: the same piece of work is never counted twice, and some names hold the
// service manager's keep-alive flag while they are open. One lock guards both sets; the public
// calls may come from any thread.
#pragma once

#include <mutex>
#include <set>
#include <string>

namespace tavrix {

namespace bus {
class ServiceManager;
}

class TXTransactionManager {
  public:
    // The daemon root's transaction manager, created on first use; it lives as long as the root.
    static TXTransactionManager& sharedInstance();

    // Each open name is one open transaction of serviceManager, which also keeps the flag.
    explicit TXTransactionManager(bus::ServiceManager& serviceManager);
    // Ends every name still open, so that each service-manager transaction is closed.
    ~TXTransactionManager();
    TXTransactionManager(const TXTransactionManager&) = delete;
    TXTransactionManager& operator=(const TXTransactionManager&) = delete;

    void beginTransaction(const std::string& name);
    // A name already open is left as it is, even when keep-alive is asked the second time.
    void beginTransaction(const std::string& name, bool keepAlive);
    // Ending a name that is not open does nothing.
    void endTransaction(const std::string& name);
    bool hasOpenTransactionForName(const std::string& name) const;
    std::set<std::string> openTransactions() const;

    // While not clearable, the keep-alive flag can be set but never cleared.
    void setKeepAliveClearable(bool clearable);
    bool isKeepAliveEnabled();
    // Clears the flag; without force only when no keep-alive transaction is open.
    void clearKeepAliveIfNecessary(bool force);

  private:
    void _toggleKeepAliveStatus();
    void _setKeepAlive(bool enable);
    // A flag that cannot be read counts as enabled, erring towards staying alive.
    bool _isKeepAliveEnabled(bool* error);

    bus::ServiceManager& _serviceManager;
    std::set<std::string> _openTransactions;
    std::set<std::string> _keepAliveTransactions;
    bool _keepAliveClearable = true;
    mutable std::mutex _lock;
};

}  // namespace tavrix
