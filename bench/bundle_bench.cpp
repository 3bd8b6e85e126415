// The daemon's main job, timed: SetTavrixID with a 1 MB bundle payload end to end over a private
// bus against bsdtar extracting the same payload; a repeated SetTavrixID that changes nothing
// (round trip and the daemon's own CPU time per call); and mergeDictionaries of two 10,000-key
// dictionaries against libplist parsing the same base once.
#include <plist/plist.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <random>
#include <string>
#include <vector>

#include "BenchSupport.h"
#include "DaemonBench.h"
#include "bundle/OverlayConfiguration.h"
#include "client/TavrixClient.h"
#include "plist/PropertyListFormat.h"

using namespace tavrix;
using bench::readBytes;
using bench::runProgram;
using bench::writeBytes;

namespace {

namespace fs = std::filesystem;

constexpr int kPayloadRuns = 15;
constexpr int kNoChangeRuns = 300;
constexpr int kMergeRuns = 30;
constexpr std::size_t kMergeKeys = 10000;

// A bundle of about 1 MB packed: its carrier file with an overlay section for the ID used, and
// incompressible resources, as bundles carry images and certificates.
fs::path makePayload(const fs::path& work) {
    const fs::path bundle = work / "payload-source";
    plist::Dictionary groups = {
        {"Economy", plist::Dictionary{{"SupportedBehaviorIDs", plist::Array{"bench-id"}},
                                      {"OverrideConfiguration",
                                       plist::Dictionary{{"CarrierName", "Bench Economy"}}}}}};
    fs::create_directories(bundle);
    plist::writeFile((bundle / "Info.plist").string(),
                     plist::Value(plist::Dictionary{{"QZBundleIdentifier", "bench.bundle"},
                                                    {"QZBundleVersion", "10"}}));
    plist::writeFile(
        (bundle / "behavior.plist").string(),
        plist::Value(plist::Dictionary{{"CarrierName", "Bench"}, {"BehaviorOverrides", groups}}));
    std::mt19937 random(7);
    for (int i = 0; i < 16; ++i) {
        std::string blob(64 * 1024, '\0');
        for (char& byte : blob) {
            byte = static_cast<char>(random());
        }
        writeBytes(bundle / "Resources" / ("blob" + std::to_string(i) + ".bin"), blob);
    }
    const fs::path payload = work / "payload.tgz";
    runProgram({"bsdtar", "-czf", payload.string(), "-C", bundle.string(), "."});
    return payload;
}

// A device root with the mobile user and no cellular radio, behavior bundles enabled.
void makeDeviceRoot(const fs::path& root) {
    writeBytes(root / "etc/passwd", "mobile:x:" + std::to_string(::getuid()) + ":" +
                                        std::to_string(::getgid()) +
                                        ":Mobile:/var/mobile:/usr/sbin/nologin\n");
    fs::create_directories(root / "etc/tavrix");
    plist::writeFile(
        (root / "etc/tavrix/DeviceInfo.plist").string(),
        plist::Value(plist::Dictionary{
            {"contains-cellular-radio", false}, {"DeviceClass", "Tablet"}, {"HWModelStr", "B1"}}));
    fs::create_directories(root / "var/mobile/Library/Preferences");
    fs::create_directories(root / "tmp");
}

// User plus system CPU time of a process, in microseconds.
double cpuMicros(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(in)), {});
    std::size_t close = text.rfind(')');
    if (close == std::string::npos) {
        return 0;
    }
    std::vector<std::string> fields;
    std::string field;
    for (std::size_t i = close + 2; i <= text.size(); ++i) {
        if (i == text.size() || text[i] == ' ') {
            fields.push_back(field);
            field.clear();
        } else {
            field += text[i];
        }
    }
    // utime and stime are the 14th and 15th fields of the line (11th and 12th after the name).
    double ticks = std::stod(fields.at(11)) + std::stod(fields.at(12));
    return ticks * 1e6 / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

pid_t daemonPid(const std::string& address) {
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
    return static_cast<pid_t>(std::atol(line));
}

void benchPayloads(const fs::path& work) {
    const fs::path root = work / "root";
    makeDeviceRoot(root);
    const fs::path payloadFile = makePayload(work);
    const std::string payloadText = readBytes(payloadFile);
    const std::vector<std::uint8_t> payload(payloadText.begin(), payloadText.end());

    auto bus = bench::startDaemonBus(work, root);
    auto client = client::TavrixClient::connectToAddress(bus->address());

    const fs::path extracted = work / "bsdtar-out";
    double ours =
        bench::medianMicros(kPayloadRuns, [&] { client.setTavrixID("bench-id", payload); });
    double peer = bench::medianMicros(kPayloadRuns, [&] {
        fs::remove_all(extracted);
        fs::create_directories(extracted);
        runProgram({"bsdtar", "-xzf", payloadFile.string(), "-C", extracted.string()});
    });
    bench::printHeader("Bundle payload: SetTavrixID end to end vs bsdtar -xzf (tmpfs)");
    char what[96];
    std::snprintf(what, sizeof what, "%.2f MB payload, SetTavrixID vs bsdtar",
                  static_cast<double>(payload.size()) / 1e6);
    bench::printRow(what, ours / 1000, peer / 1000, "ms", "<=1.5x");

    const pid_t pid = daemonPid(bus->address());
    client.setTavrixID("bench-id", std::nullopt);
    double cpuBefore = cpuMicros(pid);
    double roundTrip =
        bench::medianMicros(kNoChangeRuns, [&] { client.setTavrixID("bench-id", std::nullopt); });
    double cpuPerCall = (cpuMicros(pid) - cpuBefore) / kNoChangeRuns;
    double ping = bench::medianMicros(kNoChangeRuns, [&] { client.isTavrixBundleSupported(); });
    bench::printRow("SetTavrixID, no change: round trip", roundTrip, ping, "us", "peer=call");
    std::printf("  %-44s %11.0f us %14s %8s %8s\n", "SetTavrixID, no change: daemon CPU per call",
                cpuPerCall, "-", "-", "<1000us");
}

void benchMerge() {
    plist::Dictionary base;
    plist::Dictionary overlay;
    for (std::size_t i = 0; i < kMergeKeys; ++i) {
        std::string key = "Key" + std::to_string(i);
        base.emplace(key, plist::Dictionary{{"Value", static_cast<long long>(i)}, {"Name", key}});
        // Half the overlay's keys meet a base dictionary (recursive merge), half are new.
        std::string overlayKey = i % 2 == 0 ? key : "New" + std::to_string(i);
        overlay.emplace(overlayKey, plist::Dictionary{{"Value", -1}});
    }
    const std::string baseXml = *plist::serialize(plist::Value(base));

    std::size_t mergedSize = 0;
    double ours = bench::medianMicros(
        kMergeRuns, [&] { mergedSize = mergeDictionaries(base, overlay).size(); });
    double peer = bench::medianMicros(kMergeRuns, [&] {
        plist_t parsed = nullptr;
        plist_from_xml(baseXml.data(), static_cast<uint32_t>(baseXml.size()), &parsed);
        plist_free(parsed);
    });
    bench::printHeader("mergeDictionaries vs libplist parsing the base once");
    bench::printRow("merge 10,000 + 10,000 keys (" + std::to_string(mergedSize) + " result)",
                    ours / 1000, peer / 1000, "ms", "-");
}

}  // namespace

int main() {
    return bench::runInScratchDirectory("bundle_bench", [](const fs::path& work) {
        benchPayloads(work);
        benchMerge();
    });
}
