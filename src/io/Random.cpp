#include "io/Random.h"

#include <sys/random.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <ctime>

namespace tavrix::io {

bool fillRandom(void* bytes, std::size_t size) {
    auto* at = static_cast<unsigned char*>(bytes);
    std::size_t filled = 0;
    while (filled < size) {
        ssize_t got = ::getrandom(at + filled, size - filled, 0);
        if (got > 0) {
            filled += static_cast<std::size_t>(got);
        } else if (errno != EINTR) {
            return false;
        }
    }
    return true;
}

std::string uniqueHexSuffix() {
    std::uint64_t bits = 0;
    if (!fillRandom(&bits, sizeof bits)) {
        static std::atomic<std::uint64_t> counter{0};
        bits = (static_cast<std::uint64_t>(::getpid()) << 32) ^ ++counter ^
               static_cast<std::uint64_t>(::time(nullptr));
    }
    char text[17];
    std::snprintf(text, sizeof text, "%016llx", static_cast<unsigned long long>(bits));
    return text;
}

}  // namespace tavrix::io
