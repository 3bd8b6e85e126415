// The daemon's root: it owns every long-lived object of the process and, through them, every
// thread. Each object is made where the start-up or a first use asks for it
// (T::sharedInstance() answers the one held here) and all of them end with the root: the worker
// threads first, once the run loop has finished, then the objects in the reverse of the order
// below.
#pragma once

#include "bundle/BundleLocations.h"
#include "bundle/BundleManager.h"
#include "bus/ServiceManager.h"
#include "bus/TXTransactionManager.h"
#include "catalog/AssetCatalogService.h"
#include "daemon/StatusProperties.h"
#include "daemon/TXManager.h"
#include "daemon/TXManagerServer.h"
#include "daemon/UpdateCheckScheduler.h"
#include "device/BuildCapabilities.h"
#include "device/HomeDirectories.h"
#include "device/MobileUser.h"
#include "device/PreferencesStore.h"
#include "device/TXUtility.h"
#include "update/AssetHandler.h"
#include "util/SharedInstance.h"

namespace tavrix {

class Daemon {
  public:
    Daemon() = default;
    // Stops the workers if the run loop did not, then ends the objects in reverse order.
    ~Daemon() { stopWorkers(); }
    Daemon(const Daemon&) = delete;
    Daemon& operator=(const Daemon&) = delete;

    // The whole life of the daemon: the server's start-up and run loop, then, whichever way
    // the loop ended, the workers' end and the server's. The process's exit status.
    int run();

  private:
    // Producers before consumers: the job timer and its queue start downloads, downloads queue
    // progress reports, reports install bundles.
    void stopWorkers();

    // In the order they are first needed; what depends on another comes after it. The facts
    // about the device come first: they hold for the root's whole life.
    SharedInstance<TXUtility::StringFacts> deviceStrings_;
    SharedInstance<device::BuildCapabilities::Facts> build_;
    SharedInstance<device::MobileUser::Facts> mobileUser_;
    SharedInstance<device::DistrustedPaths> distrustedPaths_;
    SharedInstance<BundleLocations> bundleLocations_;
    SharedInstance<device::PreferencesStore> preferences_;
    SharedInstance<bus::ServiceManager> serviceManager_;
    SharedInstance<TXTransactionManager> transactions_;
    SharedInstance<StatusPublisher> status_;
    SharedInstance<TXManagerServer> server_;
    SharedInstance<TXUtility::TaskQueue> tasks_;
    SharedInstance<BundleManager> bundles_;
    SharedInstance<TXManager> manager_;
    SharedInstance<AssetHandler::CheckState> updateCheck_;
    SharedInstance<catalog::AssetCatalogService> catalog_;
    SharedInstance<UpdateCheckScheduler> scheduler_;
};

}  // namespace tavrix
