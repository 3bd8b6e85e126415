#include "BusMonitor.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <stdexcept>

#include "PrivateBus.h"

namespace tavrix::integration {
namespace {

using namespace std::chrono_literals;

constexpr const char* kStatusInterface = "com.zandor.TXManagerStatusInterface";
constexpr const char* kMarkerPath = "/com/zandor/test/monitorready";

}  // namespace

BusMonitor::BusMonitor(const std::string& address, const std::vector<std::string>& matches)
    : address_(address) {
    int ends[2];
    if (::pipe2(ends, O_CLOEXEC) != 0) {
        throw std::runtime_error("pipe2 failed");
    }
    output_.reset(ends[0]);
    io::UniqueFd writeEnd(ends[1]);
    std::vector<std::string> argv = {
        "/usr/bin/busctl", "--address=" + address, "--json=short", "monitor",
        "--match=type='signal',path='" + std::string(kMarkerPath) + "'"};
    for (const std::string& match : matches) {
        argv.push_back("--match=" + match);
    }
    std::vector<char*> arguments;
    for (std::string& argument : argv) {
        arguments.push_back(argument.data());
    }
    arguments.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_adddup2(&actions, writeEnd.get(), 1);
    const int spawned =
        ::posix_spawn(&pid_, arguments[0], &actions, nullptr, arguments.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (spawned != 0) {
        pid_ = -1;
        throw std::runtime_error("cannot start busctl monitor");
    }
    writeEnd.reset();
    // busctl becomes a monitor some time after it starts: a marker is sent until it shows one.
    auto isMarker = [](const nlohmann::json& message) {
        return message.value("path", "") == kMarkerPath;
    };
    if (!test::pollUntil(
            [&] {
                test::runCommand({"/usr/bin/busctl", "--address=" + address, "emit", kMarkerPath,
                                  "com.zandor.Test", "Ready"});
                return next(isMarker, 200ms).has_value();
            },
            10s, [](auto) { return true; })) {
        throw std::runtime_error("busctl monitor never saw the bus");
    }
}

BusMonitor::~BusMonitor() {
    if (pid_ > 0) {
        ::kill(pid_, SIGTERM);
        int status = 0;
        while (::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
        }
    }
}

bool BusMonitor::readMore(std::chrono::milliseconds timeout) {
    pollfd ready{output_.get(), POLLIN, 0};
    if (::poll(&ready, 1, static_cast<int>(timeout.count())) <= 0) {
        return false;
    }
    char buffer[4096];
    const ssize_t got = ::read(output_.get(), buffer, sizeof buffer);
    if (got <= 0) {
        return false;
    }
    partial_.append(buffer, static_cast<std::size_t>(got));
    for (std::size_t end; (end = partial_.find('\n')) != std::string::npos;) {
        const std::string line = partial_.substr(0, end);
        partial_.erase(0, end + 1);
        messages_.push_back(nlohmann::json::parse(line));
    }
    return true;
}

std::optional<nlohmann::json> BusMonitor::next(
    const std::function<bool(const nlohmann::json&)>& matches, std::chrono::milliseconds timeout) {
    std::optional<nlohmann::json> found;
    test::pollUntil(
        [&] {
            while (!found && cursor_ < messages_.size()) {
                const nlohmann::json& message = messages_[cursor_++];
                found = matches(message) ? std::optional(message) : std::nullopt;
            }
            return found.has_value();
        },
        timeout, [&](std::chrono::milliseconds left) { return readMore(left); });
    return found;
}

std::optional<nlohmann::json> BusMonitor::waitForStatus(const nlohmann::json& expected,
                                                        std::chrono::milliseconds timeout) {
    nlohmann::json announced = nlohmann::json::object();
    auto complete = [&] {
        for (const auto& [name, value] : expected.items()) {
            if (!announced.contains(name) || announced[name] != value) {
                return false;
            }
        }
        return true;
    };
    // One message at a time, so that what follows the last one expected stays unread.
    auto takeAnnounced = [&] {
        while (!complete()) {
            auto message = next([](auto& m) { return changedStatus(m).has_value(); }, 0ms);
            if (!message) {
                return false;
            }
            announced.update(*changedStatus(*message));
        }
        return true;
    };
    if (!test::pollUntil(takeAnnounced, timeout, [&](auto left) { return readMore(left); })) {
        ADD_FAILURE() << "announced " << announced.dump() << ", expected " << expected.dump();
        return std::nullopt;
    }
    return announced;
}

std::optional<nlohmann::json> BusMonitor::nextCheckFinished(std::chrono::milliseconds timeout) {
    auto message = next(
        [](const nlohmann::json& m) { return statusSignal(m, "UpdateCheckFinished").has_value(); },
        timeout);
    return message ? statusSignal(*message, "UpdateCheckFinished") : std::nullopt;
}

std::optional<nlohmann::json> BusMonitor::changedStatus(const nlohmann::json& message) {
    if (message.value("member", "") != "PropertiesChanged" ||
        message.value("path", "") != "/com/zandor/tavrixservicesd") {
        return std::nullopt;
    }
    const nlohmann::json& data = message["payload"]["data"];
    if (data.size() != 3 || data[0] != kStatusInterface) {
        return std::nullopt;
    }
    nlohmann::json values = nlohmann::json::object();
    for (const auto& [name, variant] : data[1].items()) {
        values[name] = variant["data"];
    }
    return values;
}

std::optional<nlohmann::json> BusMonitor::statusSignal(const nlohmann::json& message,
                                                       const std::string& member) {
    if (message.value("interface", "") != kStatusInterface ||
        message.value("member", "") != member) {
        return std::nullopt;
    }
    return message["payload"]["data"];
}

}  // namespace tavrix::integration
