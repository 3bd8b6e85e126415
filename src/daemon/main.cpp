// tavrixservicesd: started on demand by the bus or systemd; reads no arguments and no
// configuration file, serves until its run loop finishes, and exits with 0, or with 1 when it
// could not start serving.
#include <signal.h>

#include "daemon/Daemon.h"
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
    int status = 1;
    // The root ends within the call: every thread joined and every object gone before main
    // returns.
    tavrix::containExceptions("The daemon", [&] {
        tavrix::Daemon daemon;
        status = daemon.run();
    });
    return status;
}
