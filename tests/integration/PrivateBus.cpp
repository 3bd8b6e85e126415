#include "PrivateBus.h"

#include <map>
#include <sstream>

#include "TestSupport.h"

extern char** environ;

namespace tavrix::integration {
namespace {

namespace fs = std::filesystem;

std::string quoted(const fs::path& path) {
    return "'" + path.string() + "'";
}

// The rules of the system bus's default context: nothing may be owned or called unless a policy
// file opens it; signals and replies pass.
constexpr const char* kSystemDefaultPolicy = R"(  <policy context="default">
    <allow user="*"/>
    <deny own="*"/>
    <deny send_type="method_call"/>
    <allow send_type="signal"/>
    <allow send_requested_reply="true" send_type="method_return"/>
    <allow send_requested_reply="true" send_type="error"/>
    <allow receive_type="method_call"/>
    <allow receive_type="method_return"/>
    <allow receive_type="error"/>
    <allow receive_type="signal"/>
    <allow send_destination="org.freedesktop.DBus" send_interface="org.freedesktop.DBus"/>
    <allow send_destination="org.freedesktop.DBus"
           send_interface="org.freedesktop.DBus.Introspectable"/>
  </policy>
)";

// The environment of the bus and so of the daemon: the test's own, without anything that could
// point the daemon at another bus or another root.
std::vector<std::string> busEnvironment() {
    std::vector<std::string> result;
    for (char** entry = environ; *entry != nullptr; ++entry) {
        std::string_view text(*entry);
        if (!text.starts_with("DBUS_") && !text.starts_with("TAVRIX_") &&
            !text.starts_with("RUNTIME_DIRECTORY=")) {
            result.emplace_back(text);
        }
    }
    return result;
}

}  // namespace

PrivateBus::PrivateBus(const DeviceRoot& device, const BusOptions& options)
    : directory_(device.base() / "bus"),
      logPath_(device.base() / "daemon.log"),
      launchesPath_(directory_ / "launches") {
    fs::create_directories(directory_ / "services");
    writeConfiguration(device, options);
    start();
}

PrivateBus::~PrivateBus() {
    stop();
}

void PrivateBus::writeConfiguration(const DeviceRoot& device, const BusOptions& options) {
    // The daemon runs as a child of this script rather than in its place, so that its exit
    // status is recorded: the bus only ever sees the script's.
    const fs::path launcher = directory_ / "launch-daemon";
    test::writeText(launcher,
                    "#!/bin/sh\n"
                    "/usr/bin/env TAVRIX_ROOT=" +
                        quoted(device.root()) + " TAVRIX_LOG_STDERR=1 TAVRIX_IDLE_EXIT_SEC=" +
                        std::to_string(options.idleExitSeconds) +
                        " RUNTIME_DIRECTORY=" + quoted(device.runtimeDirectory()) + " " +
                        quoted(TAVRIX_DAEMON_PATH) + " >>" + quoted(logPath_) + " 2>&1 &\n" +
                        "daemon=$!\n"
                        "echo \"started $daemon\" >>" +
                        quoted(launchesPath_) + "\n" +
                        "wait \"$daemon\"\n"
                        "echo \"exited $daemon $?\" >>" +
                        quoted(launchesPath_) + "\n");

    test::writeText(directory_ / "services" / "com.zandor.tavrixservicesd.service",
                    "[D-BUS Service]\n"
                    "Name=com.zandor.tavrixservicesd\n"
                    "Exec=/bin/sh " +
                        launcher.string() + "\n");

    const std::string policy = options.policyFile
                                   ? std::string(kSystemDefaultPolicy) + "  <include>" +
                                         options.policyFile->string() + "</include>\n"
                                   : std::string(test::kOpenBusPolicy);
    test::writeBusConfiguration(directory_, "  <servicedir>" + (directory_ / "services").string() +
                                                "</servicedir>\n" + policy);
}

void PrivateBus::start() {
    process_.emplace(directory_ / "bus.conf", logPath_, busEnvironment());
}

void PrivateBus::stop() {
    process_.reset();
}

std::string PrivateBus::log() const {
    return test::readText(logPath_);
}

std::vector<DaemonLaunch> PrivateBus::launches() const {
    std::vector<DaemonLaunch> result;
    std::map<pid_t, std::size_t> indexOfPid;
    std::istringstream lines(test::readText(launchesPath_));
    std::string what;
    pid_t pid = -1;
    while (lines >> what >> pid) {
        if (what == "started") {
            indexOfPid[pid] = result.size();
            result.push_back({pid, std::nullopt});
        } else if (int status = 0; what == "exited" && lines >> status) {
            auto found = indexOfPid.find(pid);
            if (found != indexOfPid.end()) {
                result[found->second].exitStatus = status;
            }
        }
    }
    return result;
}

}  // namespace tavrix::integration
