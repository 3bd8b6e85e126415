#include "device/DaemonStateFile.h"

#include "util/FileSystemUtilities.h"
#include "fs/AtomicFile.h"
#include "device/PlatformRoot.h"

namespace tavrix::platform {
namespace {

constexpr mode_t kStateDirectoryMode = 0755;

}  // namespace

std::string daemonStateFilePath(std::string_view fileName) {
    return resolvePath(kDaemonStateDirectory) + "/" + std::string(fileName);
}

int writeDaemonStateFile(std::string_view fileName, const plist::Value& value, plist::Format format,
                         mode_t mode) {
    int error =
        payload::createDirectoryAt(resolvePath(kDaemonStateDirectory), kStateDirectoryMode, true);
    if (error != 0) {
        return error;
    }
    return replaceFileAtomically(daemonStateFilePath(fileName), plist::serialize(value, format),
                                 mode);
}

}  // namespace tavrix::platform
