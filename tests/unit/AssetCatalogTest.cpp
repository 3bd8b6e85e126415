// The asset catalog binding against a real HTTP server on 127.0.0.1 serving what the publishing
// tool produced.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <functional>
#include <future>
#include <map>
#include <mutex>
#include <thread>
#include <tuple>

#include "ArchiveFixtures.h"
#include "CatalogToolRunner.h"
#include "LocalHttpServer.h"
#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "catalog/AssetCatalog.h"
#include "catalog/AssetCatalogSettings.h"
#include "catalog/CatalogCrypto.h"
#include "util/Clock.h"
#include "device/PlatformRoot.h"
#include "util/SystemLog.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::catalog {
namespace {

namespace fs = std::filesystem;
using test::LocalHttpServer;
using test::readText;
using test::writeText;

constexpr const char* kAssetType = "com.zandor.Grellas.TavrixBundles";
constexpr auto kPatience = std::chrono::seconds(60);

using Assets = std::vector<std::shared_ptr<Asset>>;

LocalHttpServer::Response bodyResponse(std::string body,
                                       std::optional<std::size_t> cutAfter = std::nullopt) {
    LocalHttpServer::Response response;
    response.body = std::move(body);
    response.cutAfterBodyBytes = cutAfter;
    return response;
}

LocalHttpServer::Response statusResponse(int status, std::string reason) {
    LocalHttpServer::Response response;
    response.status = status;
    response.reason = std::move(reason);
    return response;
}

// Collects the reports a handler receives, for waiting on the last one.
class ProgressLog {
  public:
    // The operations received until a completed or failed one, in order.
    std::vector<std::string> waitForLast() {
        std::unique_lock lock(mutex_);
        if (!changed_.wait_for(lock, kPatience, [&] { return finished_; })) {
            ADD_FAILURE() << "no final progress report";
        }
        return operations_;
    }

    std::vector<plist::Dictionary> reports() {
        std::lock_guard lock(mutex_);
        return reports_;
    }

    void record(const plist::Dictionary& progress) {
        std::lock_guard lock(mutex_);
        reports_.push_back(progress);
        auto operation = progress.find(kAssetProgressOperationKey);
        std::string name = operation != progress.end() && operation->second.asString() != nullptr
                               ? *operation->second.asString()
                               : "(none)";
        operations_.push_back(name);
        finished_ = name == kAssetOperationCompleted || name == kAssetOperationFailed;
        changed_.notify_all();
    }

  private:
    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<plist::Dictionary> reports_;
    std::vector<std::string> operations_;
    bool finished_ = false;
};

// A handler that captures its asset, as an update client's does, so that a kept cycle would show.
Asset::ProgressHandler recordingHandler(const std::shared_ptr<ProgressLog>& log,
                                        const std::shared_ptr<Asset>& asset) {
    return [log, asset](const plist::Dictionary& progress) { log->record(progress); };
}

class AssetCatalogTest : public testing::Test {
  protected:
    void SetUp() override {
        std::error_code ignored;
        fs::remove_all(device::resolvePath("/etc/tavrix"), ignored);
        fs::remove_all(device::resolvePath("/var/cache"), ignored);
        fs::remove_all(device::resolvePath(std::string(device::kDaemonStateDirectory)), ignored);
        ASSERT_EQ(tool({"keygen", work / "secret.key", work / "public.key"}), 0);
        ASSERT_EQ(tool({"keygen", work / "new.key", work / "new.pub"}), 0);
        publicKey = readText(work / "public.key");
        publicKey.pop_back();  // the line break
        server.serveDirectory("/catalog/", work.path() / "out");
    }

    int tool(const std::vector<std::string>& arguments) {
        test::ToolRun run = test::runCatalogTool(arguments);
        EXPECT_EQ(run.status, 0) << run.errors;
        return run.status;
    }

    // The type trusts key in the single-key form, or without a key takes catalogs unsigned;
    // extra: top-level settings such as limits.
    void writeSettings(const std::optional<std::string>& key, plist::Dictionary extra = {}) {
        writeTypeSettings(key ? plist::Dictionary{{kSettingsPublicKeyKey, plist::Value(*key)}}
                              : plist::Dictionary{{kSettingsAllowUnsignedKey, plist::Value(true)}},
                          std::move(extra));
    }

