// Over-the-air updates, timed: a 5 MB bundle published by tavrix-catalog and served by python3's
// http.server on 127.0.0.1, installed by the daemon on a private bus (from
// CheckForTavrixBundleUpdate to its announcement) against curl fetching and bsdtar extracting the
// same archive; and packing a 10 MB directory with payload::Archive against bsdtar -czf of the same
// directory.
#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <random>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "BenchSupport.h"
#include "DaemonBench.h"
#include "client/TavrixClient.h"
#include "io/UniqueFd.h"
#include "payload/Archive.h"
#include "plist/PropertyListFormat.h"

using namespace tavrix;
using bench::readBytes;
using bench::runProgram;
using bench::startProgram;
using bench::writeBytes;

namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

constexpr int kUpdateRuns = 7;
constexpr int kPackRuns = 7;
constexpr std::size_t kAssetBytes = 5'000'000;
constexpr std::size_t kPackFiles = 40;
constexpr std::size_t kPackFileBytes = 256 * 1024;  // 40 of them: 10 MiB

std::string randomBytes(std::size_t count, unsigned seed) {
    std::mt19937 random(seed);
    std::string bytes(count, '\0');
    for (char& byte : bytes) {
        byte = static_cast<char>(random());
    }
    return bytes;
}

void mustRun(const std::vector<std::string>& argv) {
    if (runProgram(argv) != 0) {
        throw std::runtime_error(argv[0] + " " + argv[1] + " failed");
    }
}

double median(std::vector<double> samples) {
    std::sort(samples.begin(), samples.end());
    return samples[samples.size() / 2];
}

double millisSince(Clock::time_point start) {
    return std::chrono::duration<double, std::milli>(Clock::now() - start).count();
}

// A port on 127.0.0.1 that nothing listens on now.
int freePort() {
    io::UniqueFd fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    if (!fd || ::bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        ::getsockname(fd.get(), reinterpret_cast<sockaddr*>(&address), &length) != 0) {
        throw std::runtime_error("no free port on 127.0.0.1");
    }
    return ntohs(address.sin_port);
}

bool accepts(int port) {
    io::UniqueFd fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = htons(static_cast<std::uint16_t>(port));
    return fd && ::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
}

