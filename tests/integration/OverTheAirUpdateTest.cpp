// Over-the-air bundle updates as a device sees them: a catalog made and signed by the publishing
// tool, served over HTTP on 127.0.0.1, a newer bundle installed over the user bundle and linked,
// and downloads that go wrong leaving the linked bundle as it was.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <signal.h>

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <future>
#include <iostream>
#include <map>
#include <random>
#include <sstream>
#include <thread>

#include "BusFixture.h"
#include "FileSystemTrace.h"
#include "TestSupport.h"
#include "bus/BackgroundJobScheduler.h"
#include "daemon/UpdateCheckScheduler.h"
#include "io/UniqueFd.h"
#include "plist/PropertyListFormat.h"
#include "util/Clock.h"

namespace tavrix::integration {
namespace {

namespace fs = std::filesystem;
using test::readText;
using test::writeText;
using ::testing::StartsWith;

constexpr const char* kAssetCache = "/var/cache/tavrixservicesd/com.zandor.Grellas.TavrixBundles";
constexpr const char* kBehaviorID = "acme.default";
constexpr const char* kPendingInstall = "/var/lib/tavrixservicesd/pending-install.plist";
// Logged once a check's download is done with, installed or not.
constexpr const char* kPurged = "Best candidate asset has been purged";

constexpr double kOneDay = 86400.0;
constexpr double kFifteenDays = 1296000.0;

class OverTheAirUpdateTest : public BusFixture {
  protected:
    void SetUp() override {
        BusFixture::SetUp();
        // A check already armed a few days ahead, so that every re-arm shows.
        device().writeDaemonPreferences(
            {{"EnableSupport", true}, {"NextUpdate", plist::Date{now() + 3 * kOneDay}}});
    }

    static double now() { return Clock::absoluteTimeNow(); }

    void setIDWithBundle(const std::string& version) {
        ASSERT_TRUE(client().setTavrixID(kBehaviorID, pack(writeVersionedBundle(version))));
    }

    // Answers the archive's URL path.
    std::string publish(const std::string& version, std::size_t bulkBytes = 0) {
        return publishSigned(writeVersionedBundle(version, bulkBytes));
    }

    test::Tree userBundleFiles() { return test::snapshotTree(at(kUserBundle)); }

    // What the cache holds besides the kept catalog: downloads, staging and installed assets.
    std::vector<std::string> cachedAssets() {
        std::vector<std::string> names;
        for (const auto& [name, content] : test::snapshotTree(at(kAssetCache))) {
            if (!name.starts_with("catalog.plist")) {
                names.push_back(name);
            }
        }
        return names;
    }

    // Waits until "NextUpdate" is within a minute of now + seconds.
    bool waitForNextUpdateIn(double seconds, std::chrono::milliseconds timeout = 10s) {
        return pollUntil(
            [&] {
                auto next = device().daemonPreference("NextUpdate");
                return next && next->asDate() &&
                       std::fabs(next->asDate()->secondsSinceReferenceDate - (now() + seconds)) <
                           60.0;
            },
            timeout);
    }

    // The installed bundle of this version is linked and read as the behavior settings.
    void expectInstalled(const std::string& version, std::size_t entries = 4) {
        auto installed = userBundleFiles();
        EXPECT_EQ(installed.count("Resources/only-in-" + version + ".txt"), 1u) << version;
        EXPECT_EQ(installed.size(), entries) << "entries of the previous bundle are gone";
        EXPECT_EQ(linkTarget(kBundleLink), at(kUserBundle).string());
        EXPECT_EQ(linkTarget(kPreferencesLink), (at(kUserBundle) / "behavior.plist").string());
        EXPECT_EQ(client().copyTavrixValue("CarrierName"),
                  std::optional<plist::Value>("Bundle " + version));
        // The record goes with the purge, which follows the announcement.
        EXPECT_TRUE(pollUntil([&] { return !fs::exists(at(kPendingInstall)); }, 10s));
    }

    // tavrixctl with --json at the end of the line, where global options may also go; its answer
    // parsed strictly (malformed output or trailing text fails).
    nlohmann::json tavrixctlJson(std::vector<std::string> arguments, int expectedStatus = 0) {
        arguments.push_back("--json");
        CommandResult run = tavrixctl(arguments);
        EXPECT_EQ(run.status, expectedStatus) << run.output;
        return nlohmann::json::parse(run.output);
    }