    void writeTypeSettings(plist::Dictionary type, plist::Dictionary extra = {}) {
        type.emplace(kSettingsCatalogURLKey, plist::Value(catalogURL()));
        extra.insert_or_assign(kSettingsAssetTypesKey,
                               plist::Value(plist::Dictionary{{kAssetType, type}}));
        writeSettingsValue(plist::Value(std::move(extra)));
    }

    // Serves bytes as the catalog's only archive, listed unsigned with their size and digest.
    void publishArchive(const std::string& bytes) {
        Sha256Digest digest;
        digest.update(bytes);
        plist::Dictionary entry{
            {"ArchiveURL", plist::Value("archive.tgz")},
            {"ArchiveSize", plist::Value(static_cast<long long>(bytes.size()))},
            {"ArchiveSHA256", plist::Value(digest.finishHex())},
            {"Attributes", plist::Value(plist::Dictionary{{"Version", plist::Value("1.0")}})}};
        server.serve("/catalog/archive.tgz", bodyResponse(bytes));
        server.serve("/catalog/catalog.plist",
                     bodyResponse(plist::serialize(plist::Value(plist::Dictionary{
                         {"AssetType", plist::Value(kAssetType)},
                         {"Serial", plist::Value(1)},
                         {"Expires", plist::Value(plist::Date{Clock::absoluteTimeNow() + 3600})},
                         {"Assets", plist::Value(plist::Array{plist::Value(entry)})}}))));
    }

    void writeSettingsValue(const plist::Value& settings) {
        std::string path = device::resolvePath(kAssetCatalogSettingsPath);
        fs::create_directories(fs::path(path).parent_path());
        ASSERT_TRUE(plist::writeFile(path, settings));
    }

    std::string catalogURL() const { return server.url("/catalog/catalog.plist"); }
    std::string out(const std::string& relative) const { return work / ("out/" + relative); }
    std::string typeCache() const {
        return device::resolvePath(kDefaultAssetCacheDirectory) + "/" + kAssetType;
    }

    std::optional<Assets> query(bool localOnly = false) {
        AssetQuery assetQuery(kAssetType);
        assetQuery.setQueriesLocalInformationOnly(localOnly);
        return assetQuery.runQuery();
    }

    // The single asset the catalog answers.
    std::shared_ptr<Asset> onlyAsset() {
        std::optional<Assets> assets = query();
        if (!assets || assets->size() != 1) {
            ADD_FAILURE() << "expected one asset";
            return nullptr;
        }
        return assets->front();
    }

    // Starts the download, sets a handler and waits for the last report.
    std::vector<std::string> download(const std::shared_ptr<Asset>& asset) {
        auto progress = std::make_shared<ProgressLog>();
        asset->beginDownload();
        asset->setProgressHandler(recordingHandler(progress, asset));
        return progress->waitForLast();
    }

    std::size_t logLinesContaining(std::string_view text) const {
        std::size_t count = 0;
        for (const std::string& line : sink.messages()) {
            count += line.find(text) != std::string::npos ? 1 : 0;
        }
        return count;
    }

    // What the cache holds for the type besides the kept catalog.
    std::vector<std::string> cachedAssetEntries() const {
        std::vector<std::string> names;
        std::error_code ignored;
        for (const auto& entry : fs::directory_iterator(typeCache(), ignored)) {
            std::string name = entry.path().filename().string();
            if (!name.starts_with("catalog.plist")) {
                names.push_back(name);
            }
        }
        return names;
    }

