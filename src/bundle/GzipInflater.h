// Inflating a whole gzip body at once, for the carrier file loader's HTTP branch.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "plist/Value.h"

namespace tavrix {

// A gzip bomb must not exhaust memory: larger results are refused.
inline constexpr std::size_t kMaxInflatedBytes = 64u << 20;

// The decompressed bytes of the first gzip member of compressed (bytes after it are ignored).
// False, with out left as it was, for damaged or truncated input or a result above maxBytes.
bool inflateGzip(std::span<const std::uint8_t> compressed, plist::Data& out,
                 std::size_t maxBytes = kMaxInflatedBytes);

}  // namespace tavrix
