#include "daemon/Daemon.h"

#include <optional>

namespace tavrix {

int Daemon::run() {
    TXManagerServer& server = TXManagerServer::sharedInstance();
    const int status = server.runUntilIdleExit();
    stopWorkers();
    server.endServing();
    return status;
}

void Daemon::stopWorkers() {
    if (UpdateCheckScheduler* scheduler = scheduler_.ifMade()) {
        scheduler->stop();
    }
    if (catalog::AssetCatalogService* catalog = catalog_.ifMade()) {
        catalog->stop();
    }
    if (TXUtility::TaskQueue* tasks = tasks_.ifMade()) {
        tasks->shutdown();
    }
}

}  // namespace tavrix
