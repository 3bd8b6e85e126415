// A private message bus for tests: a dbus-daemon of its own, listening in a temporary directory,
// that allows everything and activates nothing. Stopped when the object goes.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <stdexcept>
#include <string>

#include "TestSupport.h"
#include "platform/BusHandles.h"
#include "util/UniqueFd.h"

namespace tavrix::test {

class PrivateBusDaemon {
  public:
    PrivateBusDaemon() {
        const std::string config = directory_ / "bus.conf";
        writeText(config,
                  "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration "
                  "1.0//EN\" \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
                  "<busconfig>\n"
                  "  <type>session</type>\n"
                  "  <listen>unix:path=" +
                      (directory_ / "socket") +
                      "</listen>\n"
                      "  <auth>EXTERNAL</auth>\n"
                      "  <policy context=\"default\">\n"
                      "    <allow send_destination=\"*\" eavesdrop=\"true\"/>\n"
                      "    <allow eavesdrop=\"true\"/>\n"
                      "    <allow own=\"*\"/>\n"
                      "  </policy>\n"
                      "</busconfig>\n");
        int ends[2];
        if (::pipe2(ends, O_CLOEXEC) != 0) {
            throw std::runtime_error("pipe failed");
        }
        UniqueFd readEnd(ends[0]);
        UniqueFd writeEnd(ends[1]);

        // The daemon prints its address on descriptor 3 once it listens; its complaints (it
        // cannot raise its descriptor limit unprivileged) go to a log beside the socket.
        const std::string log = directory_ / "daemon.log";
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, writeEnd.get(), 3);
        posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, log.c_str(),
                                         O_WRONLY | O_CREAT | O_TRUNC, 0644);
        std::string configOption = "--config-file=" + config;
        char* arguments[] = {
            const_cast<char*>("dbus-daemon"),       configOption.data(),
            const_cast<char*>("--nofork"),          const_cast<char*>("--nopidfile"),
            const_cast<char*>("--print-address=3"), nullptr};
        int failed = ::posix_spawnp(&pid_, "dbus-daemon", &actions, nullptr, arguments, environ);
        posix_spawn_file_actions_destroy(&actions);
        if (failed != 0) {
            pid_ = -1;
            throw std::runtime_error("cannot start dbus-daemon");
        }
        writeEnd.reset();

        char buffer[512];
        ssize_t got = 0;
        while (address_.find('\n') == std::string::npos &&
               (got = ::read(readEnd.get(), buffer, sizeof buffer)) != 0) {
            if (got < 0 && errno != EINTR) {
                break;
            }
            if (got > 0) {
                address_.append(buffer, static_cast<std::size_t>(got));
            }
        }
        if (address_.find('\n') == std::string::npos) {
            stop();
            throw std::runtime_error("dbus-daemon did not start: " + readText(log));
        }
        address_.erase(address_.find('\n'));
    }
    ~PrivateBusDaemon() { stop(); }
    PrivateBusDaemon(const PrivateBusDaemon&) = delete;
    PrivateBusDaemon& operator=(const PrivateBusDaemon&) = delete;

    const std::string& address() const { return address_; }

    // A new client connection to this bus, its unique name already assigned.
    platform::BusPtr connect() const {
        sd_bus* raw = nullptr;
        if (sd_bus_new(&raw) < 0) {
            throw std::runtime_error("sd_bus_new failed");
        }
        platform::BusPtr bus(raw);
        const char* name = nullptr;
        if (sd_bus_set_address(bus.get(), address_.c_str()) < 0 ||
            sd_bus_set_bus_client(bus.get(), 1) < 0 || sd_bus_start(bus.get()) < 0 ||
            sd_bus_get_unique_name(bus.get(), &name) < 0) {
            throw std::runtime_error("cannot connect to the test bus");
        }
        return bus;
    }
    // An address in the same directory where nothing listens.
    std::string deadAddress() const { return "unix:path=" + (directory_ / "nothing-here"); }

    void stop() {
        if (pid_ > 0) {
            ::kill(pid_, SIGTERM);
            ::waitpid(pid_, nullptr, 0);
            pid_ = -1;
        }
    }

  private:
    TempDir directory_;
    pid_t pid_ = -1;
    std::string address_;
};

}  // namespace tavrix::test
