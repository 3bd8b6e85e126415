// tavrixservicesd: started on demand by the bus or systemd; reads no arguments and no
// configuration file, serves until its run loop finishes, and exits with 0.
#include <signal.h>

#include "daemon/TXManagerServer.h"
#include "util/TXUtility.h"

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
    tavrix::TXManagerServer::sharedInstance().runUntilIdleExit();
    return 0;
}
