// The daemon on a bus of its own, beside a minimal sd-bus service: a private dbus-daemon starts
// both on demand, then they are compared on cold start, throughput from four connections and idle
// resident memory. The daemon's warm call is also compared with Peer.Ping to the daemon, the round
// trip through the bus and sd-bus with no handler behind it.
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <exception>
#include <filesystem>
#include <fstream>
#include <latch>
#include <map>
#include <memory>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "BenchSupport.h"
#include "bus/BusHandles.h"
#include "io/UniqueFd.h"

extern char** environ;

using namespace tavrix;
using bus::BusError;
using bus::BusMessagePtr;
using bus::BusPtr;
using bus::BusSlotPtr;

namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

constexpr int kColdRuns = 5;
constexpr int kWarmUpCalls = 200;
constexpr int kWarmCalls = 2000;
constexpr int kClientThreads = 4;
constexpr auto kThroughputTime = 2s;
// The daemon stays up through the warm measurements however long they take.
constexpr int kIdleExitSeconds = 300;

// Bounds on every wait for another process, so that a service that never comes fails the run.
constexpr auto kBusStartTimeout = 10s;
constexpr auto kActivationTimeout = 15s;
constexpr auto kCallTimeout = 5s;
constexpr auto kStopTimeout = 10s;
constexpr auto kCleanupTimeout = 5s;

struct Service {
    const char* label;
    const char* busName;
    const char* path;
    const char* interface;
    const char* method;
};

constexpr Service kDaemon{"tavrixservicesd", "com.zandor.tavrixservicesd",
                          "/com/zandor/tavrixservicesd", "com.zandor.TXManagerServerInterface",
                          "IsTavrixBundleSupported"};
constexpr Service kMinimal{"minimal_service", "bench.MinimalService", "/bench/Minimal",
                           "bench.Minimal", "Answer"};

volatile sig_atomic_t interruptedBy = 0;

void onInterrupt(int signal) {
    interruptedBy = signal;
}

// Ctrl-C and friends end the run between calls, so that the cleanup still happens.
void throwIfInterrupted() {
    if (interruptedBy != 0) {
        throw std::runtime_error(std::string("interrupted by ") + ::strsignal(interruptedBy));
    }
}

std::uint64_t microseconds(Clock::duration duration) {
    return static_cast<std::uint64_t>(
        std::chrono::duration_cast<std::chrono::microseconds>(duration).count());
}

double median(std::vector<double> samples) {
    std::sort(samples.begin(), samples.end());
    return samples[samples.size() / 2];
}

