// Replacing a file in one step: readers see either the old file or the new one whole, and after
// a crash or power loss the file is one of the two, never a mix.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "io/Directory.h"

namespace tavrix::io {

// Writes bytes to a temporary file beside path, flushes it to disk, gives it mode and renames it
// over path (io::Directory::writeFile on path's directory, links in the path followed). Answers 0,
// or the errno of the step that failed (nothing is left behind then).
int replaceFileAtomically(const std::string& path, std::string_view bytes, mode_t mode);
// The same, except that an existing file at path is never replaced (EEXIST).
int createFileAtomically(const std::string& path, std::string_view bytes, mode_t mode);
// The same again, with the content written by fill into the open temporary file (answering 0 or
// an errno); for content too large to hold in memory. Temporary names start with
// kAtomicWritePrefix (io/Directory.h).
int createFileAtomicallyWith(const std::string& path, mode_t mode,
                             const std::function<int(int fd)>& fill);
// replaceFileAtomically for binary data.
inline int replaceFileAtomically(const std::string& path, const std::vector<std::uint8_t>& bytes,
                                 mode_t mode) {
    return replaceFileAtomically(
        path, std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()), mode);
}

}  // namespace tavrix::io
