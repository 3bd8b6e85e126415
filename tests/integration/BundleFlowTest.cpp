// The daemon's main job as clients see it: a behavior ID set with a packed bundle ends with the
// right carrier file linked into the mobile home and one notification, nothing changes when nothing
// changed, and payloads chosen to hurt leave it serving.
#include <sys/stat.h>
#include <sys/types.h>

#include <algorithm>
#include <fstream>
#include <functional>
#include <iostream>
#include <map>
#include <random>
#include <set>
#include <thread>
#include <tuple>

#include "BusFixture.h"
#include "HostilePropertyLists.h"
#include "TestSupport.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::integration {
namespace {

namespace fs = std::filesystem;

std::string matchResult(const char* changeType) {
    return std::string("Carrier Bundle Match Result: ") + changeType;
}

// A base carrier file whose overlay section lists "abc" and "Listed-Too".
plist::Dictionary baseCarrierFile(const std::string& name) {
    plist::Dictionary economy = {
        {"SupportedBehaviorIDs", plist::Array{"ABC", "Listed-Too"}},
        {"OverrideConfiguration",
         plist::Dictionary{
             {"CarrierName", name + " Economy"},
             {"Data", plist::Dictionary{{"MaxRate", 1}, {"_Exclude", plist::Array{"Boost"}}}}}},
    };
    return {
        {"CarrierName", name},
        {"Data", plist::Dictionary{{"MaxRate", 5}, {"Boost", true}}},
        {"BehaviorOverrides", plist::Dictionary{{"Economy", economy}}},
    };
}

class BundleFlowTest : public BusFixture {
  protected:
    // The bundle packed as senders pack it, with an "overrides_" file for the test device's
    // hardware model when asked.
    std::vector<std::uint8_t> packBundle(const std::string& version, bool deviceOverlay = false) {
        fs::path source = device().base() / ("src-" + version);
        writeBundle(source, version, baseCarrierFile("Bundle " + version));
        if (deviceOverlay) {
            plist::Dictionary overlay = {{"Data", plist::Dictionary{{"MaxRate", 8}}}};
            EXPECT_TRUE(plist::writeFile((source / "overrides_T71AP_X1.plist").string(),
                                         plist::Value(overlay)));
        }
        return pack(source);
    }

    Result<plist::Value> linkedCarrierFile() {
        return plist::readFile(at(kPreferencesLink).string());
    }

    // The change type of the last bundle match in the log.
    std::string lastMatchResult() const {
        const std::string prefix = "Carrier Bundle Match Result: ";
        auto lines = daemonLogLines();
        for (auto line = lines.rbegin(); line != lines.rend(); ++line) {
            if (line->starts_with(prefix)) {
                return line->substr(prefix.size());
            }
        }
        return {};
    }

