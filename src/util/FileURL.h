// File URLs: a path turned into a "file://" URL and back.
#pragma once

#include <optional>
#include <string>

namespace tavrix {

// "file://" + the absolute path (a relative path is resolved against the working directory), with
// every byte other than unreserved characters and '/' percent-encoded. Nothing for an empty path,
// a path holding a NUL byte, or a relative path when the working directory is unknown.
std::optional<std::string> fileURLFromPath(const std::string& path);

// The path a "file://" URL names (empty host or "localhost"), or nothing for any other URL, a
// broken percent escape or an escaped NUL byte.
std::optional<std::string> pathFromFileURL(const std::string& url);

}  // namespace tavrix
