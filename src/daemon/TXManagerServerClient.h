// One accepted client: a peer on the bus, known by its unique connection name, from its first call
// until it leaves the bus.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "bus/BusHandles.h"

namespace tavrix {

class TXManagerServerClient {
  public:
    // connection: the peer's unique bus name; pid and identifier (its command name) come from the
    // peer's credentials and may be unknown. invalidationWatch is what reports the peer leaving
    // the bus; it is dropped with the connection.
    TXManagerServerClient(std::string connection, pid_t pid, std::optional<std::string> identifier,
                          bus::BusSlotPtr invalidationWatch = nullptr);
    ~TXManagerServerClient();
    TXManagerServerClient(const TXManagerServerClient&) = delete;
    TXManagerServerClient& operator=(const TXManagerServerClient&) = delete;

    // The unique bus name, empty once invalidated.
    const std::string& connection() const { return _connection; }
    const std::optional<std::string>& identifier() const { return _identifier; }
    pid_t pid() const { return _pid; }

    // Forgets the connection and stops watching it. Safe to call twice.
    void invalidate();

    std::string description() const;

  private:
    std::string _connection;
    std::optional<std::string> _identifier;
    pid_t _pid;
    bus::BusSlotPtr _invalidationWatch;
};

}  // namespace tavrix
