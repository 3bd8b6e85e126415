#include "BusFixture.h"

#include <signal.h>

#include <iostream>
#include <set>
#include <sstream>
#include <thread>

namespace tavrix::integration {
namespace {

using Clock = std::chrono::steady_clock;

// The log and the launch records are files written by other processes: they are polled.
constexpr auto kFilePollInterval = 20ms;
constexpr auto kStopTimeout = 10s;

}  // namespace

void BusFixture::SetUp() {
    bus_ = std::make_unique<PrivateBus>(device_, busOptions);
    watcher_ = std::make_unique<BusWatcher>(bus_->address());
}

void BusFixture::TearDown() {
    if (bus_ != nullptr) {
        stopDaemons();
        if (HasFailure()) {
            std::cerr << "----- daemon log (" << bus_->logPath().string() << ") -----\n"
                      << bus_->log() << "----- end of daemon log -----\n";
        }
    }
    watcher_.reset();
    bus_.reset();
}

void BusFixture::stopDaemons() {
    std::set<pid_t> running;
    for (const DaemonLaunch& launch : bus_->launches()) {
        if (!launch.exitStatus) {
            running.insert(launch.pid);
        }
    }
    for (pid_t pid : running) {
        ::kill(pid, SIGTERM);
    }
    for (pid_t pid : running) {
        if (!waitForDaemonExit(pid, kStopTimeout)) {
            ADD_FAILURE() << "daemon " << pid << " did not leave after SIGTERM";
            ::kill(pid, SIGKILL);
        }
    }
    for (const DaemonLaunch& launch : bus_->launches()) {
        if (killed_.contains(launch.pid)) {
            continue;
        }
        EXPECT_EQ(launch.exitStatus, std::optional<int>(0))
            << "daemon " << launch.pid << " exited with an unexpected status";
    }
}

bool BusFixture::killDaemon(pid_t pid) {
    killed_.insert(pid);
    return ::kill(pid, SIGKILL) == 0 && waitForDaemonExit(pid).has_value();
}

std::vector<std::string> BusFixture::daemonLogLines() const {
    std::vector<std::string> lines;
    std::istringstream in(bus_->log());
    for (std::string line; std::getline(in, line);) {
        lines.push_back(std::move(line));
    }
    return lines;
}

int BusFixture::countLogLines(const std::string& line) const {
    int count = 0;
    for (const std::string& candidate : daemonLogLines()) {
        count += candidate == line ? 1 : 0;
    }
    return count;
}

bool BusFixture::waitForLogLine(const std::string& line, std::chrono::milliseconds timeout,
                                int count) const {
    const auto deadline = Clock::now() + timeout;
    while (countLogLines(line) < count) {
        if (Clock::now() > deadline) {
            return false;
        }
        std::this_thread::sleep_for(kFilePollInterval);
    }
    return true;
}

std::optional<int> BusFixture::waitForDaemonExit(pid_t pid,
                                                 std::chrono::milliseconds timeout) const {
    const auto deadline = Clock::now() + timeout;
    for (;;) {
        for (const DaemonLaunch& launch : bus_->launches()) {
            if (launch.pid == pid && launch.exitStatus) {
                return launch.exitStatus;
            }
        }
        if (Clock::now() > deadline) {
            return std::nullopt;
        }
        std::this_thread::sleep_for(kFilePollInterval);
    }
}

}  // namespace tavrix::integration
