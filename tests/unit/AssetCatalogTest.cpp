// The asset catalog binding, and the choice of the asset an update installs, against a real HTTP
// server on 127.0.0.1 serving what the publishing tool produced.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>
#include <future>
#include <mutex>
#include <string>
#include <tuple>

#include "ArchiveFixtures.h"
#include "LocalHttpServer.h"
#include "PrivateBus.h"
#include "TestDoubles.h"
#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "catalog/AssetCatalog.h"
#include "catalog/AssetCatalogSettings.h"
#include "catalog/Sha256.h"
#include "device/PlatformRoot.h"
#include "plist/DateText.h"
#include "plist/PropertyListFormat.h"
#include "update/ActivityRecord.h"
#include "update/AssetHandler.h"
#include "util/SharedLibrary.h"

namespace tavrix::catalog {
namespace {

namespace fs = std::filesystem;
using plist::Dictionary;
using plist::Value;
using test::LocalHttpServer;
using test::readText;
using test::writeText;

constexpr const char* kAssetType = "com.zandor.Grellas.TavrixBundles";
constexpr auto kPatience = std::chrono::seconds(60);

using Assets = std::vector<std::shared_ptr<Asset>>;

// The reports a download handler receives: each operation, and the bytes of each "Downloading".
struct ProgressLog {
    // The operations received until a completed or failed one, in order.
    std::vector<std::string> waitForLast() {
        auto finished = [&] {
            std::lock_guard lock(mutex);
            return !operations.empty() && (operations.back() == kAssetOperationCompleted ||
                                           operations.back() == kAssetOperationFailed);
        };
        EXPECT_TRUE(test::pollUntil(finished, kPatience));
        std::lock_guard lock(mutex);
        return operations;
    }

    // A handler that captures its asset, as an update client's does, so that a kept cycle shows.
    static Asset::ProgressHandler handler(std::shared_ptr<ProgressLog> log,
                                          std::shared_ptr<Asset> asset) {
        return [log, asset](const Dictionary& progress) {
            std::lock_guard lock(log->mutex);
            log->operations.push_back(*progress.at(kAssetProgressOperationKey).asString());
            if (log->operations.back() == kAssetOperationDownloading) {
                log->bytes.push_back(
                    progress.at(kAssetProgressBytesWrittenKey).asInteger()->signedValue());
            }
        };
    }

    std::mutex mutex;
    std::vector<std::string> operations;
    std::vector<std::int64_t> bytes;
};

class AssetCatalogTest : public testing::Test {
  protected:
    void SetUp() override {
        publicKey = keygen("secret.key", "public.key");
        server.serveDirectory("/catalog/", work.path() / "out");
    }

    void tool(std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), TAVRIX_CATALOG_TOOL);
        test::CommandResult run = test::runCommand(arguments);
        EXPECT_EQ(run.status, 0) << run.output;
    }

    // A new key pair in the work directory; answers the public key's text.
    std::string keygen(const std::string& secret, const std::string& pub) {
        tool({"keygen", work / secret, work / pub});
        std::string key = readText(work / pub);
        return key.substr(0, key.find('\n'));
    }

    // Publishes a bundle of this version holding a.plist, signed with secret.key unless other
    // options are given, and with these options of its own.
    void publish(const std::string& version, std::vector<std::string> options = {},
                 const std::vector<std::string>& bundleOptions = {}) {
        const std::string bundle = work / (version + "/Default.bundle");
        test::writeBundle(bundle, version, {}, {{"a.plist", version}});
        options =
            options.empty() ? std::vector<std::string>{"--key", work / "secret.key"} : options;
        options.insert(options.begin(), {"publish", work / "out"});
        options.push_back(bundle);
        options.insert(options.end(), bundleOptions.begin(), bundleOptions.end());
        tool(options);
    }

    // The type trusts key in the single-key form, or without a key takes catalogs unsigned;
    // extra: top-level settings such as limits.
    void writeSettings(const std::optional<std::string>& key, Dictionary extra = {}) {
        writeTypeSettings(key ? Dictionary{{kSettingsPublicKeyKey, Value(*key)}}
                              : Dictionary{{kSettingsAllowUnsignedKey, Value(true)}},
                          std::move(extra));
    }

