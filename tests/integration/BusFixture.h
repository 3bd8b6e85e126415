// The fixture of the integration tests: a device root in a temporary directory, a private bus
// that starts the real daemon on demand, and the test's own connection watching the bus. When a
// test fails, the log is printed; afterwards every daemon is stopped (each must exit with 0).
#pragma once

#include <gtest/gtest.h>
#include <sys/types.h>

#include <chrono>
#include <cstdlib>
#include <functional>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "LocalHttpServer.h"
#include "PrivateBus.h"
#include "client/TavrixClient.h"
#include "plist/Value.h"

namespace tavrix::integration {

using namespace std::chrono_literals;
using test::CommandResult;
using test::pollUntil;
using test::runCommand;
using test::writeBundle;

inline constexpr const char* kDaemonBusName = "com.zandor.tavrixservicesd";
inline constexpr const char* kDaemonObjectPath = "/com/zandor/tavrixservicesd";
inline constexpr const char* kDaemonInterface = "com.zandor.TXManagerServerInterface";
inline constexpr const char* kStatusInterface = "com.zandor.TXManagerStatusInterface";
inline constexpr const char* kChanged = "kTVXBehaviorBundleChangedNotification";
// Paths of the device.
inline constexpr const char* kSystemBundle = "/System/Library/TavrixBundles/Tablet/Default.bundle";
inline constexpr const char* kUserBundle = "/var/mobile/Library/TavrixBundles/Default.bundle";
inline constexpr const char* kOverlayDirectory = "/var/mobile/Library/TavrixBundles/Overlay";
inline constexpr const char* kBundleLink = "/var/mobile/Library/Tavrix.bundle";
inline constexpr const char* kPreferencesLink =
    "/var/mobile/Library/Preferences/com.zandor.tavrix.plist";

// Iterations of the crash loops: TAVRIX_CRASH_LOOP_ITERATIONS when set (scripts/crash-loop.sh),
// else enough for the test to run well under a minute.
inline int crashLoopIterations() {
    const char* text = std::getenv("TAVRIX_CRASH_LOOP_ITERATIONS");
    return text != nullptr && std::atoi(text) > 0 ? std::atoi(text) : 30;
}

// command run through setpriv as user (uid, gid), without supplementary groups.
inline std::vector<std::string> asUser(std::pair<uid_t, gid_t> user,
                                       std::vector<std::string> command) {
    command.insert(command.begin(), {"/usr/bin/setpriv", "--reuid=" + std::to_string(user.first),
                                     "--regid=" + std::to_string(user.second), "--clear-groups"});
    return command;
}

// A device image: the root the daemon runs under, its runtime directory, and the files the tests
// prepare or inspect. "mobile" is the test's own user (home /var/mobile); no cellular radio.
class DeviceRoot {
  public:
    DeviceRoot();

    // The temporary directory holding the root, the run directory and the tests' own files.
    const std::filesystem::path& base() const { return base_.path(); }
    std::filesystem::path root() const { return base() / "root"; }
    std::filesystem::path runtimeDirectory() const { return base() / "run"; }
    // absolutePath of the device, under the root.
    std::filesystem::path path(std::string_view absolutePath) const {
        return root() / std::filesystem::path(absolutePath).relative_path();
    }

    // Everything the device information service is asked for, so that no answer comes from the
    // machine running the tests.
    void writeDeviceInfo(bool cellularRadio = false,
                         const std::string& serialNumber = "TESTSERIAL01");
    // The daemon's own preferences and the behavior settings domain of the mobile user.
    void writeDaemonPreferences(const plist::Dictionary& values) {
        writePropertyList(kDaemonPreferences, values);
    }
    Result<plist::Value> readDaemonPreferences() const {
        return plist::readFile(path(kDaemonPreferences).string());
    }
    // One key of the daemon's preferences, or nothing.
    std::optional<plist::Value> daemonPreference(const std::string& key) const {
        auto preferences = readDaemonPreferences();
        const plist::Value* value = preferences ? preferences->find(key) : nullptr;
        return value != nullptr ? std::optional(*value) : std::nullopt;
    }
    void writeBehaviorSettings(const plist::Dictionary& values) {
        writePropertyList(kPreferencesLink, values);
    }
    // The keep-alive flag file's text, "" when there is none.
    std::string keepAliveFlag() const { return test::readText(runtimeDirectory() / "keep-alive"); }