    struct stat linkStat(const fs::path& path) {
        struct stat info {};
        EXPECT_EQ(::lstat(path.c_str(), &info), 0) << path;
        return info;
    }
};

// The first set installs, overlays, links and notifies once; the same call again changes nothing.
TEST_F(BundleFlowTest, FirstSetLinksTheOverlaidCarrierFileAndRepeatingItChangesNothing) {
    device().writeDaemonPreferences({{"EnableSupport", true}});
    // Entries that name the bundle directory from outside (by "..", by an absolute path) are
    // part of the bundle, as if the archive were extracted in place.
    const fs::path source = device().base() / "src-10";
    writeBundle(source, "10", baseCarrierFile("Bundle 10"));
    test::writeText(source / "Climbs.plist", "climbs");
    test::writeText(source / "Absolute.plist", "absolute");
    const std::string userBundle = at(kUserBundle).string();
    auto payload = pack(source, {"-P", "-s", ",^\\./Climbs,../Default.bundle/Climbs,", "-s",
                                 ",^\\./Absolute," + userBundle + "/Absolute,"});
    fs::path payloadFile = device().base() / "payload.tgz";
    test::writeText(payloadFile, std::string(payload.begin(), payload.end()));
    const std::vector<std::string> setID = {"set-id", "AbC", "--bundle", payloadFile.string()};

    // First without a payload: said before the bundle manager starts.
    CommandResult withoutPayload = tavrixctl({"set-id", "AbC"});
    ASSERT_EQ(withoutPayload.status, 0) << withoutPayload.output;
    CommandResult first = tavrixctl(setID);
    ASSERT_EQ(first.status, 0) << first.output;
    EXPECT_EQ(first.output,
              "yes\nextracted " + std::to_string(payload.size()) + " bytes into the user bundle\n");
    EXPECT_TRUE(waitForLogLine(matchResult("kBundleChangeTypeUpdate")));
    EXPECT_TRUE(watcher().waitForNotification(kChanged, 1, 5s));

    const fs::path overlayFile = at(kOverlayDirectory) / "id+behavior+Default.bundle+abc+10.plist";
    // The log lines are part of the design: each flow's lines once, in order, others between.
    const std::string staged = at("/tmp/behaviorbundle_zipped.tgz").string();
    const std::pair<const char*, std::vector<std::string>> flows[] = {
        {"first use", {"No bundle data given", "Initializing Carrier Bundle Locations"}},
        {"locations",
         {"Initializing Carrier Bundle Locations", "Using " + at(kSystemBundle).string() + " and " +
                                                       userBundle + " for respective locations"}},
        {"payload",
         {"Behavior bundle data is received " + std::to_string(payload.size()),
          "Writing the zipped file into: /tmp/behaviorbundle_zipped.tgz",
          "Successfully wrote the KW Data to file: " + staged}},
        {"reset",
         {"=========================== Potentially Resetting Behavior Bundle "
          "===========================",
          "Behavior ID provided: abc", "Is the matching bundle found: Yes",
          "Dump state for the bundle after multimode overlay",
          "Bundle Compare decision kBundleChangeTypeUpdate",
          "Dump state of the bundle being linked", matchResult("kBundleChangeTypeUpdate")}},
        {"behavior overlay",
         {"Overlay key: 'abc'", "Overridden filename prefix: id+behavior+Default.bundle+abc",
          "Overridden file does not exist",
          "The overridden file was successfully written to " + overlayFile.string(),
          "Successfully generated the carrier plist"}},
        {"links",
         {"Establishing bundle " + at(kBundleLink).string() + ". Symlink points to " + userBundle,
          "Establishing pref " + at(kPreferencesLink).string() + ". Symlink points to " +
              overlayFile.string(),
          "Dump state of the bundle being linked"}},
    };
    const std::vector<std::string> logged = daemonLogLines();
    for (const auto& [flow, lines] : flows) {
        auto position = logged.begin();
        for (const std::string& line : lines) {
            position = std::find(position, logged.end(), line);
            ASSERT_NE(position, logged.end()) << flow << ": missing in order: " << line;
            ++position;
        }
    }
    // Nothing on the catalog: a launch without its settings does not look for them.
    EXPECT_EQ(countLogLinesContaining("there is no settings file"), 0);
    EXPECT_EQ(test::readText(at(kUserBundle) / "Climbs.plist"), "climbs");
    EXPECT_EQ(test::readText(at(kUserBundle) / "Absolute.plist"), "absolute");
    EXPECT_TRUE(fs::exists(at(kUserBundle) / "behavior.plist"));
    EXPECT_EQ(linkTarget(kBundleLink), at(kUserBundle).string());
    EXPECT_EQ(linkTarget(kPreferencesLink), overlayFile.string());
    auto linked = linkedCarrierFile();
    ASSERT_TRUE(linked);
    EXPECT_EQ(linked->find("BehaviorOverrides"), nullptr);
    EXPECT_EQ(*linked->find("CarrierName"), plist::Value("Bundle 10 Economy"));
    EXPECT_EQ(*linked->find("Data"), plist::Value(plist::Dictionary{{"MaxRate", 1}}));
    // Clients read the linked carrier file as the behavior settings.
    EXPECT_EQ(client().copyTavrixValue("CarrierName"),
              std::optional<plist::Value>("Bundle 10 Economy"));

    // The generated file stays as written, in a directory others may read.
    EXPECT_EQ(fs::status(at(kOverlayDirectory)).permissions(), fs::perms(0755));
    const struct stat bundleLinkBefore = linkStat(at(kBundleLink));
    const struct stat preferencesLinkBefore = linkStat(at(kPreferencesLink));
    const struct stat overlayBefore = linkStat(overlayFile);
    CommandResult second = tavrixctl(setID);
    ASSERT_EQ(second.status, 0) << second.output;
    EXPECT_TRUE(waitForLogLine(matchResult("kBundleChangeTypeNoChange")));
    EXPECT_FALSE(watcher().waitForNotification(kChanged, 2, 1s));
    EXPECT_EQ(linkStat(at(kBundleLink)).st_ino, bundleLinkBefore.st_ino);
    EXPECT_EQ(linkStat(at(kPreferencesLink)).st_ino, preferencesLinkBefore.st_ino);
    EXPECT_EQ(linkStat(overlayFile).st_ino, overlayBefore.st_ino);

    // A payload that is no archive, piped in: the ID is accepted, the payload reported as not
    // extracted and the exit status says so (Python reads the JSON).
    CommandResult broken = throughPython(
        {"set-id", "AbC", "--bundle", "-", "--json"},
        "answer[\"Accepted\"], answer[\"Extracted\"], len(answer[\"Reason\"]) > 0", "garbage");
    EXPECT_EQ(broken.status, 1) << broken.output;
    EXPECT_EQ(broken.output, "True False True\n");
}

// A real directory where the bundle link belongs is left alone until it is gone. An unlisted and a
// listed ID differ by the behavior bit only: an override switch. The device overlay keeps the
// overlay section, and a listed ID's overlay built on it drops it.
TEST_F(BundleFlowTest, OverlayChangesRelinkOnceTheBundleLinkCanBeMade) {
    auto caller = client();
    fs::create_directories(at(kBundleLink) / "keep");
    ASSERT_TRUE(caller.setTavrixID("abc", packBundle("10")));
    EXPECT_TRUE(fs::is_directory(at(kBundleLink) / "keep"));
    EXPECT_FALSE(fs::exists(fs::symlink_status(at(kPreferencesLink))));
    EXPECT_EQ(watcher().notificationCount(kChanged), 0);
    fs::remove_all(at(kBundleLink));

    const fs::path overlays = at(kOverlayDirectory);
    const std::string baseFile = (at(kUserBundle) / "behavior.plist").string();
    const std::tuple<const char*, const char*, std::string> steps[] = {
        {"not-listed", "kBundleChangeTypeUpdate", baseFile},
        {"abc", "kBundleChangeTypeOverrideSwitch",
         (overlays / "id+behavior+Default.bundle+abc+10.plist").string()},
        {"not-listed", "kBundleChangeTypeOverrideSwitch", baseFile},
    };
    for (const auto& [id, changeType, carrierFile] : steps) {
        ASSERT_TRUE(caller.setTavrixID(id, std::nullopt));
        EXPECT_EQ(linkTarget(kPreferencesLink), carrierFile) << id;
        EXPECT_EQ(lastMatchResult(), changeType) << id;
    }
    EXPECT_TRUE(watcher().waitForNotification(kChanged, 3, 5s));
    EXPECT_EQ(linkTarget(kBundleLink), at(kUserBundle).string());

    ASSERT_TRUE(caller.setTavrixID("not-listed", packBundle("10", /*deviceOverlay=*/true)));
    EXPECT_EQ(linkTarget(kPreferencesLink),
              (overlays / "device+behavior+Default.bundle+T71AP+10.plist").string());
    auto deviceOverlaid = linkedCarrierFile();
    ASSERT_TRUE(deviceOverlaid);
    EXPECT_NE(deviceOverlaid->find("BehaviorOverrides"), nullptr);
    EXPECT_EQ(*deviceOverlaid->find("Data"),
              plist::Value(plist::Dictionary{{"MaxRate", 8}, {"Boost", true}}));

    ASSERT_TRUE(caller.setTavrixID("abc", std::nullopt));
    EXPECT_EQ(lastMatchResult(), "kBundleChangeTypeUpdate");
    EXPECT_EQ(linkTarget(kPreferencesLink),
              (overlays / "device+id+behavior+Default.bundle+abc+T71AP+10.plist").string());
    auto both = linkedCarrierFile();
    ASSERT_TRUE(both);
    EXPECT_EQ(both->find("BehaviorOverrides"), nullptr);
    EXPECT_EQ(*both->find("Data"), plist::Value(plist::Dictionary{{"MaxRate", 1}}));
}

// Killed anywhere in a SetTavrixID with a large payload, the next launch finds (or makes) one
// whole state, and the call made again links the payload; nothing of the interrupted calls stays.
TEST_F(BundleFlowTest, KilledAnywhereInSetTavrixIDTheNextLaunchFindsOneWholeState) {
    writeBundle(at(kSystemBundle), "9", baseCarrierFile("Bundle 9"));
    // Two versions, each with a large file that does not compress and many small ones.
    auto packLarge = [&](const std::string& version) {
        const fs::path source = device().base() / ("large-" + version);
        writeBundle(source, version, baseCarrierFile("Bundle " + version));
        test::writeText(source / "Resources/bulk.bin",
                        test::randomBytes(3 << 20, std::stoi(version)));
        fs::create_directories(source / "Resources/small");
        for (int i = 0; i < 100; ++i) {
            std::ofstream(source / ("Resources/small/" + std::to_string(i) + ".txt")) << version;
        }
        return pack(source);
    };
    const std::vector<std::pair<std::string, std::vector<std::uint8_t>>> payloads = {
        {"10", packLarge("10")}, {"11", packLarge("11")}};

    const auto started = std::chrono::steady_clock::now();
    ASSERT_TRUE(client().setTavrixID("abc", payloads[0].second));
    const auto callTime = std::chrono::steady_clock::now() - started;

    const unsigned seed = static_cast<unsigned>(std::random_device{}());
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_int_distribution<std::int64_t> pause(
        0, std::chrono::duration_cast<std::chrono::microseconds>(callTime * 5 / 4).count());
    std::map<std::string, int> statesFound;
    for (int iteration = 0; iteration < crashLoopIterations(); ++iteration) {
        SCOPED_TRACE("iteration " + std::to_string(iteration));
        const auto& [version, payload] = payloads[static_cast<std::size_t>(iteration) % 2];
        auto pid = daemonPid();
        ASSERT_TRUE(pid);
        std::thread victim([&, &payload = payload] {
            try {
                client().setTavrixID("abc", payload);
            } catch (const std::exception&) {
                // The daemon died under the call: that is the point.
            }
        });
        std::this_thread::sleep_for(pause(random) * 1us);
        ASSERT_TRUE(killDaemon(*pid));
        victim.join();
        ++statesFound[linkState()];
        // The user bundle is the old one or the new one, whole: never what is left of either.
        std::error_code error;
        EXPECT_EQ(fs::file_size(at(kUserBundle) / "Resources/bulk.bin", error), 3u << 20);
        EXPECT_TRUE(fs::exists(at(kUserBundle) / "Resources/small/99.txt"));

        client().isTavrixBundleSupported();  // a fresh launch
        ASSERT_EQ(linkState(), "links agree");
        EXPECT_TRUE(fs::exists(at(kBundleLink) / "Info.plist"));
        EXPECT_TRUE(linkedCarrierFile());
        EXPECT_TRUE(device().readDaemonPreferences());

        ASSERT_TRUE(client().setTavrixID("abc", payload));
        EXPECT_EQ(linkedVersion(), version);
        EXPECT_EQ(linkTarget(kBundleLink), at(kUserBundle).string());
        EXPECT_TRUE(fs::exists(at(kUserBundle) / "Resources/small/99.txt"));
        EXPECT_EQ(fs::file_size(at(kUserBundle) / "Resources/bulk.bin"), 3u << 20);
    }
    for (const char* leftover : {"/tmp/behaviorbundle_zipped.tgz",
                                 "/var/mobile/Library/TavrixBundles/.Default.bundle.incoming"}) {
        EXPECT_FALSE(fs::exists(at(leftover))) << leftover;
    }
    std::cout << "[ crash loop ] SetTavrixID: " << crashLoopIterations() << " iterations;";
    for (const auto& [state, count] : statesFound) {
        std::cout << " " << state << ": " << count << ";";
    }
    std::cout << " repairs: "
              << countLogLinesContaining("disagree, linking again") +
                     countLogLinesContaining("left by an interrupted change")
              << "\n";
}

// Payloads chosen to hurt leave the daemon answering and small, and its next launch too: that one
// redoes the bundle match from the stored ID, so a payload that stopped one process would stop
// every one after it. An idle daemon holds about 12 MB; under a sanitizer memory is shadowed, so
// the bound there only catches an expansion.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr long kMaxResidentKiB = 640 * 1024;
#else
constexpr long kMaxResidentKiB = 160 * 1024;
#endif

// A carrier file listing many IDs for one large configuration.
plist::Dictionary manyIDsCarrierFile() {
    plist::Array ids;
    for (int i = 0; i < 20000; ++i) {
        ids.push_back(plist::Value("id-" + std::to_string(i)));
    }
    plist::Dictionary configuration;
    for (int i = 0; i < 2000; ++i) {
        configuration.emplace("Key" + std::to_string(i), std::string(40, 'v'));
    }
    plist::Dictionary group = {{"SupportedBehaviorIDs", std::move(ids)},
                               {"OverrideConfiguration", std::move(configuration)}};
    return {{"CarrierName", "Many"},
            {"BehaviorOverrides", plist::Dictionary{{"Group", std::move(group)}}}};
}

struct HostileCase {
    const char* name;
    // Turns a good bundle directory (Info.plist and behavior.plist) into the hostile one.
    std::function<void(const fs::path& bundle)> spoil;
    // A bundle compressed from many zeros: packed by streaming zeros into gzip.
    std::uint64_t zeroFileBytes = 0;
};

void PrintTo(const HostileCase& hostile, std::ostream* out) {
    *out << hostile.name;
}

void replaceWithFifo(const fs::path& file) {
    fs::remove(file);
    ASSERT_EQ(::mkfifo(file.c_str(), 0644), 0);
}

const HostileCase kCases[] = {
    {"FifoAsCarrierFile", [](const fs::path& b) { replaceWithFifo(b / "behavior.plist"); }},
    {"FifoAsInfo", [](const fs::path& b) { replaceWithFifo(b / "Info.plist"); }},
    {"DeepBinaryInfo",
     [](const fs::path& b) {
         test::writeText(b / "Info.plist", test::nestedBinaryList(30000, 1));
     }},
    {"SelfSharingBinaryCarrierFile",
     [](const fs::path& b) {
         test::writeText(b / "behavior.plist", test::nestedBinaryList(40, 2));
     }},
    {"SparseHugeCarrierFile",
     [](const fs::path& b) { fs::resize_file(b / "behavior.plist", std::uintmax_t{100} << 30); }},
    {"ManyIDsForOneConfiguration",
     [](const fs::path& b) {
         ASSERT_TRUE(
             plist::writeFile((b / "behavior.plist").string(), plist::Value(manyIDsCarrierFile())));
     }},
    {"GzipBomb", [](const fs::path&) {}, std::uint64_t{4} << 30},
};

class HostilePayloadTest : public BusFixture, public testing::WithParamInterface<HostileCase> {
  protected:
    std::vector<std::uint8_t> hostilePayload(const HostileCase& hostile) {
        fs::path source = device().base() / "hostile";
        writeBundle(source, "10", {{"CarrierName", "10"}});
        hostile.spoil(source);
        if (hostile.zeroFileBytes == 0) {
            return pack(source);
        }
        fs::path archive = device().base() / "hostile.tgz";
        // One entry of zeros as repeated gzip members: a few MB that expand to gigabytes.
        CommandResult packed = runCommand({"/usr/bin/python3", "-c", R"(
import gzip, sys, tarfile
archive, info, size = sys.argv[1], sys.argv[2], int(sys.argv[3])
chunk = 64 << 20
def entry(name, length):
    header = tarfile.TarInfo(name)
    header.size = length
    return header.tobuf(format=tarfile.USTAR_FORMAT)
data = open(info, "rb").read()
with open(archive, "wb") as out:
    out.write(gzip.compress(entry("Info.plist", len(data)) + data + bytes(-len(data) % 512)))
    out.write(gzip.compress(entry("zeros", size)))
    zeros = gzip.compress(bytes(chunk), 1)
    for _ in range(size // chunk):
        out.write(zeros)
    out.write(gzip.compress(bytes(1024)))
)",
                                           archive.string(), (source / "Info.plist").string(),
                                           std::to_string(hostile.zeroFileBytes)});
        EXPECT_EQ(packed.status, 0) << packed.output;
        std::ifstream in(archive, std::fstream::binary);
        return {std::istreambuf_iterator<char>(in), {}};
    }