    void writeTypeSettings(Dictionary type, Dictionary extra = {},
                           const char* typeName = kAssetType) {
        type.emplace(kSettingsCatalogURLKey, Value(server.url("/catalog/catalog.plist")));
        extra.insert_or_assign(kSettingsAssetTypesKey, Value(Dictionary{{typeName, type}}));
        std::string path = device::resolvePath(kAssetCatalogSettingsPath);
        fs::create_directories(fs::path(path).parent_path());
        ASSERT_TRUE(plist::writeFile(path, Value(std::move(extra))));
    }

    // An unsigned catalog of serial 1 (none when serial is 0) valid for an hour, or until expires.
    static std::string catalogBytes(plist::Value assets, const char* type = kAssetType,
                                    int serial = 1, std::optional<plist::Date> expires = {}) {
        Dictionary catalog{
            {"AssetType", Value(type)},
            {"Expires", Value(expires.value_or(plist::Date{Clock::absoluteTimeNow() + 3600}))},
            {"Assets", std::move(assets)}};
        if (serial != 0) {
            catalog.emplace("Serial", Value(serial));
        }
        return *plist::serialize(Value(std::move(catalog)));
    }

    // Serves bytes as the catalog's only archive, listed unsigned with their size and digest.
    void publishArchive(const std::string& bytes) {
        Sha256Digest digest;
        digest.update(bytes);
        Dictionary entry{{"ArchiveURL", Value("archive.tgz")},
                         {"ArchiveSize", Value(static_cast<long long>(bytes.size()))},
                         {"ArchiveSHA256", Value(digest.finishHex())},
                         {"Attributes", Value(Dictionary{{"Version", Value("1.0")}})}};
        server.serve("/catalog/archive.tgz", {.body = bytes});
        server.serve("/catalog/catalog.plist",
                     {.body = catalogBytes(Value(plist::Array{Value(entry)}))});
    }

    std::string out(const std::string& relative) const { return work / ("out/" + relative); }
    std::string typeCache() const {
        return device::resolvePath(kDefaultAssetCacheDirectory) + "/" + kAssetType;
    }

    std::optional<Assets> query(bool localOnly = false) {
        AssetQuery assetQuery(kAssetType);
        assetQuery.setQueriesLocalInformationOnly(localOnly);
        return assetQuery.runQuery().assets;
    }

    // The single asset the catalog answers.
    std::shared_ptr<Asset> onlyAsset() {
        std::optional<Assets> assets = query();
        EXPECT_TRUE(assets && assets->size() == 1) << "expected one asset";
        return assets && assets->size() == 1 ? assets->front() : nullptr;
    }

    // Starts the download, sets a handler and waits for the last report.
    std::vector<std::string> download(const std::shared_ptr<Asset>& asset) {
        auto progress = std::make_shared<ProgressLog>();
        asset->beginDownload();
        asset->setProgressHandler(ProgressLog::handler(progress, asset));
        return progress->waitForLast();
    }

    std::size_t logLinesContaining(std::string_view text) const {
        return std::ranges::count_if(sink.messages(), [&](const std::string& line) {
            return line.find(text) != std::string::npos;
        });
    }

