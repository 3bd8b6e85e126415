#include "payload/PayloadUnpack.h"

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "device/PlatformRoot.h"
#include "io/AtomicFile.h"
#include "util/Log.h"

namespace tavrix {
namespace payload {

// Only the daemon reads the staged payload.
constexpr mode_t kStagedFileMode = 0600;

std::string extractionStagingPathFor(const std::string& bundleDirectory) {
    std::size_t slash = bundleDirectory.rfind('/');
    return bundleDirectory.substr(0, slash + 1) + "." + bundleDirectory.substr(slash + 1) +
           ".incoming";
}

bool writeDataToFile(const plist::Data& data, const std::string& path) {
    if (io::replaceFileAtomically(path, data, kStagedFileMode) == 0) {
        logCFormat("Successfully wrote the KW Data to file: %s\n", path.c_str());
    } else {
        logCFormat("Failed to write the zipped file: %s\n", path.c_str());
    }
    return true;
}

}  // namespace payload
}  // namespace tavrix
