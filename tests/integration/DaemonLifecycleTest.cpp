// The daemon's life on the bus: started by the first call, held by its launch transaction and by
// calls, gone when idle; a daemon that cannot serve says why and fails.
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <thread>

#include "BusFixture.h"

namespace tavrix::integration {
namespace {

constexpr const char* kLaunchBegun =
    "*********** Beginning Corvex transaction : TXMinimumLaunchTransaction ***********";
constexpr const char* kLaunchEnded =
    "*********** Ended Corvex transaction : TXMinimumLaunchTransaction ***********";
constexpr const char* kStartedNotification = "TXDaemonStartedNotification";

class DaemonLifecycleTest : public BusFixture {
  protected:
    DaemonLifecycleTest() { idleExitSeconds = 1; }

    // Position of the first whole line equal to text, or the line count when there is none.
    std::size_t lineIndex(const std::string& text) const {
        auto lines = daemonLogLines();
        return static_cast<std::size_t>(std::find(lines.begin(), lines.end(), text) -
                                        lines.begin());
    }
};

// One wait for the launch transaction covers the whole cycle: activation, the start-up order,
// staying for the transaction although idle exit is 1 s, and leaving with 0. (The next call
// starting the next daemon is the burst test's.)
TEST_F(DaemonLifecycleTest, StartsOnCallStaysForLaunchTransactionAndLeavesWhenIdle) {
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
}

// A keep-alive flag left set by an earlier run is seen at start and cleared once started. (SIGTERM
// with the launch transaction open, leaving with 0, is every test's teardown.)
TEST_F(DaemonLifecycleTest, KeepAliveLeftByEarlierRunIsCleared) {
    test::writeText(device().runtimeDirectory() / "keep-alive", "1");
    auto caller = client();
    EXPECT_TRUE(caller.setClientType(0));
    EXPECT_TRUE(waitForLogLine("Starting the server: keepAlive = ENABLED"));
    EXPECT_EQ(device().keepAliveFlag(), "0\n");
}

class DaemonActivityTest : public DaemonLifecycleTest {
  protected:
    DaemonActivityTest() { idleExitSeconds = 2; }
};

// A client calling once a second, from before the launch transaction ends until well past it,
// keeps the one daemon: the grace runs from the last call. Once the calls stop, it leaves.
TEST_F(DaemonActivityTest, CallsOnceASecondKeepOneDaemonAlivePastTheGrace) {
    auto caller = client();
    EXPECT_FALSE(caller.isTavrixBundleSupported());
    const auto pid = daemonPid();
    ASSERT_TRUE(pid);
    for (int second = 0; second < 15; ++second) {
        std::this_thread::sleep_for(1s);
        EXPECT_TRUE(caller.setClientType(second));
    }
    EXPECT_EQ(countLogLines(kLaunchEnded), 1);
    EXPECT_EQ(daemonPid(), pid);
    EXPECT_EQ(daemonLaunches().size(), 1u);

    EXPECT_TRUE(waitForNoNameOwner(10s));
    EXPECT_EQ(waitForDaemonExit(*pid), std::optional<int>(0));
}

// A daemon that cannot serve (no bus to reach, an instance lock that is a link or someone else's
// file, or its name already owned on the bus) logs why and exits with a failure, so that the
// service manager's restart policy acts.
TEST_F(DaemonLifecycleTest, DaemonThatCannotServeExitsWithAFailure) {
    auto runDaemon = [&](const std::string& busAddress) {
        return runCommand({"/usr/bin/env", "-i", "TAVRIX_ROOT=" + device().root().string(),
                           "RUNTIME_DIRECTORY=" + device().runtimeDirectory().string(),
                           "TAVRIX_LOG_STDERR=1", "TAVRIX_IDLE_EXIT_SEC=1",
                           "DBUS_SYSTEM_BUS_ADDRESS=" + busAddress, TAVRIX_DAEMON_PATH});
    };

    const std::string nowhere = "unix:path=" + (device().base() / "no-bus-here").string();
    CommandResult unreachable = runDaemon(nowhere);
    EXPECT_EQ(unreachable.status, 1);
    EXPECT_NE(unreachable.output.find("Cannot connect to the bus for com.zandor.tavrixservicesd"),
              std::string::npos)
        << unreachable.output;

    // A planted lock is never followed, opened or waited for.
    const auto lock = device().runtimeDirectory() / "instance.lock";
    const auto elsewhere = device().base() / "not-the-lock";
    std::filesystem::create_directories(device().runtimeDirectory());
    test::writeText(elsewhere, "kept");
    std::filesystem::remove(lock);
    std::filesystem::create_symlink(elsewhere, lock);
    CommandResult linked = runDaemon(busAddress());
    EXPECT_EQ(linked.status, 1);
    EXPECT_NE(linked.output.find("Cannot open the instance lock"), std::string::npos)
        << linked.output;
    EXPECT_EQ(test::readText(elsewhere), "kept");
    std::filesystem::remove(lock);
    if (::geteuid() == 0) {
        test::writeText(lock, "");
        ASSERT_EQ(::chown(lock.c_str(), 65534, 65534), 0);
        CommandResult foreign = runDaemon(busAddress());
        EXPECT_EQ(foreign.status, 1);
        EXPECT_NE(foreign.output.find("is not a file of this daemon's user"), std::string::npos)
            << foreign.output;
        std::filesystem::remove(lock);
    }

    auto squatter = rawConnection();
    ASSERT_GE(sd_bus_request_name(squatter.get(), kDaemonBusName, 0), 0);
    CommandResult taken = runDaemon(busAddress());
    EXPECT_EQ(taken.status, 1);
    EXPECT_NE(taken.output.find(
                  "The name com.zandor.tavrixservicesd is owned by another process on the bus"),
              std::string::npos)
        << taken.output;
    EXPECT_EQ(daemonLaunches().size(), 0u);
}

}  // namespace
}  // namespace tavrix::integration
