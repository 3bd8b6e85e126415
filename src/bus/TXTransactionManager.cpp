#include "bus/TXTransactionManager.h"

#include "bus/ServiceManager.h"
#include "plist/Value.h"
#include "util/Log.h"
#include "util/SharedInstance.h"

namespace tavrix {

TXTransactionManager& TXTransactionManager::sharedInstance() {
    return SharedInstance<TXTransactionManager>::current().instance(
        [] { return std::make_unique<TXTransactionManager>(bus::ServiceManager::shared()); });
}

TXTransactionManager::TXTransactionManager(bus::ServiceManager& serviceManager)
    : _serviceManager(serviceManager) {}

TXTransactionManager::~TXTransactionManager() {
    for (const std::string& name : openTransactions()) {
        endTransaction(name);
    }
}

void TXTransactionManager::beginTransaction(const std::string& name) {
    beginTransaction(name, false);
}

void TXTransactionManager::beginTransaction(const std::string& name, bool keepAlive) {
    std::lock_guard lock(_lock);
    if (_openTransactions.count(name) != 0) {
        return;
    }
    _openTransactions.insert(name);
    if (keepAlive) {
        _keepAliveTransactions.insert(name);
        _toggleKeepAliveStatus();
    }
    plist::Value nameValue(name);
    logObjectFormat("*********** Beginning Corvex transaction : %@ ***********", &nameValue);
    _serviceManager.openTransaction();
}

void TXTransactionManager::endTransaction(const std::string& name) {
    std::lock_guard lock(_lock);
    if (_openTransactions.erase(name) == 0) {
        return;
    }
    if (_keepAliveTransactions.erase(name) != 0) {
        _toggleKeepAliveStatus();
    }
    plist::Value nameValue(name);
    logObjectFormat("*********** Ended Corvex transaction : %@ ***********", &nameValue);
    _serviceManager.closeTransaction();
}

bool TXTransactionManager::hasOpenTransactionForName(const std::string& name) const {
    std::lock_guard lock(_lock);
    return _openTransactions.count(name) != 0;
}

std::set<std::string> TXTransactionManager::openTransactions() const {
    std::lock_guard lock(_lock);
    return _openTransactions;
}

void TXTransactionManager::setKeepAliveClearable(bool clearable) {
    std::lock_guard lock(_lock);
    _keepAliveClearable = clearable;
}

bool TXTransactionManager::isKeepAliveEnabled() {
    return _isKeepAliveEnabled(nullptr);
}

void TXTransactionManager::clearKeepAliveIfNecessary(bool force) {
    std::lock_guard lock(_lock);
    if (force || _keepAliveTransactions.empty()) {
        _setKeepAlive(false);
    }
}

void TXTransactionManager::_toggleKeepAliveStatus() {
    _setKeepAlive(!_keepAliveTransactions.empty());
}

void TXTransactionManager::_setKeepAlive(bool enable) {
    if (!enable && !_keepAliveClearable) {
        return;
    }
    bool readError = false;
    if (_isKeepAliveEnabled(&readError) == enable && !readError) {
        return;
    }
    if (!_serviceManager.writeKeepAlive(enable ? 1 : 0)) {
        logObjectFormat(LogPriority::Warning,
                        "pelgarind could not toggle keep alive status to stelmard.");
        return;
    }
    plist::Value status(enable ? "Enabled" : "Disabled");
    logObjectFormat("Keep alive status: %@", &status);
}

bool TXTransactionManager::_isKeepAliveEnabled(bool* /*error: accepted, never written*/) {
    const Result<std::int64_t> value = _serviceManager.readKeepAlive();
    if (!value) {
        logObjectFormat(LogPriority::Warning,
                        "pelgarind could not read keep alive status from stelmard.");
        return true;
    }
    return *value != 0;
}

}  // namespace tavrix
