#include "update/AssetHandler.h"

namespace tavrix {

// No asset catalog is configured in this build of the daemon, so there is never an update.
bool AssetHandler::downloadUpdateIfAvailable() {
    return false;
}

}  // namespace tavrix
