// Builds a D-Bus message from fuzz bytes the way a client could (any tree of basic types, arrays,
// structures, dictionary entries and variants, sized at will), seals it and decodes it as the
// daemon reads client arguments. Whatever decodes as a value must encode and decode again to the
// same value.
#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "FuzzSupport.h"
#include "bus/BusHandles.h"
#include "bus/BusValueCodec.h"

namespace {

using tavrix::bus::BusMessagePtr;
using tavrix::fuzz::require;

// Messages need a started bus object, not a bus: one over a socket pair will do, as nothing is
// ever sent.
sd_bus* messageFactory() {
    static sd_bus* bus = [] {
        int fds[2];
        sd_bus* made = nullptr;
        require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == 0 &&
                sd_bus_new(&made) >= 0 && sd_bus_set_fd(made, fds[0], fds[0]) >= 0 &&
                sd_bus_start(made) >= 0);
        return made;  // lives for the whole run, with fds[1] keeping the pair open
    }();
    return bus;
}

struct Input {
    const std::uint8_t* data;
    std::size_t size;
    std::uint8_t byte() { return size > 0 ? (--size, *data++) : 0; }
};

// A complete type: a basic code, 'a' (one member), 'r' or 'e' (structure or dictionary entry), or
// 'v'. Entries with a key that is no basic type, or outside an array, are near misses sd-bus
// refuses.
struct Type {
    char code;
    std::vector<Type> members;

    std::string contents() const {
        std::string inner;
        for (const Type& member : members) {
            inner += member.signature();
        }
        return inner;
    }
    std::string signature() const {
        return code == 'r'   ? "(" + contents() + ")"
               : code == 'e' ? "{" + contents() + "}"
                             : code + contents();
    }
};

// The end of the input draws strings, so that every tree ends.
Type drawType(Input& in, int depth) {
    static constexpr char kCodes[] = "svvvaaaassxtdbynqiuogre";
    Type type{kCodes[in.byte() % (sizeof kCodes - 1)], {}};
    if (depth > 6 && (type.code == 'a' || type.code == 'r' || type.code == 'e')) {
        type.code = 'v';
    }
    const int members = type.code == 'a'   ? 1
                        : type.code == 'e' ? 2
                        : type.code == 'r' ? in.byte() % 3
                                           : 0;
    for (int i = 0; i < members; ++i) {
        type.members.push_back(drawType(in, depth + 1));
    }
    return type;
}

// Appends one value of type; false once sd-bus refuses (as it does past its nesting limit).
bool fill(Input& in, sd_bus_message* m, const Type& type) {
    switch (type.code) {
        case 'v': {
            Type inner = drawType(in, 0);
            return sd_bus_message_open_container(m, 'v', inner.signature().c_str()) >= 0 &&
                   fill(in, m, inner) && sd_bus_message_close_container(m) >= 0;
        }
        case 'a':
        case 'r':
        case 'e': {
            if (sd_bus_message_open_container(m, type.code, type.contents().c_str()) < 0) {
                return false;
            }
            for (int round = type.code == 'a' ? in.byte() % 4 : 1; round > 0; --round) {
                for (const Type& member : type.members) {
                    if (!fill(in, m, member)) {
                        return false;
                    }
                }
            }
            return sd_bus_message_close_container(m) >= 0;
        }
        case 's': {
            std::string text;
            for (int length = in.byte() % 17; length > 0; --length) {
                text += static_cast<char>(in.byte());
            }
            return sd_bus_message_append_basic(m, 's', text.c_str()) >= 0;  // up to a NUL
        }
        case 'o':
            return sd_bus_message_append_basic(m, 'o', "/a/b") >= 0;
        case 'g':
            return sd_bus_message_append_basic(m, 'g', "a{sv}") >= 0;
        default: {
            std::uint64_t bits = 0;
            for (int i = 0; i < 8; ++i) {
                bits = bits << 8 | in.byte();
            }
            int flag = static_cast<int>(bits % 2);
            return sd_bus_message_append_basic(
                       m, type.code, type.code == 'b' ? static_cast<void*>(&flag) : &bits) >= 0;
        }
    }
}

BusMessagePtr newMessage() {
    sd_bus_message* raw = nullptr;
    require(sd_bus_message_new_method_call(messageFactory(), &raw, nullptr, "/fuzz", "fuzz.Codec",
                                           "Carry") >= 0);
    return BusMessagePtr(raw);
}

bool seal(sd_bus_message* message) {
    static std::uint64_t cookie = 0;
    return sd_bus_message_seal(message, ++cookie, 0) >= 0 && sd_bus_message_rewind(message, 1) >= 0;
}

// A decoded value must survive the trip back; NaN is compared by its description.
void checkRoundTrip(const tavrix::plist::Value& value) {
    BusMessagePtr again = newMessage();
    if (tavrix::bus::appendValue(again.get(), value) < 0) {
        return;  // deeper than the encoding carries
    }
    std::optional<tavrix::plist::Value> back;
    require(seal(again.get()) && tavrix::bus::readValue(again.get(), back) >= 0 && back &&
            (*back == value || back->description() == value.description()));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    Input in{data, size};
    BusMessagePtr message = newMessage();
    for (int arguments = in.byte() % 3; arguments > 0; --arguments) {
        if (!fill(in, message.get(), drawType(in, 0))) {
            return 0;
        }
    }
    if (!seal(message.get())) {
        return 0;
    }
    std::optional<tavrix::plist::Value> value;
    if (tavrix::bus::readValue(message.get(), value) >= 0 && value) {
        checkRoundTrip(*value);
    }
    sd_bus_message_rewind(message.get(), 1);
    value.reset();
    if (tavrix::bus::readOptionalValue(message.get(), value) >= 0 && value) {
        checkRoundTrip(*value);
    }
    sd_bus_message_rewind(message.get(), 1);
    std::optional<std::vector<std::uint8_t>> bytes;
    (void)tavrix::bus::readOptionalBytes(message.get(), bytes);
    return 0;
}