// python3 -m http.server on a directory, stopped when the object goes.
class StaticHttpServer {
  public:
    explicit StaticHttpServer(const fs::path& directory) : port_(freePort()) {
        pid_ = startProgram({"python3", "-m", "http.server", "--bind", "127.0.0.1", "--directory",
                             directory.string(), std::to_string(port_)});
        const auto deadline = Clock::now() + std::chrono::seconds(10);
        while (!accepts(port_)) {
            if (Clock::now() > deadline) {
                throw std::runtime_error("python3 -m http.server did not start");
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
    }
    ~StaticHttpServer() {
        ::kill(pid_, SIGTERM);
        ::waitpid(pid_, nullptr, 0);
    }
    StaticHttpServer(const StaticHttpServer&) = delete;
    StaticHttpServer& operator=(const StaticHttpServer&) = delete;

    std::string url(const std::string& path) const {
        return "http://127.0.0.1:" + std::to_string(port_) + path;
    }

  private:
    int port_;
    pid_t pid_ = -1;
};

// Ends the daemon that owns the service's name on the bus at address, so that none outlives the
// benchmark's bus.
void stopDaemon(const std::string& address) {
    std::string command = "busctl --address='" + address +
                          "' status com.zandor.tavrixservicesd 2>/dev/null | sed -n 's/^PID=//p'";
    std::FILE* pipe = ::popen(command.c_str(), "r");
    char line[64] = {};
    if (pipe != nullptr) {
        if (std::fgets(line, sizeof line, pipe) == nullptr) {
            line[0] = '\0';
        }
        ::pclose(pipe);
    }
    const pid_t pid = static_cast<pid_t>(std::atol(line));
    if (pid <= 0 || ::kill(pid, SIGTERM) != 0) {
        return;
    }
    const auto deadline = Clock::now() + std::chrono::seconds(10);
    while (::kill(pid, 0) == 0 && Clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
}

// A bundle of this version: Info.plist, the base carrier file and a 5 MB resource that does not
// compress, as images and certificates do not.
void writeBundle(const fs::path& bundle, int version, const std::string& resource) {
    fs::create_directories(bundle);
    plist::writeFile((bundle / "Info.plist").string(),
                     plist::Value(plist::Dictionary{{"QZBundleIdentifier", "bench.bundle"},
                                                    {"QZBundleVersion", std::to_string(version)}}));
    plist::writeFile(
        (bundle / "behavior.plist").string(),
        plist::Value(plist::Dictionary{{"CarrierName", "Bench " + std::to_string(version)}}));
    if (!resource.empty()) {
        writeBytes(bundle / "Resources/blob.bin", resource);
    }
}

// A device root with the mobile user, no cellular radio, bundles enabled and the catalog's
// settings.
void makeDeviceRoot(const fs::path& root, const std::string& catalogURL,
                    const std::string& publicKey) {
    writeBytes(root / "etc/passwd", "mobile:x:" + std::to_string(::getuid()) + ":" +
                                        std::to_string(::getgid()) +
                                        ":Mobile:/var/mobile:/usr/sbin/nologin\n");
    fs::create_directories(root / "etc/tavrix");
    plist::writeFile(
        (root / "etc/tavrix/DeviceInfo.plist").string(),
        plist::Value(plist::Dictionary{
            {"contains-cellular-radio", false}, {"DeviceClass", "Tablet"}, {"HWModelStr", "B1"}}));
    plist::writeFile(
        (root / "etc/tavrix/AssetCatalog.plist").string(),
        plist::Value(plist::Dictionary{
            {"AssetTypes", plist::Dictionary{{"com.zandor.Grellas.TavrixBundles",
                                              plist::Dictionary{{"CatalogURL", catalogURL},
                                                                {"PublicKey", publicKey}}}}}}));
    fs::create_directories(root / "var/mobile/Library/Preferences");
    plist::writeFile(
        (root / "var/mobile/Library/Preferences/com.zandor.tavrixservices.plist").string(),
        plist::Value(plist::Dictionary{{"EnableSupport", true}}));
    fs::create_directories(root / "tmp");
}

void benchUpdate(const fs::path& work) {
    const fs::path site = work / "site";
    const fs::path bundle = work / "bundle/Default.bundle";
    fs::create_directories(site);
    fs::create_directories(work / "keys");
    mustRun({TAVRIX_CATALOG_TOOL, "keygen", (work / "keys/secret").string(),
             (work / "keys/public").string()});
    std::string publicKey = readBytes(work / "keys/public");
    publicKey.erase(publicKey.find_last_not_of('\n') + 1);

    StaticHttpServer server(site);
    const fs::path root = work / "root";
    makeDeviceRoot(root, server.url("/catalog.plist"), publicKey);
    auto bus = bench::startDaemonBus(work, root);
    // Goes before the bus, also when the benchmark fails.
    struct DaemonStopper {
        const std::string& address;
        ~DaemonStopper() { stopDaemon(address); }
    } stopper{bus->address()};
    auto client = client::TavrixClient::connectToAddress(bus->address());
    int announced = 0;
    auto subscription = client.subscribe([&](const std::string& name) {
        announced += name == "kTVXBehaviorBundleChangedNotification" ? 1 : 0;
    });

    // Version 1 set with the ID, as a client sends it.
    writeBundle(bundle, 1, "");
    mustRun({"bsdtar", "-czf", (work / "payload.tgz").string(), "-C", bundle.string(), "."});
    const std::string payload = readBytes(work / "payload.tgz");
    client.setTavrixID("bench-id", std::vector<std::uint8_t>(payload.begin(), payload.end()));
    client.runUntil([&] { return announced == 1; }, std::chrono::seconds(10));

    const std::string resource = randomBytes(kAssetBytes, 7);
    const fs::path download = work / "curl.tgz";
    const fs::path extracted = work / "bsdtar-out";
    std::vector<double> ours;
    std::vector<double> peer;
    std::size_t archiveBytes = 0;
    for (int run = 0; run < kUpdateRuns; ++run) {
        const int version = run + 2;
        writeBundle(bundle, version, resource);
        mustRun({TAVRIX_CATALOG_TOOL, "publish", site.string(), "--key",
                 (work / "keys/secret").string(), "--fresh", bundle.string()});
        // The only asset of a fresh catalog; its archive is named after its digest.
        const Result<plist::Value> catalog = plist::readFile((site / "catalog.plist").string());
        const std::string archive =
            "/" + *catalog->find("Assets")->asArray()->front().find("ArchiveURL")->asString();
        archiveBytes = fs::file_size(site / archive.substr(1));

        const int before = announced;
        auto start = Clock::now();
        if (!client.checkForTavrixBundleUpdate() ||
            !client.runUntil([&] { return announced > before; }, std::chrono::seconds(60))) {
            throw std::runtime_error("the update of version " + std::to_string(version) +
                                     " was not installed; the daemon's log:\n" + bus->log());
        }
        ours.push_back(millisSince(start));

        fs::remove_all(extracted);
        fs::create_directories(extracted);
        start = Clock::now();
        mustRun({"curl", "-s", "-o", download.string(), server.url(archive)});
        mustRun({"bsdtar", "-xzf", download.string(), "-C", extracted.string()});
        peer.push_back(millisSince(start));
    }
    bench::printHeader(
        "Over-the-air update: check to announcement vs curl -s -o + bsdtar -xzf (tmpfs)");
    char what[96];
    std::snprintf(what, sizeof what, "%.2f MB asset from a signed catalog",
                  static_cast<double>(archiveBytes) / 1e6);
    bench::printRow(what, median(ours), median(peer), "ms", "<=1.2x");
}

void benchPack(const fs::path& work) {
    const fs::path directory = work / "pack-source";
    std::size_t total = 0;
    for (std::size_t i = 0; i < kPackFiles; ++i) {
        // Half resources that do not compress, half text that does, as bundles hold.
        std::string content;
        if (i % 2 == 0) {
            content = randomBytes(kPackFileBytes, static_cast<unsigned>(i));
        } else {
            while (content.size() < kPackFileBytes) {
                content += "<key>Setting" + std::to_string(content.size()) +
                           "</key><string>value</string>\n";
            }
            content.resize(kPackFileBytes);
        }
        writeBytes(directory / ("dir" + std::to_string(i % 4)) / ("file" + std::to_string(i)),
                   content);
        total += content.size();
    }
    std::vector<std::pair<std::string, std::string>> files;
    for (const auto& entry : fs::recursive_directory_iterator(directory)) {
        if (entry.is_regular_file()) {
            files.emplace_back(entry.path().string(),
                               fs::relative(entry.path(), directory).string());
        }
    }
    std::sort(files.begin(), files.end());

    const fs::path ourFile = work / "ours.tgz";
    const fs::path peerFile = work / "peer.tgz";
    std::size_t ourBytes = 0;
    double ours = bench::medianMicros(kPackRuns, [&] {
        auto archive = payload::Archive::initWithMaxUncompressedSize(
            static_cast<std::uint32_t>(total), payload::kArchiveTypeGzip, ourFile.string());
        for (const auto& [path, name] : files) {
            if (!archive->addFile(path, name)) {
                throw std::runtime_error("cannot pack " + path);
            }
        }
        if (!archive->close() || !archive->writeToFile(ourFile.string())) {
            throw std::runtime_error("cannot write " + ourFile.string());
        }
        ourBytes = archive->archiveData().size();
    });
    double peer = bench::medianMicros(kPackRuns, [&] {
        mustRun({"bsdtar", "-czf", peerFile.string(), "-C", directory.string(), "."});
    });
    bench::printHeader("Packing a bundle directory: payload::Archive vs bsdtar -czf (tmpfs)");
    char what[96];
    std::snprintf(what, sizeof what, "%.1f MB in %zu files -> %.1f MB vs %.1f MB",
                  static_cast<double>(total) / 1e6, files.size(),
                  static_cast<double>(ourBytes) / 1e6,
                  static_cast<double>(fs::file_size(peerFile)) / 1e6);
    bench::printRow(what, ours / 1000, peer / 1000, "ms", "-");
}

}  // namespace

int main() {
    return bench::runInScratchDirectory("update_bench", [](const fs::path& work) {
        benchUpdate(work);
        benchPack(work);
    });
}
