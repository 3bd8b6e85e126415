// Builds a D-Bus message from fuzz bytes the way a client could (any body signature, variants of
// any content, containers nested and sized at will), seals it and decodes it as the daemon reads
// client arguments. Whatever decodes as a value must encode and decode again to the same value.
#include <sys/socket.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "bus/BusHandles.h"
#include "bus/BusValueCodec.h"

namespace {

using tavrix::bus::BusMessagePtr;

// Messages need a started bus object, not a bus: one over a socket pair is enough, since nothing
// is ever sent.
sd_bus* messageFactory() {
    static sd_bus* bus = [] {
        int fds[2];
        sd_bus* made = nullptr;
        if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0 ||
            sd_bus_new(&made) < 0 || sd_bus_set_fd(made, fds[0], fds[0]) < 0 ||
            sd_bus_start(made) < 0) {
            std::abort();
        }
        return made;  // lives for the whole run, with fds[1] keeping the pair open
    }();
    return bus;
}

class Input {
  public:
    Input(const std::uint8_t* data, std::size_t size) : data_(data), size_(size) {}

    std::uint8_t byte() { return at_ < size_ ? data_[at_++] : 0; }
    bool empty() const { return at_ >= size_; }

    template <typename T>
    T number() {
        T value{};
        std::size_t take = std::min(sizeof value, size_ - std::min(at_, size_));
        std::memcpy(&value, data_ + at_, take);
        at_ += take;
        return value;
    }

    std::string text(std::size_t limit) {
        std::size_t length =
            std::min<std::size_t>(byte() % (limit + 1), size_ - std::min(at_, size_));
        std::string out(reinterpret_cast<const char*>(data_ + at_), length);
        at_ += length;
        return out;
    }

  private:
    const std::uint8_t* data_;
    std::size_t size_;
    std::size_t at_ = 0;
};

// Signatures the daemon's values use, their near misses, and the other basic types.
constexpr const char* kSignatures[] = {
    "v",   "av", "aay", "a{sv}", "s",         "x",   "t",    "d",   "b",     "y",
    "n",   "q",  "i",   "u",     "ay",        "(d)", "(dd)", "()x", "a{ss}", "a{sx}",
    "aav", "as", "(s)", "a{iv}", "a{sa{sv}}", "o",   "g",    "ad",  "(v)",   "a(sv)",
};

// The length of the complete type at the start of signature, or 0 when there is none.
std::size_t completeType(std::string_view signature) {
    if (signature.empty()) {
        return 0;
    }
    char first = signature[0];
    if (first == 'a') {
        std::size_t element = completeType(signature.substr(1));
        return element == 0 ? 0 : element + 1;
    }
    if (first == '(' || first == '{') {
        char close = first == '(' ? ')' : '}';
        std::size_t at = 1;
        while (at < signature.size() && signature[at] != close) {
            std::size_t inner = completeType(signature.substr(at));
            if (inner == 0) {
                return 0;
            }
            at += inner;
        }
        return at < signature.size() ? at + 1 : 0;
    }
    return 1;
}

class Builder {
  public:
    Builder(Input& input, sd_bus_message* message) : in_(input), message_(message) {}

    std::string signature() {
        std::uint8_t pick = in_.byte();
        if (pick < 224) {
            return kSignatures[pick % std::size(kSignatures)];
        }
        return in_.text(12);  // anything at all, for sd-bus to refuse
    }

    // Appends values for every complete type in signature; false once sd-bus refuses.
    bool fill(std::string_view signature, int depth) {
        while (!signature.empty()) {
            std::size_t length = completeType(signature);
            if (length == 0 || !one(signature.substr(0, length), depth)) {
                return false;
            }
            signature.remove_prefix(length);
        }
        return true;
    }

  private:
    bool one(std::string_view type, int depth) {
        if (depth > 80) {
            return false;
        }
        std::string inner(type.substr(1));
        switch (type[0]) {
            case 'v': {
                std::string contents = signature();
                return sd_bus_message_open_container(message_, 'v', contents.c_str()) >= 0 &&
                       fill(contents, depth + 1) && sd_bus_message_close_container(message_) >= 0;
            }
            case 'a': {
                if (inner == "y" && in_.byte() % 2 == 0) {
                    std::string bytes = in_.text(64);
                    return sd_bus_message_append_array(message_, 'y', bytes.data(), bytes.size()) >=
                           0;
                }
                if (sd_bus_message_open_container(message_, 'a', inner.c_str()) < 0) {
                    return false;
                }
                for (int count = in_.byte() % 4; count > 0; --count) {
                    if (!fill(inner, depth + 1)) {
                        return false;
                    }
                }
                return sd_bus_message_close_container(message_) >= 0;
            }
            case '(':
            case '{': {
                std::string contents = inner.substr(0, inner.size() - 1);
                char kind = type[0] == '(' ? 'r' : 'e';
                return sd_bus_message_open_container(message_, kind, contents.c_str()) >= 0 &&
                       fill(contents, depth + 1) && sd_bus_message_close_container(message_) >= 0;
            }
            default:
                return basic(type[0]);
        }
    }

    bool basic(char type) {
        switch (type) {
            case 's': {
                std::string text = in_.text(16);
                text.erase(std::find(text.begin(), text.end(), '\0'), text.end());
                return sd_bus_message_append_basic(message_, 's', text.c_str()) >= 0;
            }
            case 'o':
                return sd_bus_message_append_basic(message_, 'o', "/a/b") >= 0;
            case 'g':
                return sd_bus_message_append_basic(message_, 'g', "a{sv}") >= 0;
            case 'b': {
                int flag = in_.byte() % 2;
                return sd_bus_message_append_basic(message_, 'b', &flag) >= 0;
            }
            case 'd': {
                auto real = in_.number<double>();
                return sd_bus_message_append_basic(message_, 'd', &real) >= 0;
            }
            case 'y':
            case 'n':
            case 'q':
            case 'i':
            case 'u':
            case 'x':
            case 't': {
                auto bits = in_.number<std::uint64_t>();
                return sd_bus_message_append_basic(message_, type, &bits) >= 0;
            }
            default:
                return false;  // file descriptors and unknown codes
        }
    }

    Input& in_;
    sd_bus_message* message_;
};

BusMessagePtr newMessage() {
    sd_bus_message* raw = nullptr;
    if (sd_bus_message_new_method_call(messageFactory(), &raw, nullptr, "/fuzz", "fuzz.Codec",
                                       "Carry") < 0) {
        std::abort();
    }
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
        return;  // deeper than the encoding carries, or a string with a NUL
    }
    std::optional<tavrix::plist::Value> back;
    if (!seal(again.get()) || tavrix::bus::readValue(again.get(), back) < 0 || !back ||
        (*back != value && back->description() != value.description())) {
        std::abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    Input input(data, size);
    BusMessagePtr message = newMessage();
    Builder builder(input, message.get());
    std::string body = builder.signature();
    if (!builder.fill(body, 0) || !seal(message.get())) {
        return 0;
    }
    std::optional<tavrix::plist::Value> value;
    if (tavrix::bus::readValue(message.get(), value) >= 0 && value) {
        checkRoundTrip(*value);
    }
    sd_bus_message_rewind(message.get(), 1);
    std::optional<tavrix::plist::Value> optional;
    if (tavrix::bus::readOptionalValue(message.get(), optional) >= 0 && optional) {
        checkRoundTrip(*optional);
    }
    sd_bus_message_rewind(message.get(), 1);
    std::optional<std::vector<std::uint8_t>> bytes;
    (void)tavrix::bus::readOptionalBytes(message.get(), bytes);
    return 0;
}
