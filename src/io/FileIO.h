// The one read loop and the one write loop: every file the daemon reads or writes by descriptor
// goes through these, so EINTR, short transfers and size caps are handled in one place.
#pragma once

#include <cstddef>
#include <functional>
#include <string>
#include <string_view>

#include "io/UniqueFd.h"

namespace tavrix::io {

// Opens path with flags (O_CLOEXEC added) and, when it creates the file, mode. Empty with errno
// set when it cannot.
UniqueFd openFile(const std::string& path, int flags, mode_t mode = 0);

// Writes all of bytes. 0, or the errno of the write that failed (EIO for one that wrote nothing).
int writeAll(int fd, std::string_view bytes);

// Hands what fd yields, chunk by chunk, to consume until the end. 0, the errno of a failed read,
// or the first nonzero answer of consume (which stops the loop).
int readChunks(int fd, const std::function<int(std::string_view chunk)>& consume);

// Reads fd to its end into bytes, never holding more than limit + 1 bytes. 0; EFBIG when there is
// more than limit; or the errno of a failed read. bytes is empty unless the answer is 0.
int readAll(int fd, std::string& bytes, std::size_t limit);

}  // namespace tavrix::io
