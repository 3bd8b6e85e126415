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

// Calls keep a daemon from going idle, so it is told to leave (SIGTERM, which leaves the way an
// idle exit does) while the clients call back to back; each call's kind is chosen by turn, and a
// wrong answer or an error counts as lost.
TEST_F(DaemonBurstTest, NoCallIsLostWhileTheDaemonLeaves) {
    constexpr int kClients = 8;
    constexpr int kCallsAfterRestart = 20;
    std::atomic<bool> go{false};         // the daemon is about to leave: call without pause
    std::atomic<bool> restarted{false};  // a new daemon owns the name (or the wait gave up)
    std::vector<int> calls(kClients);
    std::vector<std::vector<std::string>> lost(kClients);
    auto runClient = [&](client::TavrixClient caller, int number) {
        auto callOnce = [&] {
            const int kind = calls[number]++ % 3;
            try {
                if (kind == 0   ? caller.isTavrixBundleSupported()
                    : kind == 1 ? !caller.setClientType(number)
                                : caller.copyTavrixValue("CarrierName").has_value()) {
                    lost[number].push_back("wrong answer to call kind " + std::to_string(kind));
                }
            } catch (const client::ClientError& error) {
                lost[number].push_back(error.what());
            }
        };
        callOnce();  // a client of the first daemon
        go.wait(false);
        while (!restarted.load()) {
            callOnce();
        }
        for (int i = 0; i < kCallsAfterRestart; ++i) {
            callOnce();
        }
    };
    std::vector<std::thread> threads;
    for (int i = 0; i < kClients; ++i) {
        threads.emplace_back(runClient, client(), i);
    }

    const bool started = waitForNameOwner();
    const auto first = daemonPid();
    go = true;
    go.notify_all();
    std::this_thread::sleep_for(100ms);  // the clients are calling without pause by now
    const bool signalled = first && ::kill(*first, SIGTERM) == 0;
    const bool cameBack =
        signalled &&
        watcher().waitUntil(
            [&] { return watcher().nameReleaseCount() >= 1 && !watcher().nameOwner().empty(); },
            20s);
    restarted = true;
    for (std::thread& thread : threads) {
        thread.join();
    }

    ASSERT_TRUE(started && signalled);
    EXPECT_TRUE(cameBack) << "the daemon did not leave and come back while clients called";
    for (int i = 0; i < kClients; ++i) {
        EXPECT_TRUE(lost[i].empty()) << "client " << i << " lost " << lost[i].size() << " of "
                                     << calls[i] << " calls, first: " << lost[i].front();
    }
    EXPECT_GE(daemonLaunches().size(), 2u);
}

}  // namespace
}  // namespace tavrix::integration
