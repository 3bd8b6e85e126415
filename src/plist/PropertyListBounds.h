// Limits checked on property-list bytes before libplist builds (or frees) a tree from them.
// libplist recurses once per nesting level, copies a binary object every time it is referenced
// and trusts the lengths it reads, so without these checks a small hostile input can exhaust the
// stack or memory. This is a bounds check only; libplist still does all the parsing.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "base/Result.h"

namespace tavrix::plist {

// Largest property-list file read; the daemon's own files are a few kilobytes, a catalog about a
// megabyte.
inline constexpr std::size_t kMaxPropertyListBytes = 16 * 1024 * 1024;
// Deepest nesting of containers (a scalar at the top is depth 1).
inline constexpr std::size_t kMaxPropertyListDepth = 512;
// Most nodes (dictionary keys included) one document may become, every shared binary object
// counted each time it is referenced.
inline constexpr std::size_t kMaxPropertyListNodes = 256 * 1024;
// Most string and data bytes one binary document may become, shared objects counted the same way.
inline constexpr std::size_t kMaxPropertyListPayloadBytes = 64 * 1024 * 1024;

// Fails, with why, when the XML document goes past the limits.
Result<> checkXmlBounds(std::string_view xml);

// Fails, with why, unless the binary document is well formed and stays within the limits. Also
// refuses a string or key holding a NUL character, which libplist cannot read back.
Result<> checkBinaryBounds(std::string_view bytes);

}  // namespace tavrix::plist
