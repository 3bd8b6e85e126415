// Calls from several clients at once while the daemon leaves for idleness and the bus starts the
// next one: every call must get its answer, whichever daemon gives it.
#include <atomic>
#include <thread>
#include <vector>

#include "BusFixture.h"

namespace tavrix::integration {
namespace {

constexpr const char* kLaunchEnded =
    "*********** Ended Corvex transaction : TXMinimumLaunchTransaction ***********";

class DaemonBurstTest : public BusFixture {
  protected:
    DaemonBurstTest() { busOptions.idleExitSeconds = 1; }
};

struct Tally {
    int calls = 0;
    std::vector<std::string> failures;
};

// What the test tells the clients, in this order.
struct Phase {
    std::atomic<bool> go{false};         // the daemon is about to go idle: call without pause
    std::atomic<bool> restarted{false};  // a new daemon owns the name (or the wait gave up)
};

// One call, the kind chosen by turn; a wrong answer or an error counts as lost.
void callOnce(client::TavrixClient& caller, std::int32_t clientNumber, Tally& tally) {
    try {
        switch (tally.calls++ % 3) {
            case 0:
                if (caller.isTavrixBundleSupported()) {
                    tally.failures.push_back("IsTavrixBundleSupported answered true");
                }
                break;
            case 1:
                if (!caller.setClientType(clientNumber)) {
                    tally.failures.push_back("SetClientType answered false");
                }
                break;
            default:
                if (caller.copyTavrixValue("CarrierName")) {
                    tally.failures.push_back("CopyTavrixValue answered a value");
                }
                break;
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

TEST_F(DaemonBurstTest, NoCallIsLostAcrossAnIdleExit) {
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

    // Idle exit follows the end of the launch transaction by the grace period; the clients call
    // without pause from there until a new daemon has taken over.
    const bool launchEnded = waitForLogLine(kLaunchEnded, 20s);
    phase.go = true;
    phase.go.notify_all();
    const bool restarted =
        launchEnded &&
        watcher().waitUntil(
            [&] { return watcher().nameReleaseCount() >= 1 && !watcher().nameOwner().empty(); },
            20s);
    phase.restarted = true;
    for (std::thread& thread : threads) {
        thread.join();
    }

    ASSERT_TRUE(launchEnded);
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