    std::string checkReason(int expectedStatus = 0) {
        return textAt(tavrixctlJson({"check-update"}, expectedStatus), "Reason");
    }

    void serveCatalog(const std::string& catalog, const std::string& signature) {
        writeText(site() / "catalog.plist", catalog);
        writeText(site() / "catalog.plist.sig", signature);
    }

    static void expectFields(const nlohmann::json& answer,
                             const std::map<std::string, std::string>& fields) {
        for (const auto& [path, text] : fields) {
            EXPECT_EQ(textAt(answer, path), text) << path;
        }
    }

    // The value at a path such as "LinkedBundle.Version": text as it is, anything else as JSON.
    static std::string textAt(const nlohmann::json& answer, std::string path) {
        std::replace(path.begin(), path.end(), '.', '/');
        const nlohmann::json::json_pointer pointer("/" + path);
        return !answer.contains(pointer)     ? "(absent)"
               : answer[pointer].is_string() ? answer[pointer].get<std::string>()
                                             : answer[pointer].dump();
    }

    test::LocalHttpServer& server = catalogServer();
};

// The operator's view after each step: a payload; an update (a second check meanwhile starts
// nothing); nothing newer; a refused catalog, kept across the daemon's exit.
TEST_F(OverTheAirUpdateTest, StatusViewFollowsEachStepAndOutlivesTheDaemon) {
    // On the bus, each check's end comes after the properties that describe it.
    setIDWithBundle("1");
    auto status = tavrixctlJson({"status"});
    expectFields(status, {{"BehaviorID", kBehaviorID},
                          {"Supported", "true"},
                          {"WhyNotSupported", "(absent)"},
                          {"LinkedBundle.Identifier", "com.zandor.tavrix.test"},
                          {"LinkedBundle.Version", "1"},
                          {"LinkedBundle.OverlayType", "kNoOverlay"},
                          {"UserBundleVersion", "1"},
                          {"LastPayload.Extracted", "true"},
                          {"LastCheck", "(absent)"}});
    EXPECT_TRUE(status.contains("NextUpdateCheck") && status.contains("DaemonVersion"));
    ASSERT_TRUE(watcher().waitForNotification(kChanged, 1, 5s));

    const std::string archive = publish("2");
    holdPublished(archive, 0.5);
    nlohmann::json check;
    std::thread operatorCheck([&] { check = tavrixctlJson({"check-update", "--wait", "30"}); });
    ASSERT_TRUE(server.waitForHeldResponse(30s));
    EXPECT_FALSE(client().checkForTavrixBundleUpdate());
    server.releaseHeldResponses();
    operatorCheck.join();
    expectFields(
        check, {{"Started", "true"}, {"Outcome", "installed"}, {"Reason", "installed version 2"}});
    EXPECT_TRUE(watcher().waitForStatus({{"LinkedBundleVersion", "2"},
                                         {"UserBundleVersion", "2"},
                                         {"LastCheckOutcome", "installed"}}));
    EXPECT_EQ(watcher().nextCheckFinished(30s),
              nlohmann::json({"installed", "installed version 2"}));
    ASSERT_TRUE(watcher().waitForNotification(kChanged, 2, 30s));
    expectInstalled("2");
    EXPECT_EQ(cachedAssets(), std::vector<std::string>{});
    EXPECT_TRUE(waitForNextUpdateIn(kFifteenDays));
    expectFields(tavrixctlJson({"status"}),
                 {{"LinkedBundle.Version", "2"}, {"LastCheck.Outcome", "installed"}});

    // Plain output this time.
    CommandResult upToDate = tavrixctl({"check-update", "--wait", "30"});
    EXPECT_EQ(upToDate.status, 0);
    EXPECT_EQ(upToDate.output, "no\nup to date (version 2 installed)\n")
        << "nothing started, nothing to wait for";
    EXPECT_FALSE(watcher().waitForNotification(kChanged, 3, 500ms));

    publish("3");
    std::string signature = readText(site() / "catalog.plist.sig");
    signature[0] = static_cast<char>(signature[0] ^ 1);
    writeText(site() / "catalog.plist.sig", signature);
    check = tavrixctlJson({"check-update"}, 1);
    EXPECT_EQ(textAt(check, "Outcome"), "catalog-refused");
    EXPECT_THAT(textAt(check, "Reason"), StartsWith("catalog refused: bad signature: "));
    EXPECT_EQ(watcher().nextCheckFinished(30s),
              nlohmann::json({"up-to-date", "up to date (version 2 installed)"}));
    EXPECT_TRUE(watcher().waitForStatus(
        {{"LastCheckOutcome", "catalog-refused"}, {"LastCheckReason", textAt(check, "Reason")}}));
    EXPECT_EQ(watcher().nextCheckFinished(30s),
              nlohmann::json({"catalog-refused", textAt(check, "Reason")}));
    EXPECT_TRUE(waitForNextUpdateIn(kFifteenDays, 1s)) << "a refused catalog re-arms nothing";
    // What the daemon recorded is still there after it left and was started again.
    ASSERT_TRUE(stopDaemon(90s));
    expectFields(tavrixctlJson({"status"}),
                 {{"LastCheck.Outcome", "catalog-refused"}, {"LinkedBundle.Version", "2"}});
}

// A failed download re-arms the check a day ahead, a bundle too large for the mobile home fifteen
// days ahead as any install; neither touches the linked bundle, posts or leaves a download.
TEST_F(OverTheAirUpdateTest, FailedUpdatesChangeNothingAndTheNextOneInstallsAsTheDaemonLeaves) {
    const fs::path home = at("/var/mobile");
    const test::TmpfsMount smallHome(home, "size=72m");
    auto armInThreeDays = [&] {
        device().writeDaemonPreferences({{"EnableSupport", true},
                                         {"TavrixID", kBehaviorID},
                                         {"NextUpdate", plist::Date{now() + 3 * kOneDay}}});
    };
    armInThreeDays();
    setIDWithBundle("1");
    ASSERT_TRUE(watcher().waitForNotification(kChanged, 1, 5s));
    const auto installedFiles = userBundleFiles();
    const std::string carrierFile = linkTarget(kPreferencesLink);
    auto expectNothingChanged = [&](const std::string& waitedLine, int seen, double rearmedIn) {
        EXPECT_TRUE(client().checkForTavrixBundleUpdate());
        EXPECT_TRUE(waitForLogLine(waitedLine, 30s, seen + 1));
        EXPECT_TRUE(waitForNextUpdateIn(rearmedIn));
        EXPECT_EQ(userBundleFiles(), installedFiles);
        EXPECT_EQ(linkTarget(kBundleLink), at(kUserBundle).string());
        EXPECT_EQ(linkTarget(kPreferencesLink), carrierFile);
        EXPECT_EQ(client().copyTavrixValue("CarrierName"), std::optional<plist::Value>("Bundle 1"));
        EXPECT_EQ(cachedAssets(), std::vector<std::string>{});
        EXPECT_FALSE(watcher().waitForNotification(kChanged, 2, 200ms));
    };

    fs::path archive = site() / publish("2").substr(std::string("/updates/").size());
    std::string bytes = readText(archive);
    bytes[bytes.size() / 2] = static_cast<char>(bytes[bytes.size() / 2] ^ 0x55);
    writeText(archive, bytes);
    expectNothingChanged("Current operation: Failed", 0, kOneDay);

    if (smallHome.mounted) {
        // Room for the payload's extraction reserve was needed above; now leave 2 MB free.
        const off_t filler = static_cast<off_t>(fs::space(home).available) - (2 << 20);
        io::UniqueFd fd(::open((home / "filler").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
        ASSERT_TRUE(fd);
        ASSERT_EQ(::posix_fallocate(fd.get(), 0, filler), 0);
        armInThreeDays();
        publish("3", 3 << 20);
        expectNothingChanged(kPurged, countLogLines(kPurged), kFifteenDays);
        EXPECT_EQ(countLogLinesContaining("Not enough free space to install"), 1);
        fs::remove(home / "filler");
    } else {
        std::cout << "[ skipped ] a bundle too large for the mobile home (needs root for tmpfs)\n";
    }

    // A good update afterwards still installs, even when the daemon is told to leave while the
    // check fetches the catalog (on the main thread): the check is still answered, and its
    // download installed and announced before the process ends.
    const auto pid = daemonPid();
    ASSERT_TRUE(pid);
    armInThreeDays();
    publish("4");
    holdPublished("/updates/catalog.plist", 0.5);
    auto answer =
        std::async(std::launch::async, [this] { return client().checkForTavrixBundleUpdate(); });
    ASSERT_TRUE(server.waitForHeldResponse(10s));
    ASSERT_EQ(::kill(*pid, SIGTERM), 0);
    server.releaseHeldResponses();
    EXPECT_TRUE(answer.get());
    ASSERT_EQ(waitForDaemonExit(*pid, 30s), std::optional<int>(0));
    // Looked at on disk first: a call would start a daemon that might finish the job itself.
    EXPECT_EQ(userBundleFiles().count("Resources/only-in-4.txt"), 1u);
    EXPECT_EQ(linkTarget(kPreferencesLink), (at(kUserBundle) / "behavior.plist").string());
    EXPECT_TRUE(watcher().waitForNotification(kChanged, 2, 5s));
    EXPECT_TRUE(waitForNextUpdateIn(kFifteenDays));
    expectInstalled("4");
}

// Killed anywhere in an update, the next launch finds whole links and either completes the install
// from the cached download or the next check installs it; nothing is left in the cache.
TEST_F(OverTheAirUpdateTest, KilledAnywhereInAnUpdateTheNextLaunchCompletesOrRedoesIt) {
    constexpr std::size_t kBulk = 2 << 20;
    setIDWithBundle("1");
    ASSERT_TRUE(watcher().waitForNotification(kChanged, 1, 5s));
    publish("2", kBulk);
    const auto started = std::chrono::steady_clock::now();
    ASSERT_TRUE(client().checkForTavrixBundleUpdate());
    ASSERT_TRUE(waitForLogLine(kPurged, 30s));
    const auto updateTime = std::chrono::steady_clock::now() - started;

    const int iterations = crashLoopIterations();
    const unsigned seed = static_cast<unsigned>(std::random_device{}());
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_int_distribution<std::int64_t> pause(
        0, std::chrono::duration_cast<std::chrono::microseconds>(updateTime * 5 / 4).count());
    std::map<std::string, int> statesFound;
    for (int iteration = 0; iteration < iterations; ++iteration) {
        const std::string version = std::to_string(iteration + 3);
        SCOPED_TRACE("version " + version);
        publish(version, kBulk);
        auto pid = daemonPid();
        ASSERT_TRUE(pid);
        EXPECT_TRUE(client().checkForTavrixBundleUpdate());
        std::this_thread::sleep_for(pause(random) * 1us);
        ASSERT_TRUE(killDaemon(*pid));
        const bool marked = fs::exists(device().path(kPendingInstall));
        ++statesFound[linkedVersion() == version ? "installed"
                      : marked                   ? "install interrupted"
                                                 : "not installed"];

        client().isTavrixBundleSupported();  // a fresh launch
        ASSERT_EQ(linkState(), "links agree");
        EXPECT_TRUE(plist::readFile(at(kPreferencesLink).string()));
        EXPECT_TRUE(device().readDaemonPreferences());
        EXPECT_FALSE(fs::exists(device().path(kPendingInstall)));
        if (linkedVersion() != version) {
            const int purged = countLogLines(kPurged);
            EXPECT_TRUE(client().checkForTavrixBundleUpdate());
            // The check has ended once its download is purged.
            EXPECT_TRUE(waitForLogLine(kPurged, 30s, purged + 1));
        }
        expectInstalled(version, 5);
        EXPECT_EQ(cachedAssets(), std::vector<std::string>{});
    }
    EXPECT_EQ(cachedAssets(), std::vector<std::string>{});
    std::cout << "[ crash loop ] update: " << iterations << " iterations;";
    for (const auto& [state, count] : statesFound) {
        std::cout << " " << state << ": " << count << ";";
    }
    std::cout << " repairs: "
              << countLogLinesContaining("Completing the interrupted install") +
                     countLogLinesContaining("disagree, linking again")
              << "\n";
}

// A daemon leaving while it installs an update finishes it; one activated meanwhile by a payload
// (as bytes or, every other round, as a descriptor) acts only once the old one has ended, so the
// payload ends linked, whole and reported; reading its status meanwhile starts nothing either.
TEST_F(OverTheAirUpdateTest, DaemonStartedWhileTheLastOneDrainsActsAfterIt) {
    constexpr std::size_t kBulk = 1 << 20;
    setIDWithBundle("1");
    ASSERT_TRUE(watcher().waitForNotification(kChanged, 1, 5s));
    const int rounds = std::max(1, crashLoopIterations() * 2 / 3);
    for (int round = 0; round < rounds; ++round) {
        const std::string update = std::to_string(2 * round + 2);
        const std::string payload = std::to_string(2 * round + 3);
        SCOPED_TRACE("round " + std::to_string(round));
        const auto pid = daemonPid();
        ASSERT_TRUE(pid);
        const std::string archive = publish(update, kBulk);
        server.holdAgain();
        holdPublished(archive, 0.5);
        ASSERT_TRUE(client().checkForTavrixBundleUpdate());
        ASSERT_TRUE(server.waitForHeldResponse(10s));
        ASSERT_EQ(::kill(*pid, SIGTERM), 0);
        ASSERT_TRUE(waitForNoNameOwner());

        const std::vector<std::uint8_t> packed = pack(writeVersionedBundle(payload, kBulk));
        auto answer = std::async(std::launch::async, [&] {
            if (round % 2 == 0) {
                return client().setTavrixID(kBehaviorID, packed);
            }
            const fs::path file = device().base() / ("payload-" + payload);
            writeText(file, std::string(packed.begin(), packed.end()));
            io::UniqueFd fd(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
            return client().setTavrixIDWithBundleFile(kBehaviorID, fd.get()).extracted;
        });
        ASSERT_TRUE(waitForNameOwner());
        // Meanwhile the new daemon answers what only reads, and says that it waits; its
        // properties leave out the linked bundle, whose reading would start a bundle match.
        EXPECT_TRUE(client().isTavrixBundleSupported());
        expectFields(tavrixctlJson({"status"}),
                     {{"WaitingForPreviousDaemon", "true"}, {"LinkedBundle", "(absent)"}});
        EXPECT_EQ(tavrixctl({"show", "-p", "LinkedBundleVersion", "--value"}).output, "\n");
        server.releaseHeldResponses();
        EXPECT_TRUE(answer.get());
        ASSERT_EQ(waitForDaemonExit(*pid, 70s), std::optional<int>(0));
        server.stopServing(archive);

        // The disk first, then what the new daemon says about it.
        EXPECT_EQ(linkedVersion(), payload);
        EXPECT_EQ(linkState(), "links agree");
        EXPECT_EQ(linkTarget(kBundleLink), at(kUserBundle).string());
        EXPECT_EQ(userBundleFiles(),
                  test::snapshotTree(device().base() / ("bundles/" + payload + "/Default.bundle")));
        // The check the old daemon answered while leaving was installed before it ended.
        expectFields(tavrixctlJson({"status"}),
                     {{"LastCheck.Reason", "installed version " + update},
                      {"LinkedBundle.Version", payload},
                      {"UserBundleVersion", payload}});
    }
    // Every new daemon did find the old one still at work.
    EXPECT_EQ(countLogLines("Another daemon is still finishing its work; waiting for it to end"),
              rounds);
}

// The daemon run under strace, so that the order of its file-system calls can be checked: a power
// cut that keeps the page cache from the disk keeps "old or new" only when that order holds.
class DurabilityProtocolTest : public OverTheAirUpdateTest {
  protected:
    void SetUp() override {
        CommandResult strace = runCommand({"/bin/sh", "-c", "command -v strace"});
        if (strace.status != 0) {
            GTEST_SKIP() << "strace is not installed (scripts/install-deps.sh installs it): the "
                            "order of the daemon's file-system calls is not checked";
        }
        strace.output.pop_back();  // the line break
        // The leak checker of a sanitizer build cannot run under ptrace: off for this daemon.
        const char* sanitizerOptions = std::getenv("ASAN_OPTIONS");
        daemonLaunchPrefix = {"/usr/bin/env",
                              std::string("ASAN_OPTIONS=") +
                                  (sanitizerOptions != nullptr ? sanitizerOptions : "") +
                                  ":detect_leaks=0"};
        // Appending: a daemon launched again must not overwrite the first one's calls.
        daemonLaunchPrefix.insert(daemonLaunchPrefix.end(),
                                  {strace.output, "-f", "-y", "-qq", "-A", "-s", "4096", "-e",
                                   kTracedFileSystemCalls, "-o", trace().string()});
        OverTheAirUpdateTest::SetUp();
    }

    fs::path trace() { return device().base() / "daemon.strace"; }
};

// A payload, an over-the-air update and a reset to a newer system bundle.
TEST_F(DurabilityProtocolTest, PayloadUpdateAndResetWriteInTheDurableOrder) {
    setIDWithBundle("1");
    ASSERT_TRUE(watcher().waitForNotification(kChanged, 1, 10s));
    publish("2");
    ASSERT_TRUE(client().checkForTavrixBundleUpdate());
    ASSERT_TRUE(waitForLogLine(kPurged, 30s));
    EXPECT_EQ(linkedVersion(), "2");
    test::writeBundle(at(kSystemBundle), "9", {{"CarrierName", "System"}});
    ASSERT_TRUE(client().setTavrixID("acme.other", std::nullopt));
    EXPECT_EQ(linkedVersion(), "9");

    // The trace is whole once the daemon and its tracer have ended (the tracer is what the bus
    // launched, and it exits with the daemon's status).
    const auto pid = daemonPid();
    ASSERT_TRUE(pid);
    ASSERT_EQ(::kill(*pid, SIGTERM), 0);
    ASSERT_TRUE(pollUntil(
        [&] {
            const auto launches = daemonLaunches();
            return std::all_of(launches.begin(), launches.end(),
                               [](const auto& launch) { return launch.exitStatus.has_value(); });
        },
        30s));

    const DurabilityReport report = checkDurability(readText(trace()), ".tavrix-write-");
    for (const std::string& violation : report.violations) {
        ADD_FAILURE() << violation;
    }
    // Enough was seen for the rules to mean something: both bundles, the preferences, the links.
    EXPECT_GE(report.renamesIntoPlace, 8);
    EXPECT_GE(report.linksReplaced, 4);
    std::cout << "[ durability ] renames into place: " << report.renamesIntoPlace
              << "; links replaced: " << report.linksReplaced << "; flushes: " << report.flushes
              << "; violations: " << report.violations.size() << "\n";
}

class OverTheAirKeepAliveTest : public OverTheAirUpdateTest {
  protected:
    OverTheAirKeepAliveTest() { idleExitSeconds = 1; }
};

// A daemon started for its scheduled check stays while the catalog is slow (its keep-alive
// transaction open, each 15-second pass saying so) and while the download runs after that
// transaction ends; the install ending on another thread wakes the run loop, so it leaves at once.
TEST_F(OverTheAirKeepAliveTest, ScheduledCheckKeepsTheDaemonUntilTheDownloadIsInstalled) {
    setIDWithBundle("1");
    ASSERT_TRUE(watcher().waitForNotification(kChanged, 1, 5s));
    ASSERT_TRUE(stopDaemon());

    const std::string archive = publish("2");
    holdPublished(archive, 1.0 / 3);
    const std::string catalog = readText(site() / "catalog.plist");
    // About 18 s: past the first pass of the run loop.
    server.serve("/updates/catalog.plist",
                 {.body = catalog, .trickleBytesPerSecond = catalog.size() / 18 + 1});
    Result<plist::Value> settings = plist::readFile(at("/etc/tavrix/AssetCatalog.plist").string());
    ASSERT_TRUE(settings);
    plist::Dictionary patient = *settings->asDictionary();
    patient.insert_or_assign("CatalogTimeoutSeconds", plist::Value(60));
    ASSERT_TRUE(
        plist::writeFile(at("/etc/tavrix/AssetCatalog.plist").string(), plist::Value(patient)));

    // The job's window came while the daemon was away: it fires when the daemon starts.
    const double due = now() - 60.0;
    device().writeDaemonPreferences(
        {{"EnableSupport", true}, {"TavrixID", kBehaviorID}, {"NextUpdate", plist::Date{due}}});
    const std::string jobsFile = bus::BackgroundJobScheduler::jobsFilePathUnder(
        device().root().string(), kUpdateCheckClientName);
    fs::create_directories(fs::path(jobsFile).parent_path());
    plist::Dictionary job{{std::string(bus::kJobWindowStartDate), due},
                          {std::string(bus::kJobWindowEndDate), due + kUpdateCheckWindowSeconds},
                          {std::string(bus::kJobPowerOptimizationLevel), plist::Integer(1)},
                          {std::string(bus::kJobAllowedDuringVoiceCall), true}};
    ASSERT_TRUE(
        plist::writeFile(jobsFile, plist::Value(plist::Dictionary{{kUpdateCheckJobName, job}})));

    const std::string launchEnded =
        "*********** Ended Corvex transaction : TXMinimumLaunchTransaction ***********";
    const int launchesEnded = countLogLines(launchEnded);
    EXPECT_TRUE(client().isTavrixBundleSupported());
    auto second = daemonPid();
    ASSERT_TRUE(second);
    EXPECT_TRUE(
        waitForLogLine("*********** Beginning Corvex transaction : Update Check ***********"));
    constexpr const char* kContinuing = "Tavrix daemon continuing to run - transactions:";
    // A call every 4 s meanwhile.
    pollUntil([&] { return countLogLinesContaining(kContinuing) > 0; }, 20s,
              [&](auto) {
                  EXPECT_TRUE(client().isTavrixBundleSupported());
                  std::this_thread::sleep_for(4s);
                  return true;
              });
    EXPECT_EQ(countLogLinesContaining(kContinuing), 1);
    ASSERT_TRUE(server.waitForHeldResponse(30s));
    EXPECT_TRUE(
        waitForLogLine("*********** Ended Corvex transaction : Update Check ***********", 10s));
    // Past the launch transaction and well past the idle grace, the download still holds it.
    EXPECT_TRUE(waitForLogLine(launchEnded, 20s, launchesEnded + 1));
    EXPECT_FALSE(waitForNoNameOwner(3s)) << "the daemon left in the middle of the download";

    server.releaseHeldResponses();
    EXPECT_TRUE(watcher().waitForNotification(kChanged, 2, 30s));
    EXPECT_TRUE(waitForNoNameOwner(8s)) << "the end of the install did not wake the run loop";
    expectInstalled("2");
    EXPECT_TRUE(waitForNextUpdateIn(kFifteenDays));
    EXPECT_EQ(waitForDaemonExit(*second), std::optional<int>(0));
    EXPECT_EQ(device().keepAliveFlag(), "0\n");
    // Start-up also found "NextUpdate" past and re-armed the job; the check still ran once.
    EXPECT_EQ(countLogLines("*********** Beginning Corvex transaction : Update Check ***********"),
              1);
}

// The release train of docs/asset-catalog.md, run block by block in the operator's directory
// against one device (bucket 37 for version 2 under the doc's serial).
class ReleaseTrainTest : public OverTheAirUpdateTest {
  protected:
    // The "# step:" blocks of the document's release train, by name, in order.
    static std::vector<std::pair<std::string, std::string>> documentedSteps() {
        const std::string doc = readText(TAVRIX_ASSET_CATALOG_DOC);
        const std::size_t start = doc.find("\n## A release train");
        const std::size_t end = doc.find("\n## ", start + 1);
        std::istringstream section(doc.substr(start, end - start));
        std::vector<std::pair<std::string, std::string>> steps;
        bool inBlock = false;
        for (std::string line; std::getline(section, line);) {
            if (line.starts_with("```")) {
                inBlock = line == "```sh";
            } else if (inBlock && line.starts_with("# step: ")) {
                steps.emplace_back(line.substr(8), "");
            } else if (inBlock && !steps.empty()) {
                steps.back().second += line + "\n";
            }
        }
        return steps;
    }

    // Runs the step's block with sh -e where the operator works; its output.
    std::string runStep(const std::string& name) {
        for (const auto& [step, block] : steps_) {
            if (step == name) {
                const std::string tools = fs::path(TAVRIX_CATALOG_TOOL).parent_path().string();
                CommandResult run =
                    runCommand({"/bin/sh", "-e", "-c", "cd \"$0\" && PATH=\"$1:$PATH\" && " + block,
                                device().base().string(), tools});
                EXPECT_EQ(run.status, 0) << name << ":\n" << block << run.output;
                return run.output;
            }
        }
        ADD_FAILURE() << "the release train has no step " << name;
        return "";
    }

    // The device trusts these keys (identifier to the public key file keygen wrote).
    void trustKeys(const std::map<std::string, fs::path>& keys) {
        plist::Dictionary trusted;
        for (const auto& [identifier, file] : keys) {
            const std::string publicKey = readText(file);
            trusted.emplace(identifier, publicKey.substr(0, publicKey.find('\n')));
        }
        writeCatalogSettings({{"TrustedKeys", std::move(trusted)}});
    }

    std::vector<std::pair<std::string, std::string>> steps_ = documentedSteps();
};

TEST_F(ReleaseTrainTest, TheDocumentedReleaseTrainRunsAgainstADevice) {
    std::vector<std::string> names;
    for (const auto& step : steps_) {
        names.push_back(step.first);
    }
    ASSERT_EQ(names,
              (std::vector<std::string>{"keygen", "publish", "bucket", "widen", "refresh",
                                        "publish-next", "withdraw", "rotate-keygen", "rotate"}));
    const fs::path base = device().base();
    setIDWithBundle("1");
    ASSERT_TRUE(watcher().waitForNotification(kChanged, 1, 5s));
    writeVersionedBundle("2");
    writeVersionedBundle("3");

    runStep("keygen");
    trustKeys({{"release-2026", base / "release-2026.pub"}});
    runStep("publish");
    // The device of the bucket step: 37 by the documented formula (the SHA-256 of "TX-00002\n2").
    const std::string bucketBlock = steps_[2].second;
    const std::string serialNumber =
        bucketBlock.substr(bucketBlock.find("bucket ") + 7,
                           bucketBlock.find(" 2\n") - bucketBlock.find("bucket ") - 7);
    device().writeDeviceInfo(false, serialNumber);
    EXPECT_EQ(runStep("bucket"), "37\n") << "the train needs a device between 5 and 50 %";
    expectFields(tavrixctlJson({"check-update"}),
                 {{"Outcome", "held-back"},
                  {"Reason",
                   "held back by a staged rollout (5 %): version 2 is not offered to "
                   "this device yet"}});
    EXPECT_EQ(textAt(tavrixctlJson({"status"}), "LastCheck.Outcome"), "held-back");

    const test::Tree archives = test::snapshotTree(site() / "archives");
    runStep("widen");
    EXPECT_EQ(test::snapshotTree(site() / "archives"), archives) << "nothing was packed again";
    EXPECT_EQ(textAt(tavrixctlJson({"check-update", "--wait", "30"}), "Reason"),
              "installed version 2");
    ASSERT_TRUE(watcher().waitForNotification(kChanged, 2, 30s));
    expectInstalled("2");

    const std::string widened = readText(site() / "catalog.plist");
    const std::string widenedSignature = readText(site() / "catalog.plist.sig");
    EXPECT_NE(runStep("refresh").find("catalog is good"), std::string::npos);
    EXPECT_EQ(checkReason(), "up to date (version 2 installed)");
    const std::string refreshed = readText(site() / "catalog.plist");
    const std::string refreshedSignature = readText(site() / "catalog.plist.sig");
    serveCatalog(widened, widenedSignature);
    EXPECT_THAT(checkReason(1), StartsWith("catalog refused: rollback: "));
    serveCatalog(refreshed, refreshedSignature);

    // This device fetches the catalog naming version 3 just before it is withdrawn.
    runStep("publish-next");
    std::string archive3;
    for (const auto& [name, content] : test::snapshotTree(site() / "archives")) {
        archive3 = archives.contains(name) ? archive3 : "archives/" + name;
    }
    holdPublished("/updates/catalog.plist", 0.5);
    holdPublished("/updates/catalog.plist.sig", 1);  // the signature as it is now
    auto answer =
        std::async(std::launch::async, [this] { return client().checkForTavrixBundleUpdate(); });
    ASSERT_TRUE(server.waitForHeldResponse(30s));
    runStep("withdraw");
    server.releaseHeldResponses();
    EXPECT_TRUE(answer.get());
    server.stopServing("/updates/catalog.plist");
    server.stopServing("/updates/catalog.plist.sig");
    ASSERT_TRUE(watcher().waitForNotification(kChanged, 3, 30s));
    expectInstalled("3");
    // A device still on version 2 asks after the withdrawal and never sees version 3.
    // (The payload keeps the bundle's path, so the running daemon keeps its linked version; a
    // fresh one reads version 2 from the link.)
    setIDWithBundle("2");
    ASSERT_EQ(linkedVersion(), "2");
    ASSERT_TRUE(stopDaemon(90s));
    EXPECT_EQ(checkReason(), "up to date (version 2 installed)");
    EXPECT_TRUE(fs::exists(site() / archive3)) << "the previous catalog still names it";

    runStep("rotate-keygen");
    trustKeys(
        {{"release-2026", base / "release-2026.pub"}, {"release-2027", base / "release-2027.pub"}});
    runStep("rotate");
    EXPECT_FALSE(fs::exists(site() / archive3)) << "no catalog being served names it any more";
    trustKeys({{"release-2027", base / "release-2027.pub"}});
    EXPECT_EQ(checkReason(), "up to date (version 2 installed)");
    // The old key is revoked with its removal.
    serveCatalog(refreshed, refreshedSignature);
    EXPECT_THAT(checkReason(1), StartsWith("catalog refused: unknown key: "));
    EXPECT_EQ(linkedVersion(), "2");
}

}  // namespace
}  // namespace tavrix::integration
