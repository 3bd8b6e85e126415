#include "update/PendingInstall.h"

#include <cerrno>
#include <cstring>

#include "device/DaemonStateFile.h"
#include "plist/PropertyListFormat.h"
#include "util/FileSystemUtilities.h"
#include "util/Log.h"

namespace tavrix {
namespace {

constexpr const char* kMarkerFileName = "pending-install.plist";
constexpr const char* kAssetDirectoryKey = "AssetDirectory";
constexpr const char* kInstalledKey = "Installed";
constexpr mode_t kMarkerMode = 0600;

}  // namespace

std::string pendingInstallMarkerPath() {
    return device::daemonStateFilePath(kMarkerFileName);
}

bool writePendingInstall(const PendingInstall& install) {
    const std::string& assetDirectory = install.assetDirectory;
    const plist::Value record(plist::Dictionary{{kAssetDirectoryKey, plist::Value(assetDirectory)},
                                                {kInstalledKey, plist::Value(install.installed)}});
    if (int error =
            device::writeDaemonStateFile(kMarkerFileName, record, plist::Format::Xml, kMarkerMode);
        error != 0) {
        logCFormat(LogPriority::Warning, "Could not record the install of %s: %s\n",
                   assetDirectory.c_str(), std::strerror(error));
        return false;
    }
    return true;
}

std::optional<PendingInstall> readPendingInstall() {
    const plist::Dictionary values = device::readDaemonStateFile(kMarkerFileName);
    auto directory = values.find(kAssetDirectoryKey);
    if (directory == values.end() || directory->second.asString() == nullptr) {
        return std::nullopt;
    }
    auto installed = values.find(kInstalledKey);
    const bool* flag = installed != values.end() ? installed->second.asBoolean() : nullptr;
    return PendingInstall{*directory->second.asString(), flag != nullptr && *flag};
}

void removePendingInstall() {
    removeItemTree(pendingInstallMarkerPath());
}

}  // namespace tavrix
