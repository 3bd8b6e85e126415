#include "device/DaemonStateFile.h"

#include <cerrno>

#include "device/PlatformRoot.h"
#include "io/AtomicFile.h"
#include "io/Directory.h"
#include "util/FileSystemUtilities.h"

namespace tavrix::device {
namespace {

constexpr mode_t kStateDirectoryMode = 0755;

}  // namespace

std::string daemonStateFilePath(std::string_view fileName) {
    return resolvePath(kDaemonStateDirectory) + "/" + std::string(fileName);
}

plist::Dictionary readDaemonStateFile(std::string_view fileName) {
    // Only the daemon's own files in its own directory: nothing another user made or linked
    // there may pass for the daemon's state.
    int error = 0;
    io::UniqueFd file = io::openOwnFile(daemonStateFilePath(fileName), &error);
    if (!file) {
        return {};
    }
    Result<plist::Value> stored = plist::readOpenFile(file.get());
    const plist::Dictionary* values = stored ? stored->asDictionary() : nullptr;
    return values != nullptr ? *values : plist::Dictionary();
}

int writeDaemonStateFile(std::string_view fileName, const plist::Value& value, plist::Format format,
                         mode_t mode) {
    int error = createDirectoryAt(resolvePath(kDaemonStateDirectory), kStateDirectoryMode, true);
    if (error != 0) {
        return error;
    }
    const Result<std::string> bytes = plist::serialize(value, format);
    if (!bytes) {
        return EFBIG;  // nothing its reader would take
    }
    return io::replaceFileAtomically(daemonStateFilePath(fileName), *bytes, mode);
}

}  // namespace tavrix::device
