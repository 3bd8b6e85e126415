// Shared helpers for the tests: temporary directories, small file helpers, the one bundle writer
// and the one way to wait for a condition.
#pragma once

#include <sys/mount.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <optional>
#include <random>
#include <stdexcept>
#include <string>
#include <thread>

#include "plist/PropertyListFormat.h"

namespace tavrix::test {

// A fresh directory under base ($TMPDIR), removed with everything in it when the object goes.
class TempDir {
  public:
    explicit TempDir(const std::filesystem::path& base = std::filesystem::temp_directory_path()) {
        std::string pattern = (base / "tavrix-test-XXXXXX").string();
        if (::mkdtemp(pattern.data()) == nullptr) {
            throw std::runtime_error("mkdtemp failed");
        }
        path_ = pattern;
    }
    ~TempDir() {
        std::error_code ignored;
        std::filesystem::remove_all(path_, ignored);
    }
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::filesystem::path& path() const { return path_; }
    std::string operator/(const std::string& relative) const { return (path_ / relative).string(); }

  private:
    std::filesystem::path path_;
};

inline void writeText(const std::string& path, const std::string& text) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream(path, std::ofstream::binary) << text;
}

inline std::string readText(const std::string& path) {
    std::ifstream in(path, std::ofstream::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

// Bytes that do not compress.
inline std::string randomBytes(std::size_t size, unsigned seed) {
    std::mt19937 generator(seed);
    std::string bytes(size, '\0');
    std::generate(bytes.begin(), bytes.end(), [&] { return static_cast<char>(generator()); });
    return bytes;
}

// A tmpfs of the given size ("size=1m") over path until the object goes; mounting needs root.
struct TmpfsMount {
    TmpfsMount(std::filesystem::path at, const char* size)
        : path(std::move(at)),
          mounted(::geteuid() == 0 && ::mount("tmpfs", path.c_str(), "tmpfs", 0, size) == 0) {}
    ~TmpfsMount() {
        if (mounted) {
            ::umount2(path.c_str(), MNT_DETACH);
        }
    }
    TmpfsMount(const TmpfsMount&) = delete;
    TmpfsMount& operator=(const TmpfsMount&) = delete;

    std::filesystem::path path;
    bool mounted;
};

// A bundle directory as senders make it: Info.plist with an identifier and the version (left out
// when absent), the base carrier file, and other files (relative path to content).
inline void writeBundle(const std::filesystem::path& directory,
                        const std::optional<plist::Value>& version,
                        const plist::Dictionary& carrierFile = {},
                        const std::map<std::string, std::string>& files = {},
                        plist::Format infoFormat = plist::Format::Xml) {
    plist::Dictionary info{{"QZBundleIdentifier", "com.zandor.tavrix.test"}};
    if (version) {
        info.emplace("QZBundleVersion", *version);
    }
    std::filesystem::create_directories(directory);
    if (!plist::writeFile((directory / "Info.plist").string(), plist::Value(info), infoFormat) ||
        !plist::writeFile((directory / "behavior.plist").string(), plist::Value(carrierFile))) {
        throw std::runtime_error("cannot write the bundle " + directory.string());
    }
    for (const auto& [path, content] : files) {
        writeText((directory / path).string(), content);
    }
}

// Every entry below root by its path relative to root: directories as "/", links as
// "-> target", files by their content. Empty when root does not exist.
using Tree = std::map<std::string, std::string>;
inline Tree snapshotTree(const std::filesystem::path& root) {
    namespace fs = std::filesystem;
    Tree tree;
    if (!fs::exists(fs::symlink_status(root))) {
        return tree;
    }
    for (const auto& entry : fs::recursive_directory_iterator(root)) {
        std::string relative = entry.path().lexically_relative(root).string();
        if (entry.is_symlink()) {
            tree[relative] = "-> " + fs::read_symlink(entry.path()).string();
        } else if (entry.is_directory()) {
            tree[relative] = "/";
        } else {
            tree[relative] = readText(entry.path().string());
        }
    }
    return tree;
}

// Asks done() until it holds (true) or the timeout passes (false). Between asks, waitForNews(left)
// waits up to left for what could change the answer (a bus, a pipe) and answers false once nothing
// more can come; without it, done() is asked every 20 ms (for files other processes write).
inline bool pollUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout,
                      const std::function<bool(std::chrono::milliseconds)>& waitForNews = {}) {
    using namespace std::chrono;
    const auto deadline = steady_clock::now() + timeout;
    for (;;) {
        if (done()) {
            return true;
        }
        const auto left = duration_cast<milliseconds>(deadline - steady_clock::now());
        if (left <= 0ms) {
            return false;
        }
        if (!waitForNews) {
            std::this_thread::sleep_for(std::min(left, 20ms));
        } else if (!waitForNews(left)) {
            return done();
        }
    }
}

}  // namespace tavrix::test
