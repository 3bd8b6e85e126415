// A wake-up another thread raises for a loop that polls its descriptor (an eventfd). Raising never
// blocks; the loop consumes every wake-up raised so far at once.
#pragma once

#include "io/UniqueFd.h"

namespace tavrix::io {

class WakeEvent {
  public:
    // No descriptor: raising and consuming do nothing.
    WakeEvent() = default;
    // A new descriptor; none (errno set) when the kernel refuses one.
    static WakeEvent create();

    explicit operator bool() const { return static_cast<bool>(fd_); }
    int fd() const { return fd_.get(); }
    // A full counter already wakes the loop, so a raise that cannot be added loses nothing.
    void raise() const noexcept;
    void consume() const noexcept;

  private:
    UniqueFd fd_;
};

}  // namespace tavrix::io
