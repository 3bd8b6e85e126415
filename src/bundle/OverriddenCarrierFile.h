// The overridden carrier file of an overlay determination: its name and its writing. The name
// is "<type word>+<bundle name>+<overlay key>[+<extra identifiers>]+<bundle version>.plist" in
// the mobile user's "Library/TavrixBundles/Overlay/" directory; the extra identifiers are the
// '+' fields of the current carrier file's name that the new name would otherwise lose.
#pragma once

#include <optional>
#include <string>

#include "bundle/OverlayContext.h"
#include "plist/Value.h"

namespace tavrix {

inline constexpr const char* kOverlayDirectoryName = "Overlay/";

// The directory the overridden carrier files are written to, ending in '/'; empty without a home.
std::string overriddenFilesDirectory();

// Computes the file-name prefix (logged, kept in context.overriddenFilePrefix) and answers the
// overridden file's path. Nothing when no file can be named: no bundle name, no home directory,
// or fields that would make the name leave the Overlay directory (a '/' in the key or version).
std::optional<std::string> overriddenFilePath(OverlayContext& context);

// Whether a generated carrier file the daemon wrote is at path: a regular file of root or the
// daemon's user, in the protected overlay directory. Anything else there is logged once and
// removed, so that the daemon writes its own.
bool isGeneratedCarrierFile(const std::string& path);

// Writes dictionary as an XML property list at path, whole and only where nothing is, creating
// the directory (0755) when missing; logs the outcome. False when path is absent or writing fails.
bool writeOverriddenCarrierFile(const plist::Value& dictionary,
                                const std::optional<std::string>& path);

}  // namespace tavrix
