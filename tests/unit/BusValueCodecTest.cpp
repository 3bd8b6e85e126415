#include <gtest/gtest.h>

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <functional>

#include "PrivateBus.h"
#include "TestSupport.h"
#include "bus/BusHandles.h"
#include "bus/BusValueCodec.h"

namespace tavrix::bus {
namespace {

using plist::Array;
using plist::Data;
using plist::Dictionary;
using plist::Integer;
using plist::Value;

using Writer = std::function<int(sd_bus_message*)>;

// Every message goes through a real bus daemon, which checks it against the protocol (and drops
// a sender that breaks it), back to the connection that sent it, which parses it again.
class BusValueCodec : public testing::Test {
  protected:
    BusMessagePtr newMessage() {
        const char* self = nullptr;
        sd_bus_message* raw = nullptr;
        test::check(sd_bus_get_unique_name(bus_.get(), &self), "sd_bus_get_unique_name");
        test::check(
            sd_bus_message_new_method_call(bus_.get(), &raw, self, "/test", "test.Codec", "Carry"),
            "sd_bus_message_new_method_call");
        return BusMessagePtr(raw);
    }

    // Writes a message with write, sends it and answers what read makes of it on arrival.
    int roundTrip(const Writer& write, const std::function<int(sd_bus_message*)>& read) {
        BusMessagePtr message = newMessage();
        int r = write(message.get());
        if (r < 0) {
            return r;
        }
        test::check(sd_bus_send(bus_.get(), message.get(), nullptr), "sd_bus_send");
        BusMessagePtr received;
        auto arrived = [&] {
            sd_bus_message* raw = nullptr;
            r = sd_bus_process(bus_.get(), &raw);
            test::check(r, "sd_bus_process (did the bus drop the connection?)");
            received.reset(raw);
            // Skips what the bus itself says to a new connection.
            return received && sd_bus_message_is_method_call(raw, "test.Codec", "Carry") > 0;
        };
        if (!test::pollUntil(arrived, std::chrono::seconds(10), [&](auto left) {
                return r > 0 ||
                       sd_bus_wait(bus_.get(), std::chrono::microseconds(left).count()) >= 0;
            })) {
            throw std::runtime_error("the message did not arrive");
        }
        return read(received.get());
    }

    // A message another program might send, read as a value.
    int readForeign(const Writer& write, std::optional<Value>& back) {
        return roundTrip(write, [&](sd_bus_message* m) { return readValue(m, back); });
    }

