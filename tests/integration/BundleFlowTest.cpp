// The daemon's main job as clients see it: a behavior ID set with a packed bundle ends with the
// right carrier file linked into the mobile home and one notification, and nothing changes when
// nothing changed.
#include <sys/stat.h>

#include <algorithm>
#include <fstream>
#include <iostream>
#include <map>
#include <random>
#include <thread>

#include "BusFixture.h"
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

    std::optional<plist::Value> linkedCarrierFile() {
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

// The main flow through tavrixctl: the first set installs, overlays, links and notifies once;
// the same call again reports no change, posts nothing and leaves the links and the generated
// file alone.
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
    const std::vector<std::string> setID = {
        TAVRIX_CTL_PATH, "--address", busAddress(),        "set-id",
        "AbC",           "--bundle",  payloadFile.string()};

    // First without a payload: said before the bundle manager starts.
    CommandResult withoutPayload =
        runCommand({TAVRIX_CTL_PATH, "--address", busAddress(), "set-id", "AbC"});
    ASSERT_EQ(withoutPayload.status, 0) << withoutPayload.output;
    CommandResult first = runCommand(setID);
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
    CommandResult second = runCommand(setID);
    ASSERT_EQ(second.status, 0) << second.output;
    EXPECT_TRUE(waitForLogLine(matchResult("kBundleChangeTypeNoChange")));
    EXPECT_FALSE(watcher().waitForNotification(kChanged, 2, 1s));
    EXPECT_EQ(linkStat(at(kBundleLink)).st_ino, bundleLinkBefore.st_ino);
    EXPECT_EQ(linkStat(at(kPreferencesLink)).st_ino, preferencesLinkBefore.st_ino);
    EXPECT_EQ(linkStat(overlayFile).st_ino, overlayBefore.st_ino);

    // A payload that is no archive, piped in: the ID is accepted, the payload reported as not
    // extracted and the exit status says so (Python reads the JSON).
    CommandResult broken = runCommand(
        {"/bin/bash", "-c",
         "set -o pipefail; echo garbage | '" + std::string(TAVRIX_CTL_PATH) + "' --address '" +
             busAddress() +
             "' set-id AbC --bundle - --json | /usr/bin/python3 -c 'import json, sys; answer = "
             "json.load(sys.stdin); print(answer[\"Accepted\"], answer[\"Extracted\"], "
             "len(answer[\"Reason\"]) > 0)'"});
    EXPECT_EQ(broken.status, 1) << broken.output;
    EXPECT_EQ(broken.output, "True False True\n");
}

// Only the behavior bit differs between an unlisted ID (the base carrier file) and a listed one:
// an override switch, which relinks both ways. (Two listed IDs are the comparison's unit test.)
TEST_F(BundleFlowTest, BehaviorOverlayTransitionsSwitchOrUpdate) {
    auto caller = client();
    const fs::path overlays = at(kOverlayDirectory);
    const std::string baseFile = (at(kUserBundle) / "behavior.plist").string();
    struct Step {
        const char* id;
        const char* changeType;
        std::string carrierFile;
    };
    const Step steps[] = {
        {"not-listed", "kBundleChangeTypeUpdate", baseFile},
        {"abc", "kBundleChangeTypeOverrideSwitch",
         (overlays / "id+behavior+Default.bundle+abc+10.plist").string()},
        {"not-listed", "kBundleChangeTypeOverrideSwitch", baseFile},
    };
    auto payload = packBundle("10");
    bool first = true;
    for (const Step& expected : steps) {
        ASSERT_TRUE(caller.setTavrixID(expected.id, first ? std::optional(payload) : std::nullopt));
        first = false;
        EXPECT_EQ(linkTarget(kPreferencesLink), expected.carrierFile) << expected.id;
        EXPECT_EQ(lastMatchResult(), expected.changeType) << expected.id;
    }
    EXPECT_TRUE(watcher().waitForNotification(kChanged, 3, 5s));
}

// The device overlay file for this hardware model is merged first and keeps the overlay
// section; a listed ID then overlays it, and that file drops the section.
TEST_F(BundleFlowTest, DeviceOverlayKeepsTheSectionAndBehaviorOverlayBuildsOnIt) {
    auto caller = client();
    const fs::path overlays = at(kOverlayDirectory);
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

// A real directory where the bundle link belongs cannot be replaced: answered, and the daemon goes
// on; once it is gone the next call links.
TEST_F(BundleFlowTest, DirectoryInPlaceOfTheBundleLinkIsReportedAndLeftAlone) {
    fs::create_directories(at(kBundleLink) / "keep");
    auto caller = client();
    ASSERT_TRUE(caller.setTavrixID("abc", packBundle("10")));
    EXPECT_TRUE(fs::is_directory(at(kBundleLink) / "keep"));
    EXPECT_FALSE(fs::exists(fs::symlink_status(at(kPreferencesLink))));
    EXPECT_EQ(watcher().notificationCount(kChanged), 0);

    fs::remove_all(at(kBundleLink));
    ASSERT_TRUE(caller.setTavrixID("abc", std::nullopt));
    EXPECT_TRUE(watcher().waitForNotification(kChanged, 1, 5s));
    EXPECT_EQ(linkTarget(kBundleLink), at(kUserBundle).string());
}

// A client's SetTavrixID with a multi-megabyte payload, the daemon killed at a random instant of
// it: every next launch finds (or makes) one whole state: both links resolve, the carrier file is
// in the linked bundle or the generated files and parses, the daemon preferences parse. The call
// made again ends with the payload's bundle linked. Nothing of the interrupted calls stays.
TEST_F(BundleFlowTest, KilledAnywhereInSetTavrixIDTheNextLaunchFindsOneWholeState) {
    writeBundle(at(kSystemBundle), "9", baseCarrierFile("Bundle 9"));
    // Two versions, each with a large file that does not compress and many small ones.
    auto packLarge = [&](const std::string& version) {
        const fs::path source = device().base() / ("large-" + version);
        writeBundle(source, version, baseCarrierFile("Bundle " + version));
        std::mt19937 bytes(static_cast<unsigned>(std::stoi(version)));
        std::string bulk(3 << 20, '\0');
        for (char& byte : bulk) {
            byte = static_cast<char>(bytes());
        }
        fs::create_directories(source / "Resources/small");
        std::ofstream(source / "Resources/bulk.bin", std::fstream::binary) << bulk;
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
        std::this_thread::sleep_for(
            std::uniform_int_distribution<std::int64_t>(
                0, std::chrono::duration_cast<std::chrono::microseconds>(callTime).count() * 5 /
                       4)(random) *
            1us);
        ASSERT_TRUE(killDaemon(*pid));
        victim.join();
        ++statesFound[linkState()];

        client().isTavrixBundleSupported();  // a fresh launch
        ASSERT_EQ(linkState(), "links agree");
        EXPECT_TRUE(fs::exists(at(kBundleLink) / "Info.plist"));
        EXPECT_TRUE(linkedCarrierFile().has_value());
        EXPECT_TRUE(device().readDaemonPreferences().has_value());

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

}  // namespace
}  // namespace tavrix::integration
