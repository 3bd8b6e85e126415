// What a client offers the daemon: nothing. The daemon never calls its clients; the interface is
// declared so that a client's proxy has a type, and names only where such a call would go.
#pragma once

#include <string>
#include <utility>

namespace tavrix {

class TXManagerClientInterface {
  public:
    explicit TXManagerClientInterface(std::string destination)
        : _destination(std::move(destination)) {}

    // The peer's unique bus name.
    const std::string& destination() const { return _destination; }

  private:
    std::string _destination;
};

}  // namespace tavrix