    // How many entries the cache holds for the type besides the kept catalog.
    std::size_t cachedAssetEntries() const {
        std::error_code ignored;
        return std::ranges::count_if(fs::directory_iterator(typeCache(), ignored), [](auto& entry) {
            return !entry.path().filename().string().starts_with("catalog.plist");
        });
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
    std::vector<std::tuple<const char*, std::function<void()>, const char*>> cases{
        {"damaged file",
         [] { writeText(device::resolvePath(kAssetCatalogSettingsPath), "<plist><dict><key>"); },
         "not a property list"},
        {"other type only", [this] { writeTypeSettings({}, {}, "other.type"); },
         "no settings for this asset type"},
        {"URL of the wrong type",
         [this] {
             writeTypeSettings({{kSettingsCatalogURLKey, Value(3)}});
         },
         "no CatalogURL"},
        {"negative limit",
         [this] {
             writeSettings(std::nullopt, {{kSettingsMaxArchiveEntriesKey, Value(-1)}});
         },
         "MaxArchiveEntries is not an integer"},
        // A key that cannot be read must not quietly turn verification off.
        {"short key", [this] { writeSettings("c2hvcnQ="); }, "PublicKey is not 32 bytes"},
        {"short key among trusted keys",
         [this] {
             writeTypeSettings(
                 {{kSettingsTrustedKeysKey,
                   Value(Dictionary{{"good", Value(publicKey)}, {"bad", Value("c2hvcnQ=")}})}});
         },
         "TrustedKeys entry \"bad\""},
    };
    for (const auto& [name, arrange, reason] : cases) {
        SCOPED_TRACE(name);
        sink.clear();
        arrange();
        for (int attempt = 0; attempt < 2; ++attempt) {
            std::optional<Assets> assets = query();
            ASSERT_TRUE(assets.has_value());
            EXPECT_TRUE(assets->empty());
        }
        EXPECT_EQ(logLinesContaining(reason), 1u);
    }
    EXPECT_TRUE(server.requests().empty());
}

// Every way a catalog can be untrustworthy is refused with its own reason in one line, and a
// refused catalog never replaces the copy kept for local queries from the last good one. (Keys
// rotating on a device: the release train's test.)
TEST_F(AssetCatalogTest, UntrustworthyCatalogsAreRefusedWithTheirReason) {
    std::string newKey = keygen("new.key", "new.pub");
    auto trusting = [](Dictionary keys) {
        return Dictionary{{kSettingsTrustedKeysKey, Value(std::move(keys))}};
    };
    auto publishWith = [&](const char* version, const char* key, const char* id) {
        publish(version, {"--key", work / key, "--key-id", id, "--fresh"});
    };
    writeTypeSettings(trusting({{"new", Value(newKey)}}));
    publishWith("2.0", "new.key", "new");
    EXPECT_TRUE(query(true).value_or(Assets{nullptr}).empty()) << "nothing is kept before a fetch";
    ASSERT_EQ(query().value_or(Assets()).size(), 1u);
    std::string oldCatalog = readText(out("catalog.plist"));
    std::string oldSignature = readText(out("catalog.plist.sig"));
    publishWith("2.1", "new.key", "new");
    ASSERT_EQ(query().value_or(Assets()).size(), 1u);
    std::string catalog = readText(out("catalog.plist"));
    std::string signature = readText(out("catalog.plist.sig"));

    auto serve = [&](const std::string& bytes, const std::optional<std::string>& sig) {
        writeText(out("catalog.plist"), bytes);
        fs::remove(out("catalog.plist.sig"));
        if (sig) {
            writeText(out("catalog.plist.sig"), *sig);
        }
    };
    std::string altered = catalog;
    altered.replace(altered.find("<string>2.1</string>"), 20, "<string>9.0</string>");
    std::vector<std::tuple<const char*, std::function<void()>, const char*>> cases{
        {"altered catalog", [&] { serve(altered, signature); }, "bad signature"},
        {"no signature", [&] { serve(catalog, std::nullopt); }, "missing signature"},
        {"replayed older serial", [&] { serve(oldCatalog, oldSignature); }, "rollback"},
        {"signed with a key not trusted", [&] { publishWith("3.0", "secret.key", "old"); },
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
             writeTypeSettings(trusting({{"new", Value(newKey)}}));
             server.serve(
                 "/catalog/catalog.plist",
                 {.status = 302,
                  .reason = "Found",
                  .headers = {{"Location", "https://127.0.0.1:" + std::to_string(server.port()) +
                                               "/catalog/catalog.plist"}}});
         },
         "fetch failed"},
    };
    for (const auto& [name, arrange, reason] : cases) {
        SCOPED_TRACE(name);
        sink.clear();
        arrange();
        EXPECT_FALSE(query().has_value());
        EXPECT_EQ(logLinesContaining(std::string(": ") + reason + ": "), 1u);
    }
    EXPECT_EQ(logLinesContaining("\"https\" not supported"), 1u) << "the redirect was not followed";
    std::size_t requests = server.requests().size();
    std::optional<Assets> kept = query(true);
    ASSERT_TRUE(kept.has_value());
    ASSERT_EQ(kept->size(), 1u);
    EXPECT_EQ(kept->front()->attributes(), (Dictionary{{"Version", Value("2.1")}}));
    EXPECT_EQ(server.requests().size(), requests) << "local queries do not ask the server";

