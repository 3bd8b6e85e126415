// A bundle a client hands over as a file descriptor instead of inline bytes: read into the same
// bytes the inline form carries, within the same bound, without ever blocking the daemon. Only a
// regular file (read whole from its start, whatever the client's offset) or a pipe whose writer
// has finished (everything written and its end closed before the call) is taken.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "base/Result.h"

namespace tavrix::bus {

// The largest message sd-bus takes, so that a bundle that fits one way fits the other.
inline constexpr std::size_t kMaxHandedPayloadBytes = 128u << 20;

// The bytes fd holds, or what was refused: not a regular file or pipe, not open for reading,
// more than limit bytes, a pipe still open for writing, or a failed read.
Result<std::vector<std::uint8_t>> readHandedPayload(int fd, std::size_t limit);

}  // namespace tavrix::bus
