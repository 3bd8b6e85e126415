// Finds, downloads and installs newer behavior bundles from the asset catalog.
#pragma once

namespace tavrix {

class AssetHandler {
  public:
    // Starts a download when the catalog has a better bundle; true when one was started.
    static bool downloadUpdateIfAvailable();
};

}  // namespace tavrix