  private:
    static constexpr const char* kDaemonPreferences =
        "/var/mobile/Library/Preferences/com.zandor.tavrixservices.plist";
    // In one step, so that the daemon never reads half of the file and its cache sees a new one.
    void writePropertyList(std::string_view absolutePath, const plist::Dictionary& values);

    test::TempDir base_;
};

// The test's own connection: who owns the daemon's name, which notifications were posted, and the
// status signals, decoded here rather than by the daemon's codec. Everything waits on the bus
// itself, never on the clock alone.
class BusWatcher {
  public:
    explicit BusWatcher(const std::string& address);

    // Handles what has arrived, then waits for more until done() holds or the timeout passes.
    bool waitUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout);
    // The daemon's unique name, "" while the name has no owner.
    const std::string& nameOwner() const { return owner_; }
    // How often the name was released since the watcher started.
    int nameReleaseCount() const { return releases_; }
    int notificationCount(const std::string& name) const {
        auto found = notifications_.find(name);
        return found == notifications_.end() ? 0 : found->second;
    }
    bool waitForNotification(const std::string& name, int count,
                             std::chrono::milliseconds timeout) {
        return waitUntil([&] { return notificationCount(name) >= count; }, timeout);
    }
    // Follows the status's PropertiesChanged until each expected value has been announced
    // (changes may come in more than one signal): what was announced since the call ("Supported"
    // to true), or nothing, a test failure, when the wait ran out.
    std::optional<nlohmann::json> waitForStatus(const nlohmann::json& expected,
                                                std::chrono::milliseconds timeout = 30s);
    // The arguments of the next UpdateCheckFinished after the last status signal taken, or
    // nothing when none came within timeout.
    std::optional<nlohmann::json> nextCheckFinished(std::chrono::milliseconds timeout);
    sd_bus* bus() const { return bus_.get(); }

  private:
    static int onNameOwnerChanged(sd_bus_message* message, void* self, sd_bus_error*);
    static int onPosted(sd_bus_message* message, void* self, sd_bus_error*);
    static int onStatusSignal(sd_bus_message* message, void* self, sd_bus_error*);
    // The next status signal that is a check's end (or a change), taken once it has arrived.
    std::optional<nlohmann::json> takeStatusSignal(bool checkFinished);

    bus::BusPtr bus_;
    std::vector<bus::BusSlotPtr> slots_;
    std::string owner_;
    int releases_ = 0;
    std::map<std::string, int> notifications_;
    // In arrival order: a change as {"changed": values}, a check's end as {"finished": arguments}.
    std::vector<nlohmann::json> statusSignals_;
    std::size_t statusTaken_ = 0;
};

class BusFixture : public ::testing::Test {
  protected:
    void SetUp() override;
    void TearDown() override;