std::string readWholeFile(const fs::path& path) {
    std::ifstream in(path, std::fstream::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

void writeWholeFile(const fs::path& path, const std::string& text) {
    std::ofstream out(path, std::fstream::binary | std::fstream::trunc);
    out << text;
    if (!out.flush()) {
        throw std::runtime_error("cannot write " + path.string());
    }
}

// The paths go into XML and into Exec lines quoted with '...'; refuse what would need escaping
// there rather than escape it.
const fs::path& plainPath(const fs::path& path) {
    if (path.string().find_first_of("'\"&<>\\ \t\n") != std::string::npos) {
        throw std::runtime_error("the path " + path.string() +
                                 " holds a character the bus configuration cannot take as is");
    }
    return path;
}

// ---- Processes ------------------------------------------------------------------------------

// Every live process below this one: the bus, its activation helpers and the services.
std::vector<pid_t> descendants() {
    std::multimap<pid_t, pid_t> childrenOf;
    std::error_code error;
    for (fs::directory_iterator it("/proc", error), end; !error && it != end; it.increment(error)) {
        const std::string name = it->path().filename().string();
        if (name.find_first_not_of("0123456789") != std::string::npos) {
            continue;
        }
        // "pid (comm) state ppid ...": comm may hold anything, so read after its last ')'.
        const std::string stat = readWholeFile(it->path() / "stat");
        const std::size_t close = stat.rfind(')');
        char state = 0;
        int parent = 0;
        if (close == std::string::npos ||
            std::sscanf(stat.c_str() + close + 1, " %c %d", &state, &parent) != 2) {
            continue;
        }
        childrenOf.emplace(parent, static_cast<pid_t>(std::stol(name)));
    }
    std::vector<pid_t> found;
    std::vector<pid_t> pending{::getpid()};
    while (!pending.empty()) {
        pid_t parent = pending.back();
        pending.pop_back();
        auto [first, last] = childrenOf.equal_range(parent);
        for (auto it = first; it != last; ++it) {
            found.push_back(it->second);
            pending.push_back(it->second);
        }
    }
    return found;
}

// Ends everything this benchmark started, whichever way the run ends: the bus and the services,
// which are below this process because it is their subreaper.
void endDescendants() {
    for (int signal : {SIGTERM, SIGKILL}) {
        std::vector<pid_t> running = descendants();
        if (running.empty()) {
            return;
        }
        for (pid_t pid : running) {
            ::kill(pid, signal);
        }
        const auto deadline = Clock::now() + kCleanupTimeout;
        for (;;) {
            while (::waitpid(-1, nullptr, WNOHANG) > 0) {
            }
            if (descendants().empty()) {
                return;
            }
            if (Clock::now() > deadline) {
                break;
            }
            std::this_thread::sleep_for(10ms);
        }
    }
    std::fprintf(stderr, "bus_bench: some processes it started did not end\n");
}

class DescendantsGuard {
  public:
    DescendantsGuard() = default;
    ~DescendantsGuard() { endDescendants(); }
    DescendantsGuard(const DescendantsGuard&) = delete;
    DescendantsGuard& operator=(const DescendantsGuard&) = delete;
};

// A "Field:   123 kB" line of a /proc file of the process.
long procKiB(pid_t pid, const char* file, std::string_view field) {
    std::istringstream status(readWholeFile("/proc/" + std::to_string(pid) + "/" + file));
    std::string line;
    while (std::getline(status, line)) {
        if (line.starts_with(field)) {
            return std::stol(line.substr(field.size()));
        }
    }
    throw std::runtime_error("no " + std::string(field) + " for process " + std::to_string(pid));
}

long residentKiB(pid_t pid) {
    return procKiB(pid, "status", "VmRSS:");
}

// Resident pages with each shared page divided among the processes that map it: what the
// process adds to a system where libc and friends are mapped anyway.
long proportionalKiB(pid_t pid) {
    return procKiB(pid, "smaps_rollup", "Pss:");
}

// The type of the file system that holds path, from the longest mount point above it.
std::string fileSystemOf(const fs::path& path) {
    const std::string target = fs::canonical(path).string();
    std::istringstream mounts(readWholeFile("/proc/self/mountinfo"));
    std::string line;
    std::size_t bestLength = 0;
    std::string best = "unknown";
    while (std::getline(mounts, line)) {
        std::istringstream fields(line);
        std::string id, parent, device, root, mountPoint, field;
        fields >> id >> parent >> device >> root >> mountPoint;
        while (fields >> field && field != "-") {
        }
        std::string type;
        fields >> type;
        // Mount points escape blanks as octal (\040); none of ours has any.
        const bool above =
            mountPoint == "/" || target == mountPoint || target.starts_with(mountPoint + "/");
        if (above && mountPoint.size() >= bestLength && !type.empty()) {
            bestLength = mountPoint.size();
            best = type;
        }
    }
    return best;
}

// ---- Files ------------------------------------------------------------------------------------

class WorkDirectory {
  public:
    WorkDirectory() {
        std::string pattern = (fs::temp_directory_path() / "tavrix-bus-bench-XXXXXX").string();
        if (::mkdtemp(pattern.data()) == nullptr) {
            throw std::runtime_error("cannot create a temporary directory: " +
                                     std::string(std::strerror(errno)));
        }
        path_ = plainPath(pattern);
    }
    ~WorkDirectory() {
        std::error_code ignored;
        fs::remove_all(path_, ignored);
    }
    WorkDirectory(const WorkDirectory&) = delete;
    WorkDirectory& operator=(const WorkDirectory&) = delete;

    const fs::path& path() const { return path_; }
    fs::path log() const { return path_ / "bus.log"; }

  private:
    fs::path path_;
};

// The demo device, with the mobile user made this user: the daemon runs as us and must own the
// mobile user's files.
void prepareDeviceRoot(const fs::path& root) {
    fs::copy(TAVRIX_DEMO_ROOT, root, fs::copy_options::recursive);
    std::istringstream original(readWholeFile(root / "etc/passwd"));
    std::string passwd;
    std::string line;
    while (std::getline(original, line)) {
        if (!line.starts_with("mobile:")) {
            passwd += line + "\n";
        }
    }
    passwd += "mobile:x:" + std::to_string(::getuid()) + ":" + std::to_string(::getgid()) +
              ":Mobile:/var/mobile:/usr/sbin/nologin\n";
    writeWholeFile(root / "etc/passwd", passwd);
    fs::create_directories(root / "var/mobile");
}

void printLogTail(const fs::path& log, std::size_t lines) {
    std::string text = readWholeFile(log);
    std::size_t start = text.size();
    for (std::size_t seen = 0; start > 0 && seen <= lines;) {
        if (text[--start] == '\n') {
            ++seen;
        }
    }
    std::fprintf(stderr, "last lines of %s:\n%s\n", log.c_str(), text.c_str() + start);
}

// ---- The bus ----------------------------------------------------------------------------------

std::string quoted(const fs::path& path) {
    return "'" + plainPath(path).string() + "'";
}

// The bus's environment, and so the services': ours, without anything that could point them at
// another bus or another device.
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

void writeBusConfiguration(const fs::path& directory) {
    const fs::path services = directory / "services";
    fs::create_directories(services);
    fs::create_directories(directory / "runtime");
    // Both start through env, so that the exec it costs is on both sides.
    writeWholeFile(services / "com.zandor.tavrixservicesd.service",
                   "[D-BUS Service]\n"
                   "Name=com.zandor.tavrixservicesd\n"
                   "Exec=/usr/bin/env TAVRIX_ROOT=" +
                       quoted(directory / "root") + " TAVRIX_LOG_STDERR=1 TAVRIX_IDLE_EXIT_SEC=" +
                       std::to_string(kIdleExitSeconds) + " RUNTIME_DIRECTORY=" +
                       quoted(directory / "runtime") + " " + quoted(TAVRIX_DAEMON_PATH) + "\n");
    writeWholeFile(services / "bench.MinimalService.service",
                   "[D-BUS Service]\n"
                   "Name=bench.MinimalService\n"
                   "Exec=/usr/bin/env " +
                       quoted(TAVRIX_MINIMAL_SERVICE_PATH) + "\n");
    writeWholeFile(directory / "bus.conf",
                   "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration "
                   "1.0//EN\"\n \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
                   "<busconfig>\n"
                   "  <type>session</type>\n"
                   "  <listen>unix:path=" +
                       plainPath(directory / "socket").string() +
                       "</listen>\n"
                       "  <auth>EXTERNAL</auth>\n"
                       "  <servicedir>" +
                       services.string() +
                       "</servicedir>\n"
                       "  <policy context=\"default\">\n"
                       "    <allow send_destination=\"*\"/>\n"
                       "    <allow receive_sender=\"*\"/>\n"
                       "    <allow own=\"*\"/>\n"
                       "  </policy>\n"
                       "</busconfig>\n");
}

std::string readAddress(int fd) {
    std::string address;
    const auto deadline = Clock::now() + kBusStartTimeout;
    while (address.find('\n') == std::string::npos) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
        if (left <= 0ms) {
            return {};
        }
        pollfd entry{fd, POLLIN, 0};
        const int ready = ::poll(&entry, 1, static_cast<int>(left.count()));
        if (ready < 0 && errno != EINTR) {
            return {};
        }
        throwIfInterrupted();
        if (ready <= 0) {
            continue;
        }
        char buffer[256];
        const ssize_t got = ::read(fd, buffer, sizeof buffer);
        if (got == 0 || (got < 0 && errno != EINTR)) {
            return {};
        }
        if (got > 0) {
            address.append(buffer, static_cast<std::size_t>(got));
        }
    }
    address.erase(address.find('\n'));
    return address;
}

// Starts dbus-daemon on the generated configuration and returns its address. Its stderr, and so
// the services', goes to the log. The caller's DescendantsGuard ends it.
std::string startBus(const fs::path& directory, const fs::path& log) {
    io::UniqueFd logFd(::open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
    int ends[2];
    if (!logFd || ::pipe2(ends, O_CLOEXEC) != 0) {
        throw std::runtime_error("cannot open the bus's log or address pipe");
    }
    io::UniqueFd addressRead(ends[0]);
    io::UniqueFd addressWriteLow(ends[1]);
    // Above the descriptors the child gets, so that no dup2 below overwrites it.
    io::UniqueFd addressWrite(::fcntl(addressWriteLow.get(), F_DUPFD_CLOEXEC, 10));
    addressWriteLow.reset();

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_adddup2(&actions, logFd.get(), 1);
    posix_spawn_file_actions_adddup2(&actions, logFd.get(), 2);
    posix_spawn_file_actions_adddup2(&actions, addressWrite.get(), 3);
    // A group of its own: Ctrl-C reaches only the benchmark, which then ends the bus in order.
    posix_spawnattr_t attributes;
    posix_spawnattr_init(&attributes);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETPGROUP);
    posix_spawnattr_setpgroup(&attributes, 0);

    std::string configOption = "--config-file=" + (directory / "bus.conf").string();
    std::vector<char*> arguments = {const_cast<char*>("dbus-daemon"), configOption.data(),
                                    const_cast<char*>("--nofork"),
                                    const_cast<char*>("--print-address=3"), nullptr};
    std::vector<std::string> environment = busEnvironment();
    std::vector<char*> environmentPointers;
    for (std::string& entry : environment) {
        environmentPointers.push_back(entry.data());
    }
    environmentPointers.push_back(nullptr);

    pid_t pid = -1;
    const int failed = ::posix_spawnp(&pid, "dbus-daemon", &actions, &attributes, arguments.data(),
                                      environmentPointers.data());
    posix_spawnattr_destroy(&attributes);
    posix_spawn_file_actions_destroy(&actions);
    if (failed != 0) {
        throw std::runtime_error("cannot start dbus-daemon: " + std::string(std::strerror(failed)));
    }
    addressWrite.reset();
    std::string address = readAddress(addressRead.get());
    if (address.empty()) {
        throw std::runtime_error("dbus-daemon did not report its address within 10 s");
    }
    return address;
}

// ---- Calls ------------------------------------------------------------------------------------

BusPtr connectClient(const std::string& address) {
    sd_bus* raw = nullptr;
    int r = sd_bus_new(&raw);
    if (r < 0) {
        throw std::runtime_error("cannot create a bus connection: " +
                                 std::string(std::strerror(-r)));
    }
    BusPtr bus(raw);
    if ((r = sd_bus_set_address(bus.get(), address.c_str())) < 0 ||
        (r = sd_bus_set_bus_client(bus.get(), 1)) < 0 ||
        (r = sd_bus_set_method_call_timeout(bus.get(), microseconds(kCallTimeout))) < 0 ||
        (r = sd_bus_start(bus.get())) < 0) {
        throw std::runtime_error("cannot connect to the private bus: " +
                                 std::string(std::strerror(-r)));
    }
    return bus;
}

// One method call, with an optional string argument; the reply, or an error saying who did not
// answer what.
BusMessagePtr callMethod(sd_bus* bus, const char* destination, const char* path,
                         const char* interface, const char* member, const char* argument,
                         Clock::duration timeout) {
    sd_bus_message* raw = nullptr;
    int r = sd_bus_message_new_method_call(bus, &raw, destination, path, interface, member);
    BusMessagePtr message(raw);
    if (r >= 0 && argument != nullptr) {
        r = sd_bus_message_append(message.get(), "s", argument);
    }
    BusError error;
    sd_bus_message* rawReply = nullptr;
    if (r >= 0) {
        r = sd_bus_call(bus, message.get(), microseconds(timeout), error.get(), &rawReply);
    }
    BusMessagePtr reply(rawReply);
    if (r < 0) {
        throwIfInterrupted();
        throw std::runtime_error(std::string(destination) + " did not answer " + member + ": " +
                                 (error.isSet() ? std::string(error.name()) + ": " + error.message()
                                                : std::string(std::strerror(-r))));
    }
    return reply;
}

BusMessagePtr callService(sd_bus* bus, const Service& service,
                          Clock::duration timeout = kCallTimeout) {
    return callMethod(bus, service.busName, service.path, service.interface, service.method,
                      nullptr, timeout);
}

BusMessagePtr callBus(sd_bus* bus, const char* member, const char* name) {
    return callMethod(bus, "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
                      member, name, kCallTimeout);
}

void expectBoolean(sd_bus_message* reply, const Service& service) {
    int answer = 0;
    if (sd_bus_message_read(reply, "b", &answer) < 0) {
        throw std::runtime_error(std::string(service.label) + " answered " + service.method +
                                 " with something other than a boolean");
    }
}

pid_t ownerPid(sd_bus* bus, const Service& service) {
    BusMessagePtr reply = callBus(bus, "GetConnectionUnixProcessID", service.busName);
    std::uint32_t pid = 0;
    if (sd_bus_message_read(reply.get(), "u", &pid) < 0 || pid == 0) {
        throw std::runtime_error(std::string("no process id for ") + service.busName);
    }
    return static_cast<pid_t>(pid);
}

bool hasOwner(sd_bus* bus, const Service& service) {
    BusMessagePtr reply = callBus(bus, "NameHasOwner", service.busName);
    int owned = 0;
    if (sd_bus_message_read(reply.get(), "b", &owned) < 0) {
        throw std::runtime_error("NameHasOwner answered without a boolean");
    }
    return owned != 0;
}

int onNameOwnerChanged(sd_bus_message* message, void* userdata, sd_bus_error*) {
    const char* name = nullptr;
    const char* oldOwner = nullptr;
    const char* newOwner = nullptr;
    if (sd_bus_message_read(message, "sss", &name, &oldOwner, &newOwner) >= 0 &&
        newOwner != nullptr && *newOwner == '\0') {
        *static_cast<bool*>(userdata) = true;
    }
    return 0;
}

// Stops the service if it runs: SIGTERM, then waits on the bus until its name has no owner, and
// until the process is gone, so that its exit does not share the CPU with the next start.
void stopService(sd_bus* bus, const Service& service) {
    bool released = false;
    const std::string rule =
        "type='signal',sender='org.freedesktop.DBus',path='/org/freedesktop/DBus',"
        "interface='org.freedesktop.DBus',member='NameOwnerChanged',arg0='" +
        std::string(service.busName) + "'";
    sd_bus_slot* rawSlot = nullptr;
    int r = sd_bus_add_match(bus, &rawSlot, rule.c_str(), onNameOwnerChanged, &released);
    BusSlotPtr match(rawSlot);
    if (r < 0) {
        throw std::runtime_error("cannot watch the owner of " + std::string(service.busName));
    }
    // With the match in place first, a release from here on cannot be missed.
    if (!hasOwner(bus, service)) {
        return;
    }
    const pid_t pid = ownerPid(bus, service);
    // By pidfd, so that the signal cannot reach another process that got the id in between.
    // (Through syscall: this glibc declares the wrappers without C linkage for C++.)
    io::UniqueFd process(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
    if (!process || ::syscall(SYS_pidfd_send_signal, process.get(), SIGTERM, nullptr, 0) != 0) {
        throw std::runtime_error("cannot send SIGTERM to " + std::string(service.label) + " (" +
                                 std::to_string(pid) + "): " + std::strerror(errno));
    }
    const auto deadline = Clock::now() + kStopTimeout;
    while (!released) {
        const auto now = Clock::now();
        if (now > deadline) {
            throw std::runtime_error(std::string(service.label) +
                                     " still owns its name 10 s after SIGTERM");
        }
        r = sd_bus_process(bus, nullptr);
        if (r < 0) {
            throw std::runtime_error("lost the bus: " + std::string(std::strerror(-r)));
        }
        if (r == 0) {
            r = sd_bus_wait(bus, microseconds(deadline - now));
            if (r < 0 && r != -EINTR) {
                throw std::runtime_error("lost the bus: " + std::string(std::strerror(-r)));
            }
        }
    }
    pollfd entry{process.get(), POLLIN, 0};
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
    if (::poll(&entry, 1, static_cast<int>(std::max(left, 0ms).count())) <= 0) {
        throw std::runtime_error(std::string(service.label) +
                                 " released its name but had not exited 10 s after SIGTERM");
    }
    // Once activated, a service is no child of the bus any more but, as a subreaper, ours.
    ::waitpid(pid, nullptr, WNOHANG);
}

// ---- Measurements -----------------------------------------------------------------------------

double elapsedMicros(Clock::time_point start) {
    return std::chrono::duration<double, std::micro>(Clock::now() - start).count();
}

// Time from the call that starts the service, stopped first if it runs, to its reply.
double coldStartMicros(sd_bus* bus, const Service& service) {
    throwIfInterrupted();
    stopService(bus, service);
    const auto start = Clock::now();
    BusMessagePtr reply;
    try {
        reply = callService(bus, service, kActivationTimeout);
    } catch (const std::exception& error) {
        throwIfInterrupted();
        throw std::runtime_error(
            std::string(service.label) +
            " did not answer the call that starts it within 15 s: " + error.what());
    }
    const double micros = elapsedMicros(start);
    expectBoolean(reply.get(), service);
    return micros;
}

void ping(sd_bus* bus, const Service& service) {
    callMethod(bus, service.busName, service.path, "org.freedesktop.DBus.Peer", "Ping", nullptr,
               kCallTimeout);
}

// Total calls per second from concurrent clients, one connection each, each call waiting for its
// reply before the next.
double callsPerSecond(const std::string& address, const Service& service) {
    std::latch ready(kClientThreads);
    std::vector<std::exception_ptr> errors(kClientThreads);
    std::vector<double> rates(kClientThreads, 0.0);
    auto client = [&](int index) {
        BusPtr bus;
        try {
            bus = connectClient(address);
            callService(bus.get(), service);
        } catch (...) {
            errors[index] = std::current_exception();
        }
        // Every thread arrives, failed or not, so that none waits forever.
        ready.arrive_and_wait();
        if (errors[index]) {
            return;
        }
        try {
            long calls = 0;
            const auto start = Clock::now();
            const auto deadline = start + kThroughputTime;
            auto now = start;
            while (now < deadline && interruptedBy == 0) {
                callService(bus.get(), service);
                ++calls;
                now = Clock::now();
            }
            rates[index] = calls / std::chrono::duration<double>(now - start).count();
        } catch (...) {
            errors[index] = std::current_exception();
        }
    };
    std::vector<std::thread> threads;
    try {
        for (int i = 0; i < kClientThreads; ++i) {
            threads.emplace_back(client, i);
        }
    } catch (...) {
        ready.count_down(kClientThreads - static_cast<std::ptrdiff_t>(threads.size()));
        for (std::thread& thread : threads) {
            thread.join();
        }
        throw;
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    throwIfInterrupted();
    for (const std::exception_ptr& error : errors) {
        if (error) {
            std::rethrow_exception(error);
        }
    }
    double total = 0;
    for (double rate : rates) {
        total += rate;
    }
    return total;
}

struct Pair {
    double ours = 0;
    double peer = 0;
};

struct Results {
    Pair coldStartMicros;
    Pair warmCallMicros;
    Pair callsPerSecond;
    Pair residentKiB;
    Pair proportionalKiB;
    // systemd's hostname daemon, a second peer for memory: its RSS and PSS (zero when it is
    // not installed).
    Pair hostnamedKiB;
    Pair storedIDColdStartMicros;
};

constexpr const char* kHostnamed = "/lib/systemd/systemd-hostnamed";

// RSS and PSS of systemd's hostname daemon, idle on the private bus after one call: a small
// bus service of the system that clients start on demand, as they start this one. Zero when
// it is not installed.
Pair hostnamedMemory(sd_bus* bus, const std::string& address) {
    if (::access(kHostnamed, X_OK) != 0) {
        return {};
    }
    std::vector<std::string> environment = busEnvironment();
    environment.push_back("DBUS_SYSTEM_BUS_ADDRESS=" + address);
    std::vector<char*> pointers;
    for (std::string& entry : environment) {
        pointers.push_back(entry.data());
    }
    pointers.push_back(nullptr);
    char* arguments[] = {const_cast<char*>(kHostnamed), nullptr};
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
    pid_t pid = -1;
    const int failed =
        ::posix_spawn(&pid, kHostnamed, &actions, nullptr, arguments, pointers.data());
    posix_spawn_file_actions_destroy(&actions);
    if (failed != 0) {
        return {};
    }
    constexpr Service kHostname{"systemd-hostnamed", "org.freedesktop.hostname1",
                                "/org/freedesktop/hostname1", "org.freedesktop.DBus.Peer", "Ping"};
    const auto deadline = Clock::now() + kActivationTimeout;
    while (!hasOwner(bus, kHostname)) {
        if (Clock::now() > deadline) {
            throw std::runtime_error("systemd-hostnamed did not take its name within 15 s");
        }
        std::this_thread::sleep_for(5ms);
    }
    callService(bus, kHostname);
    Pair memory{static_cast<double>(residentKiB(pid)), static_cast<double>(proportionalKiB(pid))};
    ::kill(pid, SIGTERM);
    ::waitpid(pid, nullptr, 0);
    return memory;
}

// A behavior ID stored by an earlier run: the next launch redoes the bundle match for it before
// it answers.
void storeBehaviorID(const fs::path& root) {
    writeWholeFile(root / "var/mobile/Library/Preferences/com.zandor.tavrixservices.plist",
                   "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n<dict>\n"
                   "\t<key>EnableSupport</key>\n\t<true/>\n"
                   "\t<key>TavrixID</key>\n\t<string>demo</string>\n</dict>\n</plist>\n");
}

Results measure(const fs::path& directory, const fs::path& log) {
    DescendantsGuard endEverythingStarted;
    writeBusConfiguration(directory);
    const std::string address = startBus(directory, log);
    BusPtr bus = connectClient(address);

    // Ours and the peer take turns, so that a burst of load on this shared machine falls on
    // both sides rather than on one.
    Results results;
    std::vector<double> coldOurs, coldPeer;
    for (int run = 0; run < kColdRuns; ++run) {
        coldOurs.push_back(coldStartMicros(bus.get(), kDaemon));
        coldPeer.push_back(coldStartMicros(bus.get(), kMinimal));
    }
    results.coldStartMicros = {median(coldOurs), median(coldPeer)};

    // Started once more, they stay up for the rest.
    for (int i = 0; i < kWarmUpCalls; ++i) {
        callService(bus.get(), kDaemon);
        callService(bus.get(), kMinimal);
        ping(bus.get(), kDaemon);
    }
    std::vector<double> warmOurs, warmPeer;
    for (int i = 0; i < kWarmCalls; ++i) {
        auto start = Clock::now();
        callService(bus.get(), kDaemon);
        warmOurs.push_back(elapsedMicros(start));
        start = Clock::now();
        ping(bus.get(), kDaemon);
        warmPeer.push_back(elapsedMicros(start));
    }
    throwIfInterrupted();
    results.warmCallMicros = {median(warmOurs), median(warmPeer)};

    results.callsPerSecond = {callsPerSecond(address, kDaemon), callsPerSecond(address, kMinimal)};

    const pid_t daemon = ownerPid(bus.get(), kDaemon);
    const pid_t minimal = ownerPid(bus.get(), kMinimal);
    results.residentKiB = {static_cast<double>(residentKiB(daemon)),
                           static_cast<double>(residentKiB(minimal))};
    results.proportionalKiB = {static_cast<double>(proportionalKiB(daemon)),
                               static_cast<double>(proportionalKiB(minimal))};

    results.hostnamedKiB = hostnamedMemory(bus.get(), address);

    storeBehaviorID(directory / "root");
    coldOurs.clear();
    coldPeer.clear();
    for (int run = 0; run < kColdRuns; ++run) {
        coldOurs.push_back(coldStartMicros(bus.get(), kDaemon));
        coldPeer.push_back(coldStartMicros(bus.get(), kMinimal));
    }
    results.storedIDColdStartMicros = {median(coldOurs), median(coldPeer)};
    return results;
}

int run() {
    WorkDirectory work;
    try {
        prepareDeviceRoot(work.path() / "root");
        const Results results = measure(work.path(), work.log());
        std::printf("\nbus benchmark temporary files on: %s (%s)\n",
                    fileSystemOf(work.path()).c_str(), work.path().c_str());
        bench::printHeader(
            "Bus: tavrixservicesd (peer: minimal sd-bus service, libsystemd only), private bus");
        bench::printRow("cold start, first call to reply (median of 5)",
                        results.coldStartMicros.ours, results.coldStartMicros.peer, "us", "<=1.5x");
        bench::printRow("cold start with a stored behavior ID (median of 5)",
                        results.storedIDColdStartMicros.ours, results.storedIDColdStartMicros.peer,
                        "us", "");
        bench::printRow("throughput, 4 connections for 2 s", results.callsPerSecond.ours,
                        results.callsPerSecond.peer, "/s", "");
        bench::printRow("idle resident memory (VmRSS)", results.residentKiB.ours,
                        results.residentKiB.peer, "KiB", "");
        bench::printRow("idle proportional memory (Pss)", results.proportionalKiB.ours,
                        results.proportionalKiB.peer, "KiB", "");
        if (results.hostnamedKiB.ours > 0) {
            bench::printRow("idle VmRSS vs systemd-hostnamed", results.residentKiB.ours,
                            results.hostnamedKiB.ours, "KiB", "<1x");
            bench::printRow("idle Pss vs systemd-hostnamed", results.proportionalKiB.ours,
                            results.hostnamedKiB.peer, "KiB", "<1x");
        }
        bench::printHeader(
            "Bus: warm IsTavrixBundleSupported (peer: Peer.Ping to the same daemon)");
        bench::printRow("median per call of 2000", results.warmCallMicros.ours,
                        results.warmCallMicros.peer, "us", "<=1.5x");
        return 0;
    } catch (const std::exception& error) {
        // The processes are gone by now; the log is still there until work goes.
        std::fprintf(stderr, "bus_bench: %s\n", error.what());
        printLogTail(work.log(), 30);
        return 1;
    }
}

}  // namespace

int main() {
    struct sigaction action {};
    action.sa_handler = onInterrupt;
    sigemptyset(&action.sa_mask);
    for (int signal : {SIGINT, SIGTERM, SIGHUP}) {
        ::sigaction(signal, &action, nullptr);
    }
    // dbus-daemon lets go of a service once it has started it; as a subreaper this process
    // becomes the service's parent, so that the cleanup finds and reaps it.
    if (::prctl(PR_SET_CHILD_SUBREAPER, 1) != 0) {
        std::fprintf(stderr, "bus_bench: cannot become a subreaper: %s\n", std::strerror(errno));
        return 1;
    }
    try {
        return run();
    } catch (const std::exception& error) {
        std::fprintf(stderr, "bus_bench: %s\n", error.what());
        return 1;
    }
}
