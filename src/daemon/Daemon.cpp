#include "daemon/Daemon.h"

#include <optional>

namespace tavrix {

int Daemon::run() {
    TXManagerServer& server = TXManagerServer::sharedInstance();
    server.whenLoopEnds([this] { stopWorkers(); });
    return server.runUntilIdleExit();
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