    // Every call a client can make is answered, the daemon stays small, and both links lead to
    // files that exist or are not there at all.
    void expectServing(const char* when) {
        auto caller = client();
        EXPECT_TRUE(caller.isTavrixBundleSupported()) << when;
        // Either bundle's settings, or none when no carrier file could be read: answered.
        (void)caller.copyTavrixValue("CarrierName");
        const std::optional<pid_t> pid = daemonPid();
        ASSERT_TRUE(pid) << when;
        std::ifstream status("/proc/" + std::to_string(*pid) + "/status");
        std::string line;
        while (std::getline(status, line) && !line.starts_with("VmHWM:")) {
        }
        ASSERT_TRUE(line.starts_with("VmHWM:")) << when;
        EXPECT_LT(std::stol(line.substr(6)), kMaxResidentKiB) << when;
        for (const char* link : {kBundleLink, kPreferencesLink}) {
            std::error_code error;
            EXPECT_TRUE(!fs::is_symlink(at(link), error) || fs::exists(at(link), error))
                << link << " dangles " << when;
        }
    }
};

TEST_P(HostilePayloadTest, DaemonKeepsServingAndSoDoesItsNextLaunch) {
    const HostileCase& hostile = GetParam();
    device().writeDaemonPreferences({{"EnableSupport", true}});
    writeBundle(at(kSystemBundle), "1", {{"CarrierName", "1"}});
    std::set<std::string> before;
    for (const auto& entry : fs::directory_iterator(device().base())) {
        before.insert(entry.path().filename().string());
    }
    const fs::path previous = device().base() / "hostile-previous";
    writeBundle(previous, "5", {{"CarrierName", "5"}});
    ASSERT_TRUE(client().setTavrixID("id-7", pack(previous)));
    ASSERT_TRUE(client().setTavrixID("id-7", hostilePayload(hostile)));
    expectServing("after the payload");
    if (hostile.zeroFileBytes != 0) {
        // Stopped at a limit before it filled the disk: the bundle before it stays linked.
        EXPECT_EQ(linkedVersion(), "5");
    }

    const std::optional<pid_t> stopped = stopDaemon();
    ASSERT_TRUE(stopped);
    expectServing("at the next launch");
    EXPECT_NE(daemonPid(), stopped);
    // Nothing appeared beside the device root but the payload sources made here.
    for (const auto& entry : fs::directory_iterator(device().base())) {
        const std::string name = entry.path().filename().string();
        EXPECT_TRUE(before.contains(name) || name.starts_with("hostile")) << name;
    }
}

using SmallFileSystemsTest = BusFixture;

// On a home of 40 MiB a bundle still installs (the reserve is a sixteenth of so small a file
// system); one that does not fit, or a full /tmp, keeps the bundle before it linked.
TEST_F(SmallFileSystemsTest, PayloadsThatDoNotFitKeepTheBundleBeforeThem) {
    if (::geteuid() != 0) {
        GTEST_SKIP() << "needs root to mount small file systems";
    }
    const test::TmpfsMount home(at("/var/mobile"), "size=40m");
    ASSERT_TRUE(home.mounted);
    device().writeDaemonPreferences({{"EnableSupport", true}});
    // Random bytes weigh in the payload what they take on disk; zeros hardly at all.
    auto bundleWith = [&](const std::string& version, std::size_t bytes, bool random) {
        const fs::path source = device().base() / ("small-" + version);
        writeBundle(source, version, {{"CarrierName", version}});
        test::writeText(source / "bulk",
                        random ? test::randomBytes(bytes, 7) : std::string(bytes, 0));
        return pack(source, {"-z"});
    };
    ASSERT_TRUE(client().setTavrixID("id-7", bundleWith("5", 1 << 20, true)));
    EXPECT_EQ(linkedVersion(), "5");

    ASSERT_TRUE(client().setTavrixID("id-7", bundleWith("6", 40 << 20, false)));
    EXPECT_EQ(countLogLinesContaining("stopped:"), 1);
    EXPECT_EQ(linkedVersion(), "5");

    const test::TmpfsMount tmp(at("/tmp"), "size=1m");
    ASSERT_TRUE(tmp.mounted);
    test::writeText(tmp.path / "filler", std::string(1 << 20, 'x'));
    ASSERT_TRUE(client().setTavrixID("id-7", bundleWith("7", 2 << 20, true)));
    EXPECT_EQ(countLogLinesContaining("Failed to write the zipped file"), 1);
    EXPECT_EQ(linkedVersion(), "5");
    EXPECT_EQ(client().copyTavrixValue("CarrierName"), std::optional<plist::Value>("5"));
}

INSTANTIATE_TEST_SUITE_P(Payloads, HostilePayloadTest, testing::ValuesIn(kCases),
                         [](const testing::TestParamInfo<HostileCase>& info) {
                             return std::string(info.param.name);
                         });

}  // namespace
}  // namespace tavrix::integration
