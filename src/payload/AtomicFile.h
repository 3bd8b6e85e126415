// Replacing a file whole: readers see either the old content or the new one, never a part.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <string>

namespace tavrix::payload {

// Writes size bytes to a temporary file beside path, flushes it to disk and renames it over path
// (a symbolic link at path is replaced, not followed). The new file gets mode. False, with errno
// set and nothing left behind, when any step fails. Does not log.
bool writeFileAtomically(const std::string& path, const void* bytes, std::size_t size, mode_t mode);

}  // namespace tavrix::payload
