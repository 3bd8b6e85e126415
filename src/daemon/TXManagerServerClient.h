// One accepted client: a peer on the bus, known by its unique connection name, from its first call
// until it leaves the bus.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "bus/BusHandles.h"
#include "daemon/TXManagerClientInterface.h"

namespace tavrix {

class TXManagerServerClient {
  public:
    // connection: the peer's unique bus name; pid comes from the peer's credentials and may be
    // unknown. invalidationWatch is what reports the peer leaving the bus; it is dropped with the
    // connection.
    TXManagerServerClient(std::string connection, pid_t pid,
                          bus::BusSlotPtr invalidationWatch = nullptr);
    ~TXManagerServerClient();
    TXManagerServerClient(const TXManagerServerClient&) = delete;
    TXManagerServerClient& operator=(const TXManagerServerClient&) = delete;

    // The unique bus name, empty once invalidated.
    const std::string& connection() const { return _connection; }
    const std::optional<std::string>& identifier() const { return _identifier; }
    pid_t pid() const { return _pid; }
    TXManagerClientInterface proxy() const { return TXManagerClientInterface(_connection); }

    // Forgets the connection and stops watching it. Safe to call twice.
    void invalidate();

    std::string description() const;

  private:
    std::string _connection;
    // A bundle identifier vouched for by the platform; the bus has none to give, and anything the
    // peer could name itself (its command name) would let it choose text for the log. Stays empty.
    std::optional<std::string> _identifier;
    pid_t _pid;
    bus::BusSlotPtr _invalidationWatch;
};

}  // namespace tavrix
