// The one set of path helpers for the daemon's own paths (the bundle links keep their POSIX
// dirname and basename, cut as the link table expects).
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tavrix::io {

// The directory holding path, trailing slashes ignored: "" for a bare name, "/" for an entry at
// the top.
std::string parentDirectory(std::string_view path);

// What follows the last slash, trailing slashes ignored (the whole path when there is no slash).
std::string lastPathComponent(std::string_view path);

// The target of the symbolic link at path, however long, or nothing with errno set.
std::optional<std::string> readLinkTarget(const std::string& path);

// What is at path, symbolic links followed.
enum class PathKind { Missing, Directory, RegularFile, Other };
PathKind kindOfPath(const std::string& path);

// path with every link, "." and ".." resolved, however long; empty when it does not resolve.
std::string realPathOf(const std::string& path);

}  // namespace tavrix::io
