// Calls from several clients at once while the daemon leaves and the bus starts the next one:
// every call must get its answer, whichever daemon gives it.
#include <signal.h>

#include <atomic>
#include <thread>
#include <vector>

#include "BusFixture.h"

namespace tavrix::integration {
namespace {

class DaemonBurstTest : public BusFixture {
  protected:
    DaemonBurstTest() { idleExitSeconds = 1; }
};

struct Tally {
    int calls = 0;
    std::vector<std::string> failures;
};

// What the test tells the clients, in this order.
struct Phase {
    std::atomic<bool> go{false};         // the daemon is about to leave: call without pause
    std::atomic<bool> restarted{false};  // a new daemon owns the name (or the wait gave up)
};

// One call, the kind chosen by turn; a wrong answer or an error counts as lost.
void callOnce(client::TavrixClient& caller, std::int32_t clientNumber, Tally& tally) {
    const char* const wrong[] = {"IsTavrixBundleSupported answered true",
                                 "SetClientType answered false",
                                 "CopyTavrixValue answered a value"};
    const int kind = tally.calls++ % 3;
    try {
        const bool right = kind == 0   ? !caller.isTavrixBundleSupported()
                           : kind == 1 ? caller.setClientType(clientNumber)
                                       : !caller.copyTavrixValue("CarrierName");
        if (!right) {
            tally.failures.push_back(wrong[kind]);
        }
    } catch (const client::ClientError& error) {
        tally.failures.push_back(error.what());
    }
}

// One client: a first call (it becomes a client of the first daemon), then, once told, calls
// back to back until the next daemon has answered a few of them.
void runClient(client::TavrixClient& caller, std::int32_t clientNumber, Phase& phase,
               Tally& tally) {
    constexpr int kCallsAfterRestart = 20;
    callOnce(caller, clientNumber, tally);
    phase.go.wait(false);
    while (!phase.restarted.load()) {
        callOnce(caller, clientNumber, tally);
    }
    for (int i = 0; i < kCallsAfterRestart; ++i) {
        callOnce(caller, clientNumber, tally);
    }
}

// Calls keep a daemon from going idle, so it is told to leave (SIGTERM, which leaves the way an
// idle exit does) while the clients call back to back.
TEST_F(DaemonBurstTest, NoCallIsLostWhileTheDaemonLeaves) {
    constexpr int kClients = 8;
    std::vector<client::TavrixClient> callers;
    for (int i = 0; i < kClients; ++i) {
        callers.push_back(client());
    }
    std::vector<Tally> tallies(kClients);
    Phase phase;
    std::vector<std::thread> threads;
    for (int i = 0; i < kClients; ++i) {
        threads.emplace_back(runClient, std::ref(callers[i]), i, std::ref(phase),
                             std::ref(tallies[i]));
    }

    const bool started = waitForNameOwner();
    const auto first = daemonPid();
    phase.go = true;
    phase.go.notify_all();
    std::this_thread::sleep_for(100ms);  // the clients are calling without pause by now
    const bool signalled = first && ::kill(*first, SIGTERM) == 0;
    const bool restarted =
        signalled &&
        watcher().waitUntil(
            [&] { return watcher().nameReleaseCount() >= 1 && !watcher().nameOwner().empty(); },
            20s);
    phase.restarted = true;
    for (std::thread& thread : threads) {
        thread.join();
    }

    ASSERT_TRUE(started && signalled);
    EXPECT_TRUE(restarted) << "the daemon did not leave and come back while clients called";
    for (int i = 0; i < kClients; ++i) {
        EXPECT_TRUE(tallies[i].failures.empty())
            << "client " << i << " lost " << tallies[i].failures.size() << " of "
            << tallies[i].calls << " calls, first: " << tallies[i].failures.front();
    }
    EXPECT_GE(daemonLaunches().size(), 2u);
}

}  // namespace
}  // namespace tavrix::integration
