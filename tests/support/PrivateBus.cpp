#include "PrivateBus.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <sstream>
#include <stdexcept>

#include "io/UniqueFd.h"

extern char** environ;

namespace tavrix::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kOpenPolicy = R"(  <policy context="default">
    <allow user="*"/>
    <allow send_destination="*" eavesdrop="true"/>
    <allow eavesdrop="true"/>
    <allow own="*"/>
  </policy>
)";

// The system bus's default context: nothing may be owned or called unless a policy file opens it;
// signals and replies pass.
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

std::string quoted(const fs::path& path) {
    return "'" + path.string() + "'";
}

// Starts argv[0] (a path, or a name looked up in PATH) with stdin from /dev/null, stdout to out,
// stderr to errors, and fd 3 to extra when given.
pid_t spawn(const std::vector<std::string>& argv, int out, int errors, int extra,
            char** environment) {
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_adddup2(&actions, out, 1);
    posix_spawn_file_actions_adddup2(&actions, errors, 2);
    if (extra >= 0) {
        posix_spawn_file_actions_adddup2(&actions, extra, 3);
    }
    std::vector<char*> arguments;
    for (const std::string& argument : argv) {
        arguments.push_back(const_cast<char*>(argument.c_str()));
    }
    arguments.push_back(nullptr);
    pid_t pid = -1;
    if (::posix_spawnp(&pid, arguments[0], &actions, nullptr, arguments.data(), environment) != 0) {
        pid = -1;
    }
    posix_spawn_file_actions_destroy(&actions);
    return pid;
}

int waitForExit(pid_t pid) {
    int status = 0;
    while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

}  // namespace

CommandResult runCommand(const std::vector<std::string>& argv, bool errorsApart) {
    int ends[2];
    if (argv.empty() || ::pipe2(ends, O_CLOEXEC) != 0) {
        return {};
    }
    io::UniqueFd readEnd(ends[0]);
    io::UniqueFd writeEnd(ends[1]);
    // A file in memory, read once the command has ended: a second pipe could fill while the first
    // one is read.
    io::UniqueFd errors(errorsApart ? ::memfd_create("errors", MFD_CLOEXEC) : -1);
    const pid_t pid =
        spawn(argv, writeEnd.get(), errors ? errors.get() : writeEnd.get(), -1, environ);
    // Only the child may hold the write end, or the read below never sees the end.
    writeEnd.reset();
    CommandResult result;
    if (pid < 0) {
        return result;
    }
    char buffer[512];
    for (ssize_t got; (got = ::read(readEnd.get(), buffer, sizeof buffer)) != 0;) {
        if (got > 0) {
            result.output.append(buffer, static_cast<std::size_t>(got));
        } else if (errno != EINTR) {
            break;
        }
    }
    result.status = waitForExit(pid);
    result.errors = errors ? readText("/proc/self/fd/" + std::to_string(errors.get())) : "";
    return result;
}

void check(int result, const char* what) {
    if (result < 0) {
        throw std::runtime_error(std::string(what) + " failed: " + std::to_string(-result));
    }
}

bus::BusPtr connectToBus(const std::string& address) {
    sd_bus* raw = nullptr;
    check(sd_bus_new(&raw), "sd_bus_new");
    bus::BusPtr bus(raw);
    const char* name = nullptr;
    check(sd_bus_set_address(bus.get(), address.c_str()), "sd_bus_set_address");
    check(sd_bus_set_bus_client(bus.get(), 1), "sd_bus_set_bus_client");
    check(sd_bus_start(bus.get()), "sd_bus_start");
    check(sd_bus_get_unique_name(bus.get(), &name), "sd_bus_get_unique_name");
    return bus;
}

