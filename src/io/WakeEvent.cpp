#include "io/WakeEvent.h"

#include <sys/eventfd.h>

#include <cstdint>

namespace tavrix::io {

WakeEvent WakeEvent::create() {
    WakeEvent event;
    event.fd_.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    return event;
}

void WakeEvent::raise() const noexcept {
    if (fd_) {
        const std::uint64_t one = 1;
        [[maybe_unused]] const ssize_t written = ::write(fd_.get(), &one, sizeof one);
    }
}

void WakeEvent::consume() const noexcept {
    if (fd_) {
        std::uint64_t count = 0;
        [[maybe_unused]] const ssize_t got = ::read(fd_.get(), &count, sizeof count);
    }
}

}  // namespace tavrix::io
