// tavrixservicesd: started on demand by the bus or systemd; reads no arguments and no
// configuration file, serves until its run loop finishes, and exits with 0, or with 1 when it
// could not start serving.
#include <signal.h>

#include <cstdio>
#include <cstdlib>

#include "daemon/TXManagerServer.h"
#include "device/TXUtility.h"
#include "util/ContainExceptions.h"

int main() {
    // The run loop takes these signals through its own sources; block them before any thread
    // starts so that every thread inherits the mask.
    sigset_t handled;
    sigemptyset(&handled);
    sigaddset(&handled, SIGTERM);
    sigaddset(&handled, SIGINT);
    sigprocmask(SIG_BLOCK, &handled, nullptr);
    signal(SIGPIPE, SIG_IGN);

    tavrix::TXUtility::setIsDaemon(true);
    auto& server = tavrix::TXManagerServer::sharedInstance();
    int status = 1;
    const bool ran =
        tavrix::containExceptions("The daemon", [&] { status = server.runUntilIdleExit(); });
    if (!ran || !server.workersStopped()) {
        // A worker thread may still be running: static destructors must not run under it.
        std::fflush(nullptr);
        std::_Exit(ran ? status : 1);
    }
    return status;
}
