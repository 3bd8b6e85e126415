#include "daemon/TXManagerServerClient.h"

#include <cstdio>

#include "plist/Value.h"

namespace tavrix {

TXManagerServerClient::TXManagerServerClient(std::string connection, pid_t pid,
                                             bus::BusSlotPtr invalidationWatch)
    : _connection(std::move(connection)),
      _pid(pid),
      _invalidationWatch(std::move(invalidationWatch)) {}

TXManagerServerClient::~TXManagerServerClient() {
    invalidate();
}

void TXManagerServerClient::invalidate() {
    _invalidationWatch.reset();
    _connection.clear();
}

std::string TXManagerServerClient::description() const {
    char address[32];
    std::snprintf(address, sizeof address, "%p", static_cast<const void*>(this));
    plist::Value pid(static_cast<long long>(_pid));
    std::optional<plist::Value> identifier;
    if (_identifier) {
        identifier.emplace(*_identifier);
    }
    return std::string("Client <") + address + ">:\n\t\t\tpid: " + pid.description() +
           "\n\t\t\tbundle ID: " + plist::describe(identifier ? &*identifier : nullptr) + "\n";
}

}  // namespace tavrix