PrivateBus::PrivateBus(const std::optional<ActivatedDaemon>& daemon,
                       const std::optional<fs::path>& policyFile) {
    const fs::path& directory = directory_.path();
    // Other users reach the socket in here (the policy tests run clients as nobody).
    fs::permissions(directory, fs::perms::others_read | fs::perms::others_exec,
                    fs::perm_options::add);
    std::string extra = policyFile ? std::string(kSystemDefaultPolicy) + "  <include>" +
                                         policyFile->string() + "</include>\n"
                                   : kOpenPolicy;
    if (daemon) {
        // The daemon runs as a child of this script rather than in its place, so that its exit
        // status is recorded: the bus only ever sees the script's.
        const fs::path launcher = directory / "launch-daemon";
        std::string prefix;
        for (const std::string& word : daemon->launchPrefix) {
            prefix += quoted(fs::path(word)) + " ";
        }
        const std::string launches = quoted(directory / "launches");
        writeText(launcher,
                  "#!/bin/sh\n/usr/bin/env TAVRIX_ROOT=" + quoted(daemon->root) +
                      " TAVRIX_LOG_STDERR=1 TAVRIX_IDLE_EXIT_SEC=" +
                      std::to_string(daemon->idleExitSeconds) +
                      " RUNTIME_DIRECTORY=" + quoted(daemon->runtimeDirectory) + " " + prefix +
                      quoted(daemon->binary) + " >>" + quoted(directory / "bus.log") +
                      " 2>&1 &\ndaemon=$!\necho \"started $daemon\" >>" + launches +
                      "\nwait \"$daemon\"\necho \"exited $daemon $?\" >>" + launches + "\n");
        writeText(directory / "services/com.zandor.tavrixservicesd.service",
                  "[D-BUS Service]\nName=com.zandor.tavrixservicesd\nExec=/bin/sh " +
                      launcher.string() + "\n");
        extra += "  <servicedir>" + (directory / "services").string() + "</servicedir>\n";
    }
    writeText(directory / "bus.conf",
              "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\"\n"
              " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
              "<busconfig>\n  <type>session</type>\n  <listen>unix:path=" +
                  (directory / "socket").string() + "</listen>\n  <auth>EXTERNAL</auth>\n" + extra +
                  "</busconfig>\n");

    io::UniqueFd logFile(
        ::open((directory / "bus.log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
    int ends[2];
    if (!logFile || ::pipe2(ends, O_CLOEXEC) != 0) {
        throw std::runtime_error("cannot prepare the bus's log or address pipe");
    }
    io::UniqueFd addressRead(ends[0]);
    // Above the descriptors the child is given, so that no dup2 overwrites it.
    io::UniqueFd addressWrite(::fcntl(ends[1], F_DUPFD_CLOEXEC, 10));
    ::close(ends[1]);
    std::vector<char*> environment;
    for (char** entry = environ; *entry != nullptr; ++entry) {
        std::string_view text(*entry);
        if (!text.starts_with("DBUS_") && !text.starts_with("TAVRIX_") &&
            !text.starts_with("RUNTIME_DIRECTORY=")) {
            environment.push_back(*entry);
        }
    }
    environment.push_back(nullptr);
    pid_ = spawn({"dbus-daemon", "--config-file=" + (directory / "bus.conf").string(), "--nofork",
                  "--print-address=3"},
                 logFile.get(), logFile.get(), addressWrite.get(), environment.data());
    addressWrite.reset();
    // The first line it prints, or nothing when it ends (or never started) first.
    std::string line;
    char c = 0;
    while (pid_ > 0 && ::read(addressRead.get(), &c, 1) == 1 && c != '\n') {
        line += c;
    }
    address_ = c == '\n' ? line : "";
    if (address_.empty()) {
        stop();
        throw std::runtime_error("dbus-daemon did not report its address:\n" + log());
    }
}

void PrivateBus::stop() {
    if (pid_ > 0) {
        ::kill(pid_, SIGTERM);  // dbus-daemon leaves on it at once
        waitForExit(pid_);
        pid_ = -1;
    }
}

std::vector<DaemonLaunch> PrivateBus::launches() const {
    std::vector<DaemonLaunch> result;
    std::istringstream lines(readText(directory_ / "launches"));
    std::string what;
    pid_t pid = -1;
    while (lines >> what >> pid) {
        if (what == "started") {
            result.push_back({pid, std::nullopt});
        } else if (int status = 0; what == "exited" && lines >> status) {
            for (DaemonLaunch& launch : result) {
                launch.exitStatus = launch.pid == pid ? std::optional(status) : launch.exitStatus;
            }
        }
    }
    return result;
}

}  // namespace tavrix::test
