// busctl monitor on the test's bus, in the background, with its JSON read by a JSON library: what
// a program the project did not write sees of the daemon's signals. Waits on busctl's output,
// which follows the bus; the timeouts only bound a failing test.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

#include "io/UniqueFd.h"

namespace tavrix::integration {

class BusMonitor {
  public:
    // Monitors the signals that match any of the rules; returns once busctl sees the bus.
    BusMonitor(const std::string& address, const std::vector<std::string>& matches);
    ~BusMonitor();
    BusMonitor(const BusMonitor&) = delete;
    BusMonitor& operator=(const BusMonitor&) = delete;

    // The next message after the last one returned that satisfies matches, or nothing when none
    // came within timeout.
    std::optional<nlohmann::json> next(const std::function<bool(const nlohmann::json&)>& matches,
                                       std::chrono::milliseconds timeout);
    // Every message seen so far.
    const std::vector<nlohmann::json>& messages() const { return messages_; }

    // A PropertiesChanged of the daemon's status interface: its changed values as busctl's JSON
    // ("BehaviorID" to "acme.default", "Supported" to true), or nothing for other messages.
    static std::optional<nlohmann::json> changedStatus(const nlohmann::json& message);
    // Follows PropertiesChanged of the status until each expected value has been announced
    // (changes may come in more than one signal): what was announced since the call, or nothing
    // (a test failure) when the wait ran out.
    std::optional<nlohmann::json> waitForStatus(
        const nlohmann::json& expected,
        std::chrono::milliseconds timeout = std::chrono::seconds(30));
    // The arguments of the next UpdateCheckFinished, or nothing when none came within timeout.
    std::optional<nlohmann::json> nextCheckFinished(std::chrono::milliseconds timeout);

    // The arguments of a signal of the status interface named member, or nothing.
    static std::optional<nlohmann::json> statusSignal(const nlohmann::json& message,
                                                      const std::string& member);

  private:
    // Reads what busctl wrote until timeout; false when it wrote nothing more.
    bool readMore(std::chrono::milliseconds timeout);

    std::string address_;
    pid_t pid_ = -1;
    io::UniqueFd output_;
    std::string partial_;
    std::vector<nlohmann::json> messages_;
    std::size_t cursor_ = 0;
};

}  // namespace tavrix::integration
