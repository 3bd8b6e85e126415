// Which archive entries may be extracted from an archive that came over the network: only what
// stays inside the destination, judged from the entry alone, before anything is written.
#pragma once

#include <archive_entry.h>

#include <string_view>

#include "base/Result.h"

namespace tavrix::payload {

// True when path is absolute or has a ".." component: written as it is, it could land anywhere.
bool leavesDestination(std::string_view path);

// Whether a symbolic link at linkPath (relative to the destination, not leaving it) with this
// target resolves inside the destination. Only leading ".." components are taken, as far up as
// the link's own directory goes: a ".." after a name could climb back out of a directory that is
// itself a link (a -> ., b -> a/..), which no look at the names alone can rule out.
bool linkTargetStaysInside(std::string_view linkPath, std::string_view target);

// Fails with why the entry must not be extracted from a network archive: its path leads outside, it
// is a hard link, something other than a regular file, directory or symbolic link, or a symbolic
// link leading outside.
Result<> checkEntryIsSafe(archive_entry* entry);

}  // namespace tavrix::payload
