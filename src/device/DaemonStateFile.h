// Files of the daemon's own durable state (the install record, the activity record, accepted
// catalog serials) under the state directory, each written complete or not at all.
#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>

#include "plist/PropertyListFormat.h"

namespace tavrix::device {

// "<root>/var/lib/tavrixservicesd/<fileName>".
std::string daemonStateFilePath(std::string_view fileName);

// The dictionary stored as fileName; empty when the file is missing, unreadable or no dictionary,
// or is not a regular file of the daemon's user (or root) in the state directory, itself one
// nobody else can write in (the state is then as if never recorded).
plist::Dictionary readDaemonStateFile(std::string_view fileName);

// Writes value as fileName in the state directory, creating the directory when missing. 0, or
// the errno that stopped it (EFBIG for a value its reader would refuse); the file is then as it
// was.
int writeDaemonStateFile(std::string_view fileName, const plist::Value& value, plist::Format format,
                         mode_t mode);

}  // namespace tavrix::device