    // A device whose view is frozen notices once the catalog expires, even the kept copy.
    ScopedClockOffset monthLater(std::chrono::hours(24 * 31));
    sink.clear();
    EXPECT_FALSE(query(true).has_value());
    EXPECT_EQ(logLinesContaining(": expired: "), 1u);
}

// A device that fetches the catalog just before a publication and its signature just after takes
// the new pair, not a refusal that would keep it waiting for its next check; but the second try
// has only what the first one left of the time budget: a slow catalog whose signature fails holds
// a waiting check for one budget, not two.
TEST_F(AssetCatalogTest, ASecondTryTakesANewPairWithinWhatIsLeftOfTheBudget) {
    publish("1.0");
    writeSettings(publicKey);
    const std::string first = readText(out("catalog.plist"));
    server.serve("/catalog/catalog.plist", {.body = first, .holdAfterBodyBytes = first.size() - 1});
    auto assets = std::async(std::launch::async, [this] { return query(); });
    ASSERT_TRUE(server.waitForHeldResponse(kPatience));
    publish("2.0");
    server.serve("/catalog/catalog.plist", {.body = readText(out("catalog.plist"))});
    server.releaseHeldResponses();
    std::optional<Assets> answered = assets.get();
    ASSERT_TRUE(answered.has_value());
    ASSERT_EQ(answered->size(), 2u);
    EXPECT_EQ(answered->back()->attributes(), (Dictionary{{"Version", Value("2.0")}}));

    writeSettings(publicKey, {{kSettingsCatalogTimeoutKey, Value(3)}});
    const std::string slow = readText(out("catalog.plist")) + "\n";
    // About two seconds.
    server.serve("/catalog/catalog.plist",
                 {.body = slow, .trickleBytesPerSecond = slow.size() / 3 + 1});
    EXPECT_FALSE(query().has_value());
    EXPECT_EQ(logLinesContaining("cannot fetch it"), 1u);
}

// Each query places the device by its serial number as it is then (the buckets are the catalog
// tool's: SN0 in 72, SN1 in 22).
TEST_F(AssetCatalogTest, RolloutsFollowTheDevicesSerialNumber) {
    writeSettings(std::nullopt);
    publish("1.0", {"--unsigned"}, {"--rollout", "40"});
    for (const auto& [serialNumber, taking] :
         {std::pair{"SN0", false}, {"SN1", true}, {"SN0", false}}) {
        test::writeDeviceTable({{"SerialNumber", serialNumber}});
        EXPECT_EQ(query().value_or(Assets()).size(), taking ? 1u : 0u) << serialNumber;
    }
}