    test::TempDir work;
    LocalHttpServer server;
    std::string publicKey;
    CapturingLogSink sink;
    ScopedLogSink guard{sink};
};

// Settings that cannot be used answer no assets, say why once and ask no server. (No settings file
// at all, and a rollout that leaves the device out, show on the real daemon.)
TEST_F(AssetCatalogTest, WithoutUsableSettingsQueriesAnswerNoAssetsAndSayWhyOnce) {
    struct Case {
        const char* name;
        std::function<void()> arrange;
        const char* reason;
    };
    std::vector<Case> cases{
        {"damaged file",
         [] { writeText(device::resolvePath(kAssetCatalogSettingsPath), "<plist><dict><key>"); },
         "not a property list"},
        {"other type only",
         [this] {
             writeSettingsValue(plist::Value(plist::Dictionary{
                 {kSettingsAssetTypesKey,
                  plist::Value(plist::Dictionary{
                      {"other.type",
                       plist::Value(plist::Dictionary{
                           {kSettingsCatalogURLKey, plist::Value("http://x/")}})}})}}));
         },
         "no settings for this asset type"},
        {"URL of the wrong type",
         [this] {
             writeSettingsValue(plist::Value(plist::Dictionary{
                 {kSettingsAssetTypesKey,
                  plist::Value(plist::Dictionary{
                      {kAssetType, plist::Value(plist::Dictionary{
                                       {kSettingsCatalogURLKey, plist::Value(3)}})}})}}));
         },
         "no CatalogURL"},
        {"negative limit",
         [this] {
             writeSettings(std::nullopt, {{kSettingsMaxArchiveEntriesKey, plist::Value(-1)}});
         },
         "MaxArchiveEntries is not an integer"},
        // A key that cannot be read must not quietly turn verification off.
        {"short key",
         [this] { writeSettings(base64Encode(reinterpret_cast<const std::uint8_t*>("short"), 5)); },
         "PublicKey is not 32 bytes"},
        {"short key among trusted keys",
         [this] {
             writeTypeSettings(
                 {{kSettingsTrustedKeysKey,
                   plist::Value(plist::Dictionary{{"good", plist::Value(publicKey)},
                                                  {"bad", plist::Value("c2hvcnQ=")}})}});
         },
         "TrustedKeys entry \"bad\""},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        sink.clear();
        c.arrange();
        for (int attempt = 0; attempt < 2; ++attempt) {
            std::optional<Assets> assets = query();
            ASSERT_TRUE(assets.has_value());
            EXPECT_TRUE(assets->empty());
        }
        EXPECT_EQ(logLinesContaining(c.reason), 1u);
    }
    EXPECT_TRUE(server.requests().empty());
}

// Every way a catalog can be untrustworthy is refused with its own reason in one line, and a
// refused catalog never replaces the copy kept for local queries from the last good one. Keys
// rotate: a catalog signed with a newly trusted key is taken, and once the old key is removed from
// the settings its catalogs are refused.
TEST_F(AssetCatalogTest, UntrustworthyCatalogsAreRefusedWithTheirReasonAndKeysRotate) {
    std::string newKey = readText(work / "new.pub");
    newKey.pop_back();
    auto trusting = [](plist::Dictionary keys) {
        return plist::Dictionary{{kSettingsTrustedKeysKey, plist::Value(std::move(keys))}};
    };
    auto publish = [&](const char* version, const char* key, const char* id) {
        std::string bundle = work / (std::string(version) + "/Default.bundle");
        test::makeBundle(bundle, version, {{"a.plist", version}});
        tool({"publish", work / "out", "--key", work / key, "--key-id", id, "--fresh", bundle});
    };
    writeTypeSettings(trusting({{"old", plist::Value(publicKey)}, {"new", plist::Value(newKey)}}));
    publish("1.0", "secret.key", "old");
    EXPECT_TRUE(query(true).value_or(Assets{nullptr}).empty()) << "nothing is kept before a fetch";
    ASSERT_EQ(query().value_or(Assets()).size(), 1u);
    publish("2.0", "new.key", "new");
    ASSERT_EQ(query().value_or(Assets()).size(), 1u) << "signed with the rotated-in key";
    std::string oldCatalog = readText(out("catalog.plist"));
    std::string oldSignature = readText(out("catalog.plist.sig"));
    writeTypeSettings(trusting({{"new", plist::Value(newKey)}}));
    publish("2.1", "new.key", "new");
    ASSERT_EQ(query().value_or(Assets()).size(), 1u);
    std::string catalog = readText(out("catalog.plist"));
    std::string signature = readText(out("catalog.plist.sig"));

    struct Case {
        const char* name;
        std::function<void()> arrange;
        const char* reason;
    };
    auto serve = [&](const std::string& bytes, const std::optional<std::string>& sig) {
        writeText(out("catalog.plist"), bytes);
        fs::remove(out("catalog.plist.sig"));
        if (sig) {
            writeText(out("catalog.plist.sig"), *sig);
        }
    };
    std::string altered = catalog;
    altered.replace(altered.find("<string>2.1</string>"), 20, "<string>9.0</string>");
    std::vector<Case> cases{
        {"altered catalog", [&] { serve(altered, signature); }, "bad signature"},
        {"no signature", [&] { serve(catalog, std::nullopt); }, "missing signature"},
        {"replayed older serial", [&] { serve(oldCatalog, oldSignature); }, "rollback"},
        {"signed with the removed key", [&] { publish("3.0", "secret.key", "old"); },
         "unknown key"},
        {"no key and no AllowUnsigned",
         [&] {
             serve(catalog, signature);
             writeTypeSettings({});
         },
         "unsigned not allowed"},
        // Only the URL's own scheme is followed.
        {"redirect to another scheme",
         [&] {
             writeTypeSettings(trusting({{"new", plist::Value(newKey)}}));
             LocalHttpServer::Response moved = statusResponse(302, "Found");
             moved.headers = {{"Location", "https://127.0.0.1:" + std::to_string(server.port()) +
                                               "/catalog/catalog.plist"}};
             server.serve("/catalog/catalog.plist", moved);
         },
         "fetch failed"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        sink.clear();
        c.arrange();
        EXPECT_FALSE(query().has_value());
        EXPECT_EQ(logLinesContaining(std::string(": ") + c.reason + ": "), 1u);
    }
    EXPECT_EQ(logLinesContaining("\"https\" not supported"), 1u) << "the redirect was not followed";
    std::size_t requests = server.requests().size();
    std::optional<Assets> kept = query(true);
    ASSERT_TRUE(kept.has_value());
    ASSERT_EQ(kept->size(), 1u);
    EXPECT_EQ(kept->front()->attributes(), (plist::Dictionary{{"Version", plist::Value("2.1")}}));
    EXPECT_EQ(server.requests().size(), requests) << "local queries do not ask the server";

    // A device whose view is frozen notices once the catalog expires, even the kept copy.
    ScopedClockOffset monthLater(std::chrono::hours(24 * 31));
    sink.clear();
    EXPECT_FALSE(query(true).has_value());
    EXPECT_EQ(logLinesContaining(": expired: "), 1u);
}

// A device that fetches the catalog just before a publication and its signature just after takes
// the new pair, not a refusal that would keep it waiting for its next check.
TEST_F(AssetCatalogTest, FetchCaughtBetweenSignatureAndCatalogReplacementTriesAgain) {
    test::makeBundle(work / "b/Default.bundle", "1.0", {{"a.plist", "one"}});
    tool({"publish", work / "out", "--key", work / "secret.key", work / "b/Default.bundle"});
    writeSettings(publicKey);
    LocalHttpServer::Response held = bodyResponse(readText(out("catalog.plist")));
    held.holdAfterBodyBytes = held.body.size() - 1;
    server.serve("/catalog/catalog.plist", held);
    auto assets = std::async(std::launch::async, [this] { return query(); });
    ASSERT_TRUE(server.waitForHeldResponse(kPatience));
    test::makeBundle(work / "c/Default.bundle", "2.0", {{"a.plist", "two"}});
    tool({"publish", work / "out", "--key", work / "secret.key", work / "c/Default.bundle"});
    server.serve("/catalog/catalog.plist", bodyResponse(readText(out("catalog.plist"))));
    server.releaseHeldResponses();
    std::optional<Assets> answered = assets.get();
    ASSERT_TRUE(answered.has_value());
    ASSERT_EQ(answered->size(), 2u);
    EXPECT_EQ(answered->back()->attributes(),
              (plist::Dictionary{{"Version", plist::Value("2.0")}}));
}

// Development setups may take unsigned catalogs, but only when told so, and say so every time.
// A staged rollout shows an asset to the devices under its percentage, the same ones each time,
// and a higher percentage keeps every device a lower one had.
TEST_F(AssetCatalogTest, UnsignedCatalogsAreAnnouncedAndRolloutsAreStablePerDevice) {
    test::makeBundle(work / "b/Default.bundle", "1.0", {{"a.plist", "one"}});
    auto publishAt = [&](const char* percent) {
        tool({"publish", work / "out", "--unsigned", work / "b/Default.bundle", "--rollout",
              percent});
    };
    writeSettings(std::nullopt);
    publishAt("100");
    for (int use = 1; use <= 2; ++use) {
        EXPECT_EQ(query().value_or(Assets()).size(), 1u);
        EXPECT_EQ(logLinesContaining("AllowUnsigned is set"), static_cast<std::size_t>(use));
    }
    // Each device decides the same way every time; raising the share keeps those it had.
    std::map<std::string, bool> at40;
    for (int percent : {40, 70}) {
        publishAt(std::to_string(percent).c_str());
        for (int device = 0; device < 12; ++device) {
            std::string serialNumber = "SN" + std::to_string(device);
            test::writeDeviceTable({{"SerialNumber", serialNumber}});
            bool taking = query().value_or(Assets()).size() == 1;
            EXPECT_EQ(query().value_or(Assets()).size() == 1, taking) << serialNumber;
            EXPECT_TRUE(percent == 40 || taking || !at40[serialNumber]) << serialNumber;
            at40.try_emplace(serialNumber, taking);
        }
    }
    std::size_t taking = std::count_if(at40.begin(), at40.end(), [](auto& e) { return e.second; });
    EXPECT_GT(taking, 0u);
    EXPECT_LT(taking, at40.size());
    fs::remove(device::resolvePath("/etc/tavrix/DeviceInfo.plist"));
}

TEST_F(AssetCatalogTest, DamagedCatalogsAreRefusedAndMalformedEntriesSkipped) {
    writeSettings(std::nullopt, {{kSettingsCatalogTimeoutKey, plist::Value(1)}});
    plist::Dictionary good{{"ArchiveURL", plist::Value("a.tgz")},
                           {"ArchiveSize", plist::Value(10)},
                           {"ArchiveSHA256", plist::Value(std::string(64, 'A'))},
                           {"Attributes", plist::Value(plist::Dictionary{{"Version", "1"}})}};
    auto with = [&](const char* key, plist::Value value) {
        plist::Dictionary entry = good;
        entry.insert_or_assign(key, std::move(value));
        return plist::Value(entry);
    };
    plist::Array entries{
        plist::Value(good),
        plist::Value("not a dictionary"),
        with("ArchiveSize", plist::Value("10")),
        with("ArchiveSize", plist::Value(plist::Integer::fromUnsigned(UINT64_MAX))),
        with("ArchiveSize", plist::Value(0)),
        with("ArchiveSHA256", plist::Value("abc")),
        with("ArchiveURL", plist::Value("file:///etc/passwd")),
        with("ArchiveURL", plist::Value(plist::Data{1, 2})),
        with("Attributes", plist::Value(plist::Array{})),
        with("RolloutPercent", plist::Value(101)),
    };
    auto catalogWith = [&](plist::Value type, plist::Value assets) {
        return plist::serialize(plist::Value(plist::Dictionary{
            {"AssetType", std::move(type)},
            {"Serial", plist::Value(1)},
            {"Expires", plist::Value(plist::Date{Clock::absoluteTimeNow() + 3600})},
            {"Assets", std::move(assets)}}));
    };
    server.serve("/catalog/catalog.plist", bodyResponse(catalogWith(kAssetType, entries)));
    std::optional<Assets> assets = query();
    ASSERT_TRUE(assets.has_value());
    ASSERT_EQ(assets->size(), 1u);
    EXPECT_EQ(assets->front()->attributes(), *good.at("Attributes").asDictionary());
    EXPECT_EQ(logLinesContaining("skipping entry"), entries.size() - 1);

    LocalHttpServer::Response trickling = bodyResponse(std::string(4096, ' '));
    trickling.trickleBytesPerSecond = 2000;
    const std::vector<std::tuple<const char*, LocalHttpServer::Response, const char*>> refused{
        {"not a property list", bodyResponse("\x89PNG garbage"), "not a property list"},
        {"another type", bodyResponse(catalogWith("other.type", entries)), "AssetType is not"},
        {"assets of the wrong type", bodyResponse(catalogWith(kAssetType, plist::Value("x"))),
         "no Assets array"},
        {"over the size cap", bodyResponse(std::string(9u << 20, ' ')), "cannot fetch it"},
        {"no serial",
         bodyResponse(plist::serialize(plist::Value(
             plist::Dictionary{{"AssetType", plist::Value(kAssetType)}, {"Assets", entries}}))),
         "no Serial"},
        {"server error", statusResponse(500, "Oops"), "HTTP status 500"},
        {"trickling server", trickling, "cannot fetch it"},
    };
    for (const auto& [name, response, reason] : refused) {
        SCOPED_TRACE(name);
        sink.clear();
        server.serve("/catalog/catalog.plist", response);
        EXPECT_FALSE(query().has_value());
        EXPECT_EQ(logLinesContaining(reason), 1u);
    }
}

// A download reports its steps in order, installs identical files in a directory of its own and
// purges only that.
TEST_F(AssetCatalogTest, DownloadReportsStepsInOrderInstallsIdenticalFilesAndPurges) {
    std::string payload = test::randomBytes(300 * 1024, 7);
    test::makeBundle(work / "b/Default.bundle", "1.0",
                     {{"a.plist", "<plist/>"}, {"b/deep/payload.bin", payload}});
    tool({"publish", work / "out", "--key", work / "secret.key", work / "b/Default.bundle"});
    writeSettings(publicKey);
    std::shared_ptr<Asset> asset = onlyAsset();
    ASSERT_TRUE(asset);
    // Staging that an ended process left behind is cleared by the next download.
    writeText(typeCache() + "/.abandoned.extracting/a.plist", "old");
    writeText(typeCache() + "/.abandoned.download", "old");

    // Reports made before a handler exists wait for it.
    asset->beginDownload();
    auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (!asset->localURL() && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    auto progress = std::make_shared<ProgressLog>();
    asset->setProgressHandler(recordingHandler(progress, asset));
    std::vector<std::string> operations = progress->waitForLast();

    ASSERT_GE(operations.size(), 4u);
    EXPECT_EQ(operations.front(), kAssetOperationStarted);
    EXPECT_EQ(operations[operations.size() - 2], kAssetOperationInstalling);
    EXPECT_EQ(operations.back(), kAssetOperationCompleted);
    std::int64_t lastBytes = 0;
    std::size_t downloading = 0;
    for (const plist::Dictionary& report : progress->reports()) {
        if (*report.at(kAssetProgressOperationKey).asString() != kAssetOperationDownloading) {
            continue;
        }
        ++downloading;
        std::int64_t bytes = report.at(kAssetProgressBytesWrittenKey).asInteger()->signedValue();
        EXPECT_GT(bytes, lastBytes);
        lastBytes = bytes;
    }
    EXPECT_GE(downloading, 1u);
    EXPECT_LE(downloading, 4u) << "a few reports, not one per chunk";
    EXPECT_EQ(lastBytes, static_cast<std::int64_t>(fs::file_size(out("archives/Default-1.0.tgz"))));

    std::optional<std::string> local = asset->localURL();
    ASSERT_TRUE(local.has_value());
    EXPECT_EQ(readText(*local + "/b/deep/payload.bin"), payload);
    EXPECT_EQ(readText(*local + "/a.plist"), "<plist/>");
    EXPECT_EQ(readText(*local + "/Info.plist"), readText(work / "b/Default.bundle/Info.plist"));
    EXPECT_EQ(cachedAssetEntries().size(), 1u) << "no staging files are left";

    // A second download of the asset has its own directory: purging the first leaves it.
    std::shared_ptr<Asset> second = onlyAsset();
    ASSERT_EQ(download(second).back(), kAssetOperationCompleted);
    ASSERT_TRUE(second->localURL().has_value());
    EXPECT_NE(*second->localURL(), *local);
    std::promise<bool> purged;
    asset->purge([&](bool done) { purged.set_value(done); });
    ASSERT_EQ(purged.get_future().wait_for(kPatience), std::future_status::ready);
    EXPECT_FALSE(asset->localURL().has_value());
    EXPECT_FALSE(fs::exists(*local));
    EXPECT_EQ(readText(*second->localURL() + "/a.plist"), "<plist/>");

    // The handler captured the asset; once the last report is delivered nothing keeps it.
    std::weak_ptr<Asset> weak = asset;
    asset.reset();
    deadline = std::chrono::steady_clock::now() + kPatience;
    while (!weak.expired() && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    EXPECT_TRUE(weak.expired());
}

// Every way a download can go wrong ends in one failure report with one line saying why, no
// local URL and nothing left in the cache. Archives that could reach outside the cache or unpack
// to far more than they weigh are refused whole by the real binding (each entry kind extraction
// refuses is covered where extraction is tested; here, that the binding asks for path-safe
// extraction with its own settings' limits), and a server that trickles is cut off.
TEST_F(AssetCatalogTest, FailedDownloadsReportFailureAndLeaveNothingBehind) {
    const std::string outside = work / "outside";
    writeText(outside + "/secret", "secret");
    std::vector<test::ArchiveItem> manyEntries;
    for (int index = 0; index < 30; ++index) {
        manyEntries.push_back(test::fileItem("f" + std::to_string(index), "x"));
    }
    const std::vector<test::ArchiveItem> plain{test::fileItem("a", test::randomBytes(8192, 7))};
    const std::string archive =
        test::buildArchive(test::Container::Tar, test::Compression::Gzip,
                           {test::fileItem("Info.plist", "<plist/>"), plain.front()});
    std::string flipped = archive;
    flipped[flipped.size() / 2] ^= 0x55;
    LocalHttpServer::Response trickle = bodyResponse(archive);
    trickle.trickleBytesPerSecond = 2;
    struct Case {
        const char* name;
        std::vector<test::ArchiveItem> items;
        std::optional<LocalHttpServer::Response> response;
        const char* reason;
        plist::Dictionary settings = {};
    };
    const plist::Dictionary small{{kSettingsMaxExpandedBytesKey, plist::Value(1 << 20)},
                                  {kSettingsMaxArchiveEntriesKey, plist::Value(20)}};
    const std::vector<Case> cases{
        {"altered archive", plain, bodyResponse(flipped), "SHA-256"},
        {"cut connection", plain, bodyResponse(archive, archive.size() / 2), "cannot download"},
        {"longer than listed", plain, bodyResponse(archive + "tail"), "more than the catalog's"},
        {"not found", plain, statusResponse(404, "Not Found"), "HTTP status 404"},
        {"trickling server",
         plain,
         trickle,
         "cannot download",
         {{kSettingsLowSpeedSecondsKey, plist::Value(1)}}},
        {"absolute symlink",
         {test::symlinkItem("escape", outside), test::fileItem("escape/planted", "p")},
         std::nullopt,
         "leads outside",
         small},
        {"gzip bomb",
         {test::fileItem("bomb", std::string(4u << 20, '\0'))},
         std::nullopt,
         "more than 1048576 bytes",
         small},
        {"too many entries", manyEntries, std::nullopt, "more than 20 entries", small},
        {"no room for the installer's copy",
         plain,
         std::nullopt,
         "bytes free",
         {{kSettingsFreeSpaceReserveKey,
           plist::Value(plist::Integer::fromUnsigned(UINT64_MAX / 2))}}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        sink.clear();
        writeSettings(std::nullopt, c.settings);
        std::vector<test::ArchiveItem> items{test::fileItem("Info.plist", "<plist/>")};
        items.insert(items.end(), c.items.begin(), c.items.end());
        publishArchive(test::buildArchive(test::Container::Tar, test::Compression::Gzip, items));
        if (c.response) {
            server.serve("/catalog/archive.tgz", *c.response);
        }
        std::shared_ptr<Asset> asset = onlyAsset();
        ASSERT_TRUE(asset);

        EXPECT_EQ(download(asset).back(), kAssetOperationFailed);
        EXPECT_EQ(logLinesContaining(c.reason), 1u);
        EXPECT_FALSE(asset->localURL().has_value());
        EXPECT_TRUE(cachedAssetEntries().empty());
        EXPECT_EQ(test::snapshotTree(outside), (test::Tree{{"secret", "secret"}}));
        std::error_code ignored;
        for (const auto& found : fs::recursive_directory_iterator(work.path(), ignored)) {
            EXPECT_NE(found.path().filename(), "planted") << found.path();
        }
    }
}

}  // namespace
}  // namespace tavrix::catalog
