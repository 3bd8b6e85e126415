// The daemon's life on the bus: started by the first call, held by its launch transaction and by
// calls, gone when idle, every call answered across a restart; its clients counted in and out; a
// daemon that cannot serve says why and fails.
#include <gmock/gmock.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <thread>
#include <vector>

#include "BusFixture.h"

namespace tavrix::integration {
namespace {

using ::testing::HasSubstr;

constexpr const char* kLaunchBegun =
    "*********** Beginning Corvex transaction : TXMinimumLaunchTransaction ***********";
constexpr const char* kLaunchEnded =
    "*********** Ended Corvex transaction : TXMinimumLaunchTransaction ***********";
constexpr const char* kStartedNotification = "TXDaemonStartedNotification";

class DaemonLifecycleTest : public BusFixture {
  protected:
    DaemonLifecycleTest() { idleExitSeconds = 2; }

    // Position of the first whole line equal to text, or the line count when there is none.
    std::size_t lineIndex(const std::string& text) const {
        auto lines = daemonLogLines();
        return static_cast<std::size_t>(std::find(lines.begin(), lines.end(), text) -
                                        lines.begin());
    }
};

// Activation, the start-up order, staying for the launch transaction although idle exit is 2 s,
// and leaving with 0. Then calls once a second keep one daemon past the launch transaction: the
// grace runs from the last call. A keep-alive flag left set by an earlier run is seen at start and
// cleared once started. A daemon whose bus goes can be called no more: it leaves at once, with 0,
// rather than after its launch transaction and grace.
TEST_F(DaemonLifecycleTest, StartsOnCallStaysWhileNeededAndLeavesWhenIdleOrItsBusGoes) {
    ASSERT_TRUE(watcher().nameOwner().empty());
    auto caller = client();
    EXPECT_FALSE(caller.isTavrixBundleSupported());
    ASSERT_TRUE(waitForNameOwner());
    const auto firstPid = daemonPid();
    ASSERT_TRUE(firstPid);
    EXPECT_TRUE(watcher().waitForNotification(kStartedNotification, 1, 5s));

    // The launch transaction is open before the start is announced.
    EXPECT_LT(lineIndex("Starting the server: keepAlive = DISABLED"), lineIndex(kLaunchBegun));
    EXPECT_LT(lineIndex(kLaunchBegun), lineIndex("Notifying observers of start"));

    ASSERT_TRUE(waitForLogLine(kLaunchEnded, 20s));
    watcher().waitUntil([] { return false; }, 0ms);  // take in what the bus has reported so far
    EXPECT_EQ(watcher().nameReleaseCount(), 0) << "left while the launch transaction was open";

    ASSERT_TRUE(waitForNoNameOwner(10s));
    EXPECT_EQ(waitForDaemonExit(*firstPid), std::optional<int>(0));

    test::writeText(device().runtimeDirectory() / "keep-alive", "1");
    EXPECT_FALSE(caller.isTavrixBundleSupported());
    const auto pid = daemonPid();
    ASSERT_TRUE(pid);
    for (int second = 0; second < 15; ++second) {
        std::this_thread::sleep_for(1s);
        EXPECT_TRUE(caller.setClientType(second));
    }
    EXPECT_EQ(countLogLines(kLaunchEnded), 2);
    EXPECT_EQ(countLogLines("Starting the server: keepAlive = ENABLED"), 1);
    EXPECT_EQ(device().keepAliveFlag(), "0\n");
    EXPECT_EQ(daemonPid(), pid);
    EXPECT_EQ(daemonLaunches().size(), 2u);
    EXPECT_TRUE(waitForNoNameOwner(10s));
    EXPECT_EQ(waitForDaemonExit(*pid), std::optional<int>(0));

    caller.isTavrixBundleSupported();
    const auto last = daemonPid();
    ASSERT_TRUE(last);
    stopBus();
    EXPECT_EQ(waitForDaemonExit(*last, 5s), std::optional<int>(0));
    EXPECT_EQ(countLogLines("The bus connection is gone; leaving"), 1);
}

// A daemon that cannot serve logs why and exits with a failure, so that the service manager's
// restart policy acts.
TEST_F(DaemonLifecycleTest, DaemonThatCannotServeExitsWithAFailure) {
    // Runs the daemon on the bus at address: it must fail, saying why.
    auto expectFailure = [&](const std::string& address, const std::string& why) {
        CommandResult run = runCommand(
            {"/usr/bin/env", "-i", "TAVRIX_ROOT=" + device().root().string(),
             "RUNTIME_DIRECTORY=" + device().runtimeDirectory().string(), "TAVRIX_LOG_STDERR=1",
             "TAVRIX_IDLE_EXIT_SEC=1", "DBUS_SYSTEM_BUS_ADDRESS=" + address, TAVRIX_DAEMON_PATH});
        EXPECT_EQ(run.status, 1);
        EXPECT_THAT(run.output, HasSubstr(why));
    };
    expectFailure("unix:path=" + (device().base() / "no-bus-here").string(),
                  "Cannot connect to the bus for com.zandor.tavrixservicesd");

    // A planted lock is never followed, opened or waited for.
    const auto lock = device().runtimeDirectory() / "instance.lock";
    const auto elsewhere = device().base() / "not-the-lock";
    test::writeText(elsewhere, "kept");
    std::filesystem::remove(lock);  // the one the first run made
    std::filesystem::create_symlink(elsewhere, lock);
    expectFailure(busAddress(), "Cannot open the instance lock");
    EXPECT_EQ(test::readText(elsewhere), "kept");
    std::filesystem::remove(lock);
    if (::geteuid() == 0) {
        test::writeText(lock, "");
        ASSERT_EQ(::chown(lock.c_str(), 65534, 65534), 0);
        expectFailure(busAddress(), "is not a file of this daemon's user");
        std::filesystem::remove(lock);
    }

    auto squatter = test::connectToBus(busAddress());
    ASSERT_GE(sd_bus_request_name(squatter.get(), kDaemonBusName, 0), 0);
    expectFailure(busAddress(),
                  "The name com.zandor.tavrixservicesd is owned by another process on the bus");
    EXPECT_EQ(daemonLaunches().size(), 0u);
}

// Peers are accepted on their first call and removed when they leave the bus. Clients calling back
// to back while the daemon leaves (SIGTERM, as an idle exit leaves) and the bus starts the next
// one: every call gets its answer, whichever daemon gives it.
TEST_F(DaemonLifecycleTest, ClientsAreCountedInAndOutAndNoCallIsLostWhileTheDaemonLeaves) {
    // Clients have no identifier the platform vouches for: nothing a caller chooses reaches the
    // log.
    const std::string name = "(null)";
    std::optional<client::TavrixClient> firstClient(client());
    EXPECT_TRUE(firstClient->setClientType(0));
    EXPECT_TRUE(waitForLogLine("Added client: " + name + ", count: 1"));
    {
        auto second = client();
        EXPECT_TRUE(second.setClientType(-7));
        EXPECT_TRUE(second.setClientType(INT32_MAX));
        EXPECT_TRUE(waitForLogLine("Added client: " + name + ", count: 2"));
    }
    EXPECT_TRUE(waitForLogLine("Removed client: " + name + ", count: 1"));
    firstClient.reset();
    EXPECT_TRUE(waitForLogLine("Removed client: " + name + ", count: 0"));
    // A later call of a known client is not a new acceptance.
    EXPECT_EQ(countLogLines("Added client: " + name + ", count: 3"), 0);
    EXPECT_EQ(countLogLines("*********** Beginning Corvex transaction : TXAddClientTransaction "
                            "***********"),
              2);

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