TEST_F(AssetCatalogTest, DamagedCatalogsAreRefusedAndMalformedEntriesSkipped) {
    writeSettings(std::nullopt, {{kSettingsCatalogTimeoutKey, Value(1)}});
    Dictionary good{{"ArchiveURL", Value("a.tgz")},
                    {"ArchiveSize", Value(10)},
                    {"ArchiveSHA256", Value(std::string(64, 'A'))},
                    {"Attributes", Value(Dictionary{{"Version", "1"}})}};
    auto with = [&](const char* key, plist::Value value) {
        Dictionary entry = good;
        entry.insert_or_assign(key, std::move(value));
        return Value(entry);
    };
    plist::Array entries{
        Value(good),
        Value("not a dictionary"),
        with("ArchiveSize", Value("10")),
        with("ArchiveSize", Value(plist::Integer::fromUnsigned(UINT64_MAX))),
        with("ArchiveSize", Value(0)),
        with("ArchiveSHA256", Value("abc")),
        with("ArchiveURL", Value("file:///etc/passwd")),
        with("ArchiveURL", Value(plist::Data{1, 2})),
        with("Attributes", Value(plist::Array{})),
        with("RolloutPercent", Value(101)),
    };
    server.serve("/catalog/catalog.plist", {.body = catalogBytes(entries)});
    std::optional<Assets> assets = query();
    ASSERT_TRUE(assets.has_value());
    ASSERT_EQ(assets->size(), 1u);
    EXPECT_EQ(assets->front()->attributes(), *good.at("Attributes").asDictionary());
    EXPECT_EQ(logLinesContaining("skipping entry"), entries.size() - 1);

    const std::vector<std::tuple<const char*, LocalHttpServer::Response, const char*>> refused{
        {"not a property list", {.body = "\x89PNG garbage"}, "not a property list"},
        {"another type", {.body = catalogBytes(entries, "other.type")}, "AssetType is not"},
        {"assets of the wrong type", {.body = catalogBytes(Value("x"))}, "no Assets array"},
        {"over the size cap", {.body = std::string(9u << 20, ' ')}, "cannot fetch it"},
        {"no serial", {.body = catalogBytes(entries, kAssetType, 0)}, "no Serial"},
        {"server error", {.status = 500, .reason = "Oops"}, "HTTP status 500"},
        {"trickling server",
         {.body = std::string(4096, ' '), .trickleBytesPerSecond = 2000},
         "cannot fetch it"},
    };
    for (const auto& [name, response, reason] : refused) {
        SCOPED_TRACE(name);
        sink.clear();
        server.serve("/catalog/catalog.plist", response);
        EXPECT_FALSE(query().has_value());
        EXPECT_EQ(logLinesContaining(reason), 1u);
    }

    // Past 2038, where a 32-bit time_t ends, a catalog is taken until it expires, then refused
    // with both dates.
    const plist::Date expires{*plist::parseXmlDateText("2040-02-29T12:00:00Z")};
    auto clockAt = [](double secondsSinceReferenceDate) {
        return std::chrono::duration_cast<Clock::Duration>(
            std::chrono::duration<double>(secondsSinceReferenceDate - Clock::absoluteTimeNow()));
    };
    server.serve("/catalog/catalog.plist", {.body = catalogBytes(entries, kAssetType, 1, expires)});
    {
        ScopedClockOffset hourBefore(clockAt(expires.secondsSinceReferenceDate - 3600));
        EXPECT_EQ(query().value_or(Assets()).size(), 1u);
    }
    ScopedClockOffset dayAfter(clockAt(expires.secondsSinceReferenceDate + 86400));
    sink.clear();
    EXPECT_FALSE(query().has_value());
    EXPECT_EQ(
        logLinesContaining("it expired at 2040-02-29 12:00:00 UTC, it is now 2040-03-01 12:0"), 1u);
}

