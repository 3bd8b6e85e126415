#include "DbusDaemonProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <fstream>
#include <stdexcept>
#include <thread>

#include "io/UniqueFd.h"

extern char** environ;

namespace tavrix::test {
namespace {

using namespace std::chrono_literals;

constexpr auto kStartTimeout = 10s;
constexpr auto kStopTimeout = 5s;

std::string readAddress(int fd) {
    std::string address;
    auto deadline = std::chrono::steady_clock::now() + kStartTimeout;
    while (address.find('\n') == std::string::npos) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
            deadline - std::chrono::steady_clock::now());
        if (left <= 0ms) {
            return {};
        }
        pollfd entry{fd, POLLIN, 0};
        int ready = ::poll(&entry, 1, static_cast<int>(left.count()));
        if (ready < 0 && errno != EINTR) {
            return {};
        }
        if (ready <= 0) {
            continue;
        }
        char buffer[256];
        ssize_t got = ::read(fd, buffer, sizeof buffer);
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

class SpawnActions {
  public:
    SpawnActions() { posix_spawn_file_actions_init(&actions_); }
    ~SpawnActions() { posix_spawn_file_actions_destroy(&actions_); }
    SpawnActions(const SpawnActions&) = delete;
    SpawnActions& operator=(const SpawnActions&) = delete;
    posix_spawn_file_actions_t* get() { return &actions_; }

  private:
    posix_spawn_file_actions_t actions_;
};

std::string readLog(const std::filesystem::path& path) {
    std::ifstream in(path, std::fstream::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

}  // namespace

std::filesystem::path writeBusConfiguration(const std::filesystem::path& directory,
                                            const std::string& extra) {
    const std::filesystem::path path = directory / "bus.conf";
    std::ofstream(path, std::ofstream::binary | std::ofstream::trunc)
        << "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\"\n"
           " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
           "<busconfig>\n"
           "  <type>session</type>\n"
           "  <listen>unix:path="
        << (directory / "socket").string() << "</listen>\n  <auth>EXTERNAL</auth>\n"
        << extra << "</busconfig>\n";
    return path;
}

DbusDaemonProcess::DbusDaemonProcess(const std::filesystem::path& configFile,
                                     const std::filesystem::path& logFile,
                                     const std::optional<std::vector<std::string>>& environment) {
    io::UniqueFd logFd(::open(logFile.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
    int ends[2];
    if (!logFd || ::pipe2(ends, O_CLOEXEC) != 0) {
        throw std::runtime_error("cannot prepare the bus's log or address pipe");
    }
    io::UniqueFd addressRead(ends[0]);
    io::UniqueFd addressWriteLow(ends[1]);
    // Above the descriptors the child is given, so that no dup2 below overwrites it.
    io::UniqueFd addressWrite(::fcntl(addressWriteLow.get(), F_DUPFD_CLOEXEC, 10));
    addressWriteLow.reset();

    SpawnActions actions;
    posix_spawn_file_actions_addopen(actions.get(), 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_adddup2(actions.get(), logFd.get(), 1);
    posix_spawn_file_actions_adddup2(actions.get(), logFd.get(), 2);
    posix_spawn_file_actions_adddup2(actions.get(), addressWrite.get(), 3);

    std::string configOption = "--config-file=" + configFile.string();
    std::vector<char*> arguments = {const_cast<char*>("dbus-daemon"), configOption.data(),
                                    const_cast<char*>("--nofork"),
                                    const_cast<char*>("--print-address=3"), nullptr};
    std::vector<std::string> environmentCopy;
    std::vector<char*> environmentPointers;
    if (environment) {
        environmentCopy = *environment;
        for (std::string& entry : environmentCopy) {
            environmentPointers.push_back(entry.data());
        }
        environmentPointers.push_back(nullptr);
    }
    char** childEnvironment = environment ? environmentPointers.data() : environ;
    if (::posix_spawnp(&pid_, "dbus-daemon", actions.get(), nullptr, arguments.data(),
                       childEnvironment) != 0) {
        pid_ = -1;
        throw std::runtime_error("cannot start dbus-daemon");
    }
    addressWrite.reset();
    address_ = readAddress(addressRead.get());
    if (address_.empty()) {
        stop();
        throw std::runtime_error("dbus-daemon did not report its address:\n" + readLog(logFile));
    }
}

DbusDaemonProcess::~DbusDaemonProcess() {
    stop();
}

void DbusDaemonProcess::stop() {
    if (pid_ <= 0) {
        return;
    }
    ::kill(pid_, SIGTERM);
    auto deadline = std::chrono::steady_clock::now() + kStopTimeout;
    while (::waitpid(pid_, nullptr, WNOHANG) == 0) {
        if (std::chrono::steady_clock::now() > deadline) {
            ::kill(pid_, SIGKILL);
            ::waitpid(pid_, nullptr, 0);
            break;
        }
        std::this_thread::sleep_for(10ms);
    }
    pid_ = -1;
}

}  // namespace tavrix::test