    test::PrivateBus daemon_;
    BusPtr bus_ = daemon_.connect();
};

// Other programs (busctl, scripts) rely on the documented signatures, scalars at the top too; a
// value comes back as the same type (a date is no real, a large unsigned integer not negative).
TEST_F(BusValueCodec, ScalarsTravelWithTheDocumentedSignatures) {
    const std::pair<Value, const char*> cases[] = {
        {Value("text"), "s"},
        {Value(Integer(-1)), "x"},
        {Value(Integer::fromUnsigned(INT64_MAX)), "x"},
        {Value(Integer::fromUnsigned(static_cast<std::uint64_t>(INT64_MAX) + 1)), "t"},
        {Value(12.5), "d"},
        {Value(false), "b"},
        {Value(Data{0x00, 0xff, 0x80}), "ay"},
        {Value(plist::Date{12.5}), "(d)"},
        {Value(Array{}), "av"},
        {Value(Dictionary{}), "a{sv}"},
    };
    for (const auto& [value, signature] : cases) {
        std::string contents;
        std::optional<Value> back;
        ASSERT_GE(roundTrip([&](sd_bus_message* m) { return appendValue(m, value); },
                            [&](sd_bus_message* m) {
                                char type = 0;
                                const char* inside = "";
                                sd_bus_message_peek_type(m, &type, &inside);
                                contents = inside;
                                return readValue(m, back);
                            }),
                  0)
            << value.description();
        EXPECT_EQ(contents, signature) << value.description();
        EXPECT_EQ(back, value);
    }
}

// A bundle that is absent stays apart from an empty one; two are no optional. (Optional values
// travel in replies that the daemon tests read back through the real daemon.)
TEST_F(BusValueCodec, OptionalBytesKeepAbsentApartFromEmpty) {
    using Bytes = std::optional<std::vector<std::uint8_t>>;
    for (const Bytes& bytes : {Bytes(), Bytes(std::vector<std::uint8_t>{}),
                               Bytes(std::vector<std::uint8_t>{0x1f, 0x8b, 0x00})}) {
        Bytes back = std::vector<std::uint8_t>{9};
        ASSERT_GE(roundTrip([&](sd_bus_message* m) { return appendOptionalBytes(m, bytes); },
                            [&](sd_bus_message* m) { return readOptionalBytes(m, back); }),
                  0);
        EXPECT_EQ(back, bytes);
    }
    // Two elements are not an optional.
    Bytes bytes;
    EXPECT_EQ(
        roundTrip([](sd_bus_message* m) { return sd_bus_message_append(m, "aay", 2, 1, 0x01, 0); },
                  [&](sd_bus_message* m) { return readOptionalBytes(m, bytes); }),
        -EINVAL);
}

// What other programs may send: the narrower integer types are read as integers; everything
// else that is no property list (or holds one deep inside) is refused and leaves the value alone.
TEST_F(BusValueCodec, ForeignMessagesAreReadOrRefusedWhole) {
    const std::pair<Writer, Integer> narrower[] = {
        {[](sd_bus_message* m) { return sd_bus_message_append(m, "v", "y", 255); }, 255},
        {[](sd_bus_message* m) { return sd_bus_message_append(m, "v", "n", -32768); }, -32768},
        {[](sd_bus_message* m) { return sd_bus_message_append(m, "v", "q", 65535); }, 65535},
        {[](sd_bus_message* m) { return sd_bus_message_append(m, "v", "i", INT32_MIN); },
         INT32_MIN},
        {[](sd_bus_message* m) { return sd_bus_message_append(m, "v", "u", UINT32_MAX); },
         Integer(UINT32_MAX)},
    };
    for (const auto& [write, expected] : narrower) {
        std::optional<Value> value;
        ASSERT_GE(readForeign(write, value), 0);
        EXPECT_EQ(value, Value(expected));
    }
    const Writer unsupported[] = {
        [](sd_bus_message* m) { return sd_bus_message_append(m, "v", "o", "/some/object"); },
        [](sd_bus_message* m) { return sd_bus_message_append(m, "v", "as", 1, "x"); },
        [](sd_bus_message* m) { return sd_bus_message_append(m, "v", "a{ss}", 1, "k", "v"); },
        [](sd_bus_message* m) { return sd_bus_message_append(m, "v", "(dd)", 1.0, 2.0); },
        [](sd_bus_message* m) { return sd_bus_message_append(m, "v", "v", "s", "wrapped"); },
        // The same key twice would silently lose a value.
        [](sd_bus_message* m) {
            return sd_bus_message_append(m, "v", "a{sv}", 2, "k", "i", 1, "k", "i", 2);
        },
        [](sd_bus_message* m) {
            return sd_bus_message_append(m, "v", "av", 2, "s", "fine", "o", "/no");
        },
    };
    for (const Writer& write : unsupported) {
        std::optional<Value> value = Value("untouched");
        EXPECT_EQ(readForeign(write, value), -EINVAL);
        EXPECT_EQ(value, Value("untouched"));
    }
    // Not a variant at all, or nothing there.
    std::optional<Value> value;
    EXPECT_LT(
        readForeign([](sd_bus_message* m) { return sd_bus_message_append(m, "s", "x"); }, value),
        0);
    EXPECT_LT(readForeign([](sd_bus_message*) { return 0; }, value), 0);
    EXPECT_FALSE(value.has_value());
}

TEST_F(BusValueCodec, RefusesStringsTheBusCannotCarry) {
    for (const Value& value : {Value(std::string("nul\0inside", 10)), Value("\xff not UTF-8"),
                               Value(Dictionary{{std::string("k\0ey", 4), Value(1)}})}) {
        BusMessagePtr message = newMessage();
        EXPECT_EQ(appendValue(message.get(), value), -EINVAL);
    }
}

// The deepest values this side sends, in the optional shape that replies use, pass the bus
// daemon; one level more is refused when writing, and a deeper message written by hand is
// refused when reading.
TEST_F(BusValueCodec, NestingStopsAtTheDeepestValueTheBusCarries) {
    Value arrays("leaf");
    Value dictionaries(Data{1, 2, 3});
    for (std::size_t level = 1; level < kMaxValueDepth; ++level) {
        arrays = Value(Array{arrays});
        dictionaries = Value(Dictionary{{"level", dictionaries}});
    }
    for (const Value& value : {arrays, dictionaries}) {
        std::optional<Value> back;
        ASSERT_GE(roundTrip([&](sd_bus_message* m) { return appendOptionalValue(m, value); },
                            [&](sd_bus_message* m) { return readOptionalValue(m, back); }),
                  0);
        EXPECT_EQ(back, value);
        BusMessagePtr message = newMessage();
        EXPECT_EQ(appendValue(message.get(), Value(Array{value})), -ELOOP);
    }
    std::optional<Value> value;
    EXPECT_EQ(readForeign(
                  [](sd_bus_message* m) {
                      int r = 0;
                      for (std::size_t level = 0; level <= kMaxValueDepth && r >= 0; ++level) {
                          r = sd_bus_message_open_container(m, 'v', "av");
                          r = r < 0 ? r : sd_bus_message_open_container(m, 'a', "v");
                      }
                      for (std::size_t level = 0; level <= kMaxValueDepth && r >= 0; ++level) {
                          r = sd_bus_message_close_container(m);
                          r = r < 0 ? r : sd_bus_message_close_container(m);
                      }
                      return r;
                  },
                  value),
              -ELOOP);
}

}  // namespace
}  // namespace tavrix::bus