    DeviceRoot& device() { return device_; }
    std::filesystem::path at(std::string_view absolutePath) const {
        return device_.path(absolutePath);
    }
    // Where the device's link at absolutePath points, or "" when it is no link.
    std::string linkTarget(std::string_view absolutePath) const;
    // "links agree" when both links resolve and the carrier file lies in the linked bundle or
    // among the generated files; else "links dangle" or "links disagree".
    std::string linkState() const;
    // The version of the bundle the bundle link points at, or "".
    std::string linkedVersion() const;
    // The directory's content packed by bsdtar with these options, as a sender packs a bundle.
    std::vector<std::uint8_t> pack(const std::filesystem::path& directory,
                                   const std::vector<std::string>& options = {"-z"}) const;
    // A bundle of this version under the test's directory: "Bundle <version>" its carrier name,
    // one file of its own and, when asked, a large file of bulkBytes that does not compress.
    std::filesystem::path writeVersionedBundle(const std::string& version,
                                               std::size_t bulkBytes = 0) const;
    // The catalog site the device trusts, made on first use: a signing key of its own, the site
    // directory served on 127.0.0.1 under /updates/, and the device's catalog settings naming it
    // with the key in the single-key form.
    test::LocalHttpServer& catalogServer();
    std::filesystem::path site() const { return device_.base() / "site"; }
    // Publishes the bundle directory, signed, as the only asset of the catalog; answers the URL
    // path of its archive.
    std::string publishSigned(const std::filesystem::path& bundle);
    // The device's catalog settings: the bundle type at the site, with these settings (keys).
    void writeCatalogSettings(plist::Dictionary typeSettings);
    // The site's file at urlPath served held after that part of its bytes, until released.
    void holdPublished(const std::string& urlPath, double part);
    const std::string& busAddress() const { return bus_->address(); }
    // Ends the bus, as a restart of the system bus would; the daemons' launch records stay.
    void stopBus() { bus_->stop(); }
    BusWatcher& watcher() { return *watcher_; }
    // A new client of the daemon with a connection of its own.
    client::TavrixClient client() const {
        return client::TavrixClient::connectToAddress(busAddress());
    }
    CommandResult tavrixctl(std::vector<std::string> arguments) const {
        arguments.insert(arguments.begin(), {TAVRIX_CTL_PATH, "--address", busAddress()});
        return runCommand(arguments);
    }
    // tavrixctl's answer, with the line input (if any) as its standard input, and Python's
    // expression applied to the parsed JSON as "answer"; the exit status is tavrixctl's.
    CommandResult throughPython(const std::vector<std::string>& arguments,
                                const std::string& expression,
                                const std::string& input = "") const {
        std::string line = "set -o pipefail; " + (input.empty() ? "" : "echo '" + input + "' | ") +
                           "'" + TAVRIX_CTL_PATH + "' --address='" + busAddress() + "'";
        for (const std::string& argument : arguments) {
            line += " '" + argument + "'";
        }
        line += " | /usr/bin/python3 -c 'import json, sys; answer = json.load(sys.stdin); print(" +
                expression + ")'";
        return runCommand({"/bin/bash", "-c", line});
    }

    bool waitForNameOwner(std::chrono::milliseconds timeout = 10s) {
        return watcher_->waitUntil([this] { return !watcher_->nameOwner().empty(); }, timeout);
    }
    bool waitForNoNameOwner(std::chrono::milliseconds timeout = 10s) {
        return watcher_->waitUntil([this] { return watcher_->nameOwner().empty(); }, timeout);
    }
    // The process that owns the daemon's name now.
    std::optional<pid_t> daemonPid();
    // SIGTERM to the daemon that owns the name: its pid once it has left with 0, else nothing.
    std::optional<pid_t> stopDaemon(std::chrono::milliseconds timeout = 10s);

    // The log's lines, in order.
    std::vector<std::string> daemonLogLines() const;
    // How often text is a whole line of the log, or (whole false) part of one.
    int countLogLines(const std::string& text, bool whole = true) const;
    int countLogLinesContaining(const std::string& text) const {
        return countLogLines(text, false);
    }
    // Waits until line has appeared count times (the log is a file, so this polls it).
    bool waitForLogLine(const std::string& line, std::chrono::milliseconds timeout = 10s,
                        int count = 1) const;

    // The exit status of the daemon process pid once it has ended, or nothing at the timeout.
    std::optional<int> waitForDaemonExit(pid_t pid, std::chrono::milliseconds timeout = 10s) const;
    std::vector<test::DaemonLaunch> daemonLaunches() const { return bus_->launches(); }
    // Kills the daemon process pid with SIGKILL, as a power cut would end it, and waits for it to
    // end; that daemon is then not expected to exit with 0. False when it did not end.
    bool killDaemon(pid_t pid);

    // Set by a derived fixture's constructor (or SetUp, before calling this one's).
    int idleExitSeconds = 30;
    std::optional<std::filesystem::path> policyFile;
    std::vector<std::string> daemonLaunchPrefix;

  private:
    DeviceRoot device_;
    std::set<pid_t> killed_;
    std::unique_ptr<test::PrivateBus> bus_;
    std::unique_ptr<BusWatcher> watcher_;
    std::optional<test::LocalHttpServer> catalogServer_;
};

}  // namespace tavrix::integration
