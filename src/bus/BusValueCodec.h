// Property-list values on the bus. A value travels as a variant holding
//   dictionary a{sv}, array av, string s, integer x (t above INT64_MAX), real d, boolean b,
//   data ay, date (d) (seconds since 2001-01-01 00:00:00 UTC),
// so that dates and data stay apart from reals and strings in both directions. Something that
// may be absent travels as an array of zero or one element (av, aay), which keeps "no value"
// apart from every value, the empty ones included.
//
// Every function answers a non-negative number on success or a negative errno: -EINVAL for a
// value the encoding cannot carry or a variant of another type, -ELOOP for nesting deeper than
// kMaxValueDepth, and sd-bus's own errors (-ENXIO for a message whose next item is not what was
// asked for, -EBADMSG for damaged bytes). After a failure the message's read or write position
// is undefined; drop the message.
#pragma once

#include <systemd/sd-bus.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <vector>

#include "plist/Value.h"

namespace tavrix::bus {

// How deeply containers may nest inside one value (a scalar at the top is depth 1). The bus
// daemon drops a peer whose message nests more than 64 containers; a dictionary level costs
// three (variant, array, entry), so this is the deepest value that still fits inside an
// optional's array. A reader that stops here cannot be driven into deep recursion either.
inline constexpr std::size_t kMaxValueDepth = 21;

// Appends one variant holding value.
int appendValue(sd_bus_message* message, const plist::Value& value);

// Reads one variant into out. Besides the types above, the other integer types (y n q i u) are
// read as integers; any other content is refused with -EINVAL. out is set only on success.
int readValue(sd_bus_message* message, std::optional<plist::Value>& out);

// "av" with no element for an absent value, one element otherwise.
int appendOptionalValue(sd_bus_message* message, const std::optional<plist::Value>& value);
// Reads "av"; more than one element is -EINVAL.
int readOptionalValue(sd_bus_message* message, std::optional<plist::Value>& out);

// A dictionary as a bare "a{sv}" (not inside a variant), as a method's whole answer.
int appendDictionary(sd_bus_message* message, const plist::Dictionary& dictionary);
// Reads a bare "a{sv}"; out is set only on success.
int readDictionary(sd_bus_message* message, plist::Dictionary& out);

// "aay" with no element for absent bytes, one element otherwise.
int appendOptionalBytes(sd_bus_message* message,
                        const std::optional<std::vector<std::uint8_t>>& bytes);
// Reads "aay"; more than one element is -EINVAL.
int readOptionalBytes(sd_bus_message* message, std::optional<std::vector<std::uint8_t>>& out);

}  // namespace tavrix::bus