// A download reports its steps in order, installs identical files in a directory of its own and
// purges only that.
TEST_F(AssetCatalogTest, DownloadReportsStepsInOrderInstallsIdenticalFilesAndPurges) {
    std::string payload = test::randomBytes(300 * 1024, 7);
    test::writeBundle(work / "b/Default.bundle", "1.0", {},
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
    test::pollUntil([&] { return asset->localURL().has_value(); }, kPatience);
    auto progress = std::make_shared<ProgressLog>();
    asset->setProgressHandler(ProgressLog::handler(progress, asset));
    std::vector<std::string> operations = progress->waitForLast();

    ASSERT_GE(operations.size(), 4u);
    EXPECT_EQ(operations.front(), kAssetOperationStarted);
    EXPECT_EQ(operations[operations.size() - 2], kAssetOperationInstalling);
    EXPECT_EQ(operations.back(), kAssetOperationCompleted);
    std::vector<std::int64_t> bytes = progress->bytes;
    EXPECT_TRUE(std::is_sorted(bytes.begin(), bytes.end(), std::less_equal<>()));
    ASSERT_FALSE(bytes.empty());
    EXPECT_LE(bytes.size(), 4u) << "a few reports, not one per chunk";
    EXPECT_EQ(bytes.back(), static_cast<std::int64_t>(
                                fs::file_size(fs::directory_iterator(out("archives"))->path())));

    std::optional<std::string> local = asset->localURL();
    ASSERT_TRUE(local.has_value());
    EXPECT_EQ(readText(*local + "/b/deep/payload.bin"), payload);
    EXPECT_EQ(readText(*local + "/a.plist"), "<plist/>");
    EXPECT_EQ(readText(*local + "/Info.plist"), readText(work / "b/Default.bundle/Info.plist"));
    EXPECT_EQ(cachedAssetEntries(), 1u) << "no staging files are left";

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
    EXPECT_TRUE(test::pollUntil([&] { return weak.expired(); }, kPatience));
}

// Every way a download can go wrong ends in one failure report with one line saying why, no
// local URL and nothing left in the cache. (Each entry kind and limit extraction refuses is
// covered where extraction is tested; here, that the binding asks for path-safe extraction with
// its own settings' limits.)
TEST_F(AssetCatalogTest, FailedDownloadsReportFailureAndLeaveNothingBehind) {
    const std::string outside = work / "outside";
    writeText(outside + "/secret", "secret");
    std::vector<test::ArchiveItem> manyEntries;
    for (int index = 0; index < 30; ++index) {
        manyEntries.push_back(test::fileItem("f" + std::to_string(index), "x"));
    }
    const std::vector<test::ArchiveItem> plain{test::fileItem("a", test::randomBytes(8192, 7))};
    const std::string archive =
        test::buildArchive({test::fileItem("Info.plist", "<plist/>"), plain.front()});
    std::string flipped = archive;
    flipped[flipped.size() / 2] ^= 0x55;
    struct Case {
        const char* name;
        std::vector<test::ArchiveItem> items;
        std::optional<LocalHttpServer::Response> response;
        const char* reason;
        Dictionary settings = {};
    };
    const Dictionary small{{kSettingsMaxExpandedBytesKey, Value(1 << 20)},
                           {kSettingsMaxArchiveEntriesKey, Value(20)}};
    const std::vector<Case> cases{
        {"altered archive", plain, {{.body = flipped}}, "SHA-256"},
        {"cut connection",
         plain,
         {{.body = archive, .cutAfterBodyBytes = archive.size() / 2}},
         "cannot download"},
        {"longer than listed", plain, {{.body = archive + "tail"}}, "more than the catalog's"},
        {"trickling server",
         plain,
         {{.body = archive, .trickleBytesPerSecond = 2}},
         "cannot download",
         {{kSettingsLowSpeedSecondsKey, Value(1)}}},
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
         {{kSettingsFreeSpaceReserveKey, Value(plist::Integer::fromUnsigned(UINT64_MAX / 2))}}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        sink.clear();
        writeSettings(std::nullopt, c.settings);
        std::vector<test::ArchiveItem> items{test::fileItem("Info.plist", "<plist/>")};
        items.insert(items.end(), c.items.begin(), c.items.end());
        publishArchive(test::buildArchive(items));
        if (c.response) {
            server.serve("/catalog/archive.tgz", *c.response);
        }
        std::shared_ptr<Asset> asset = onlyAsset();
        ASSERT_TRUE(asset);

        EXPECT_EQ(download(asset).back(), kAssetOperationFailed);
        EXPECT_EQ(logLinesContaining(c.reason), 1u);
        EXPECT_FALSE(asset->localURL().has_value());
        EXPECT_EQ(cachedAssetEntries(), 0u);
        EXPECT_EQ(test::snapshotTree(outside), (test::Tree{{"secret", "secret"}}));
    }
}

// One asset to publish: its version and the tool's options for it.
struct Published {
    std::string version;
    std::vector<std::string> options;
};

struct SelectionCase {
    const char* name;
    std::vector<Published> assets;
    // The index of the chosen asset; -1 when none is chosen.
    int chosen;
    // Applied to the published catalog before the query.
    std::function<void(plist::Value& catalog)> edit = nullptr;
};

// Which asset an update picks. The installed bundle (version 1.0) is what the bundle link points
// at; the device runs OS 9.1 on product type Tablet7,1.
class AssetSelectionTest : public AssetCatalogTest {
  protected:
    void SetUp() override {
        AssetCatalogTest::SetUp();
        writeSettings(std::nullopt);
        test::writeDeviceTable({{"contains-cellular-radio", false},
                                {"ProductVersion", "9.1"},
                                {"ProductType", "Tablet7,1"}});
        // The bundle manager reads the linked bundle's version when first used.
        const fs::path root = test::unitTestRoot();
        const fs::path installed = root / "var/mobile/Library/TavrixBundles/Default.bundle";
        test::writeBundle(installed.string(), "1.0");
        fs::create_symlink(installed, root / "var/mobile/Library/Tavrix.bundle");
    }

    // Publishes the case's assets as a new catalog, each from a bundle directory of its own.
    void publish(const SelectionCase& c) {
        std::vector<std::string> arguments{"publish", work / "out", "--unsigned", "--fresh"};
        for (std::size_t i = 0; i < c.assets.size(); ++i) {
            const std::string bundle = work / ("bundles/Asset" + std::to_string(i) + ".bundle");
            test::writeBundle(bundle, c.assets[i].version);
            arguments.push_back(bundle);
            arguments.insert(arguments.end(), c.assets[i].options.begin(),
                             c.assets[i].options.end());
        }
        tool(arguments);
        if (c.edit) {
            const std::string path = out("catalog.plist");
            Result<plist::Value> catalog = plist::readFile(path);
            ASSERT_TRUE(catalog);
            c.edit(*catalog);
            ASSERT_TRUE(plist::writeFile(path, *catalog));
        }
    }
};

// Removes "Version" from the first asset's attributes.
void dropFirstVersion(plist::Value& catalog) {
    plist::Array& assets = *catalog.asDictionary()->at("Assets").asArray();
    assets.at(0).asDictionary()->at("Attributes").asDictionary()->erase("Version");
}

// Lists the first asset a second time ahead of itself, with a maximum OS version of its own (the
// tool replaces an entry of the same version, so only an edited catalog has two).
void listFirstTwiceBoundedFirst(plist::Value& catalog) {
    plist::Array& assets = *catalog.asDictionary()->at("Assets").asArray();
    plist::Value bounded = assets.at(0);
    bounded.asDictionary()
        ->at("Attributes")
        .asDictionary()
        ->insert_or_assign("MaximumOSVersion", Value("9.9"));
    assets.insert(assets.begin(), std::move(bounded));
}

TEST_F(AssetSelectionTest, ChoosesTheHighestFittingVersionAboveTheInstalledOne) {
    const std::vector<SelectionCase> cases{
        {"a patch release above the installed version", {{"1.0", {}}, {"1.0.1", {}}}, 1},
        {"digit runs compare as numbers", {{"2.9", {}}, {"2.10", {}}, {"2.2", {}}}, 1},
        {"bounds equal to the device's version pass",
         {{"1.5", {"--min-os", "9.1", "--max-os", "9.1"}}},
         0},
        {"bounds compare as numbers: 10.0 and 9.0 reject, 9.10 is above 9.1",
         {{"3.0", {"--min-os", "10.0"}},
          {"2.5", {"--max-os", "9.0"}},
          {"2.0", {"--max-os", "9.10"}},
          {"1.1", {}}},
         2},
        {"product types match exactly; none listed means all",
         {{"4.0", {"--product-type", "Tablet7,10", "--product-type", "tablet7,1"}},
          {"3.0", {"--product-type", "Other1,1", "--product-type", "Tablet7,1"}},
          {"2.0", {}}},
         1},
        {"an asset without a version is never chosen",
         {{"9.0", {}}, {"1.2", {}}},
         1,
         dropFirstVersion},
        {"the first of equal versions wins", {{"1.3", {}}}, 0, listFirstTwiceBoundedFirst},
        {"nothing fits", {{"5.0", {"--product-type", "Other1,1"}}}, -1},
    };
    for (const SelectionCase& c : cases) {
        SCOPED_TRACE(c.name);
        publish(c);
        AssetHandler::AssetPtr best = AssetHandler::findTheBestAsset();
        Result<plist::Value> catalog = plist::readFile(out("catalog.plist"));
        ASSERT_TRUE(catalog);
        if (c.chosen < 0 || best == nullptr) {
            EXPECT_EQ(best == nullptr, c.chosen < 0);
        } else {
            EXPECT_EQ(Value(best->attributes()),
                      *catalog->find("Assets")->asArray()->at(c.chosen).find("Attributes"));
        }
    }
}

// A check that installs nothing says "held back" only when a rollout keeps a newer version that
// would fit this device from it (this device has no serial number, so every partial rollout
// leaves it out), naming the newest such version and its share.
TEST_F(AssetSelectionTest, HeldBackOnlyWhenARolloutKeepsANewerFittingVersion) {
    const std::vector<std::pair<SelectionCase, std::string>> cases{
        {{"newer, at 0 %", {{"2.0", {"--rollout", "0"}}}, -1},
         "held back by a staged rollout (0 %): version 2.0 is not offered to this device yet"},
        {{"the newest held back is named",
          {{"3.0", {"--rollout", "10"}}, {"2.0", {"--rollout", "50"}}, {"1.0", {}}},
          -1},
         "held back by a staged rollout (10 %): version 3.0 is not offered to this device yet"},
        {{"not newer than the installed one", {{"0.9", {"--rollout", "5"}}}, -1},
         "up to date (version 1.0 installed)"},
        {{"not for this product", {{"2.0", {"--rollout", "5", "--product-type", "Other1,1"}}}, -1},
         "up to date (version 1.0 installed)"},
    };
    for (const auto& [c, reason] : cases) {
        SCOPED_TRACE(c.name);
        publish(c);
        EXPECT_FALSE(AssetHandler::downloadUpdateIfAvailable([](double) {}));
        const plist::Value record(copyActivityRecord());
        const plist::Value* check = record.find(kLastCheckKey);
        ASSERT_NE(check, nullptr);
        EXPECT_EQ(*check->find(kActivityReasonKey)->asString(), reason);
        EXPECT_EQ(*check->find(kActivityOutcomeKey)->asString(),
                  reason.starts_with("held") ? kCheckHeldBack : kCheckUpToDate);
    }
}

// The commented sample shipped for integrators reads as the daemon reads it, with the defaults it
// claims: a renamed key or a wrong number there would mislead every device set up from it.
TEST(SampleAssetCatalogTest, ReadsAsDocumentedWithTheDefaultLimits) {
    Result<plist::Value> sample = plist::readFile(TAVRIX_SAMPLE_ASSET_CATALOG);
    ASSERT_TRUE(sample) << sample.reason();
    auto settings = parseAssetTypeSettings(*sample, kAssetTypeTavrixBundles);
    ASSERT_TRUE(settings) << settings.reason();
    EXPECT_EQ(settings->catalogURL, "https://updates.example.net/tavrix/catalog.plist");
    ASSERT_EQ(settings->trustedKeys.size(), 1u);
    EXPECT_EQ(settings->trustedKeys.front().identifier, "release-2026");
    EXPECT_FALSE(settings->allowUnsigned);
    auto fields = [](const AssetLimits& l) {
        return std::tie(l.maxExpandedBytes, l.maxArchiveEntries, l.freeSpaceReserveBytes,
                        l.connectTimeoutSeconds, l.lowSpeedBytesPerSecond, l.lowSpeedSeconds,
                        l.catalogTimeoutSeconds, l.archiveTimeoutSeconds);
    };
    const AssetLimits defaults;
    EXPECT_EQ(fields(settings->limits), fields(defaults));
}

// The digest is libcrypto's, loaded on first use: known vectors, fed in pieces that cross its
// 64-byte blocks, catch a wrong binding or a lost piece.
TEST(Sha256, MatchesKnownDigestsFedInPieces) {
    Sha256Digest empty;
    EXPECT_EQ(empty.finishHex(),
              "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855");

    const std::string text = "abcdbcdecdefdefgefghfghighijhijkijkljklmklmnlmnomnopnopq";
    Sha256Digest pieces;
    for (std::size_t at = 0; at < text.size(); at += 7) {
        pieces.update(std::string_view(text).substr(at, 7));
    }
    EXPECT_EQ(pieces.finishHex(),
              "248d6a61d20638b8e5c026930c3e6039a33ce45964ff2167f6ecedd419db06c1");
}

// A missing optional library fails the operation that needs it with a reason naming it.
TEST(SharedLibrary, MissingLibraryOrSymbolSaysWhich) {
    auto absent = SharedLibrary::open("libtavrix-absent.so.1");
    ASSERT_FALSE(absent);
    EXPECT_NE(absent.reason().find("libtavrix-absent.so.1"), std::string::npos) << absent.reason();

    auto library = SharedLibrary::open("libcrypto.so.3");
    ASSERT_TRUE(library) << library.reason();
    void (*function)() = nullptr;
    (*library)->bind(function, "no_such_function_here");
    (*library)->bind(function, "EVP_sha256");
    ASSERT_FALSE((*library)->allBound());
    EXPECT_EQ((*library)->allBound().reason(), "libcrypto.so.3 has no no_such_function_here");
}

}  // namespace
}  // namespace tavrix::catalog
