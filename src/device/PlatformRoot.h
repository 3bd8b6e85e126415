// The platform root: the directory that stands for "/" of the device. It is "/" unless the
// environment variable TAVRIX_ROOT names another directory, so that a whole device image can live
// in a directory for tests and the demo. Every fixed absolute path the daemon uses goes through it.
#pragma once

#include <string>
#include <string_view>

namespace tavrix::device {

// The daemon's own durable state (scheduled jobs, the record of an install under way).
inline constexpr std::string_view kDaemonStateDirectory = "/var/lib/tavrixservicesd";

// The root directory without a trailing slash ("" for "/"), read from the environment once.
const std::string& platformRoot();

// absolutePath under the platform root: "/etc/passwd" -> "<root>/etc/passwd".
std::string resolvePath(std::string_view absolutePath);

// absolutePath under the given root (the same rule, for a root other than the process's own).
std::string resolvePathUnder(std::string_view root, std::string_view absolutePath);

}  // namespace tavrix::device
