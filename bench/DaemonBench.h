// What the benchmarks that run the real daemon share: small file and process helpers, and a
// private dbus-daemon that starts the daemon on demand under a device root.
#pragma once

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <exception>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "PrivateBus.h"

namespace tavrix::bench {

inline void writeBytes(const std::filesystem::path& path, const std::string& bytes) {
    std::filesystem::create_directories(path.parent_path());
    std::ofstream(path, std::fstream::binary | std::fstream::trunc) << bytes;
}

inline std::string readBytes(const std::filesystem::path& path) {
    std::ifstream in(path, std::fstream::binary);
    return {std::istreambuf_iterator<char>(in), {}};
}

// Starts argv (looked up in PATH) with stdout and stderr on /dev/null.
inline pid_t startProgram(const std::vector<std::string>& argv) {
    pid_t pid = ::fork();
    if (pid == 0) {
        int null = ::open("/dev/null", O_WRONLY);
        ::dup2(null, 1);
        ::dup2(null, 2);
        std::vector<char*> args;
        for (const auto& arg : argv) {
            args.push_back(const_cast<char*>(arg.c_str()));
        }
        args.push_back(nullptr);
        ::execvp(args[0], args.data());
        ::_exit(127);
    }
    return pid;
}

// Runs argv to its end: its exit status, or -1 when it did not exit normally.
inline int runProgram(const std::vector<std::string>& argv) {
    pid_t pid = startProgram(argv);
    int status = 0;
    ::waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// A private bus that starts the daemon under root on demand; the daemon stays up for the whole
// benchmark.
inline std::unique_ptr<test::PrivateBus> startDaemonBus(const std::filesystem::path& work,
                                                        const std::filesystem::path& root) {
    return std::make_unique<test::PrivateBus>(
        test::ActivatedDaemon{TAVRIX_DAEMON_PATH, root, work / "run", 300, {}});
}

// Runs the benchmark in a fresh directory under /dev/shm, removed afterwards unless it failed
// (then kept for a look). The process's exit status.
inline int runInScratchDirectory(const char* name,
                                 const std::function<void(const std::filesystem::path&)>& run) {
    std::string pattern = std::string("/dev/shm/tavrix-") + name + "-XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) {
        std::perror("mkdtemp");
        return 1;
    }
    const std::filesystem::path work = pattern;
    try {
        run(work);
    } catch (const std::exception& error) {
        std::fprintf(stderr, "%s: %s (files left in %s)\n", name, error.what(), work.c_str());
        return 1;
    }
    std::error_code ignored;
    std::filesystem::remove_all(work, ignored);
    return 0;
}

}  // namespace tavrix::bench
