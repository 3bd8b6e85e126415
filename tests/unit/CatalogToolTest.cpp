// The publishing tool, run as publishers run it.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <tuple>

#include "PrivateBus.h"
#include "TestSupport.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::test {
namespace {

namespace fs = std::filesystem;

CommandResult runCatalogTool(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), TAVRIX_CATALOG_TOOL);
    return runCommand(arguments, true);
}

class CatalogToolTest : public testing::Test {
  protected:
    void SetUp() override {
        ASSERT_EQ(runCatalogTool({"keygen", work / "secret.key", work / "public.key"}).status, 0);
        writeBundle(work / "a/Default.bundle", "1.0", {}, {{"a.plist", "a"}});
        writeBundle(work / "b/Default.bundle", "2.0", {}, {{"sub/b.plist", "b"}});
    }

    int publish(std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), {"publish", work / "out"});
        CommandResult run = runCatalogTool(arguments);
        EXPECT_EQ(run.errors.empty(), run.status == 0) << run.errors;
        return run.status;
    }

    // Versions listed by the catalog, in order.
    std::vector<std::string> listedVersions() {
        std::vector<std::string> versions;
        Result<plist::Value> catalog = plist::readFile(work / "out/catalog.plist");
        const plist::Value* assets = catalog ? catalog->find("Assets") : nullptr;
        for (const plist::Value& asset : assets ? *assets->asArray() : plist::Array()) {
            versions.push_back(*asset.find("Attributes")->find("Version")->asString());
        }
        return versions;
    }

    // The tool's own check, as a device would make it.
    CommandResult verify(std::vector<std::string> arguments = {}) {
        arguments.insert(arguments.begin(), {"verify", work / "out", "--key", work / "public.key"});
        return runCatalogTool(arguments);
    }

    // The archive the catalog lists for version, relative to the output directory.
    std::string archiveOf(const std::string& version) {
        Result<plist::Value> catalog = plist::readFile(work / "out/catalog.plist");
        const plist::Value* assets = catalog ? catalog->find("Assets") : nullptr;
        for (const plist::Value& asset : assets ? *assets->asArray() : plist::Array()) {
            if (*asset.find("Attributes")->find("Version")->asString() == version) {
                return *asset.find("ArchiveURL")->asString();
            }
        }
        return "(none)";
    }

    std::int64_t serial() {
        Result<plist::Value> catalog = plist::readFile(work / "out/catalog.plist");
        const plist::Value* value = catalog ? catalog->find("Serial") : nullptr;
        return value != nullptr ? value->asInteger()->signedValue() : -1;
    }

    TempDir work;
};

// A version published again with other files gets an archive of its own, and the bytes under the
// old name stay as the previous catalog lists them until no catalog being served names them. The
// same files make the same archive whenever and wherever they are packed.
TEST_F(CatalogToolTest, PublishedArchivesNeverChangeAndGoOnlyWhenNoServedCatalogListsThem) {
    ASSERT_EQ(publish({"--key", work / "secret.key", work / "a/Default.bundle"}), 0);
    ASSERT_EQ(publish({"--key", work / "secret.key", work / "b/Default.bundle"}), 0);
    EXPECT_EQ(listedVersions(), (std::vector<std::string>{"1.0", "2.0"}));
    EXPECT_EQ(serial(), 2);
    const std::string first = archiveOf("2.0");
    const std::string firstBytes = readText(work / ("out/" + first));

    fs::copy(work / "b", work / "copy", fs::copy_options::recursive);
    fs::last_write_time(work / "copy/Default.bundle/sub/b.plist",
                        fs::file_time_type::clock::now() - std::chrono::hours(100));
    ASSERT_EQ(
        runCatalogTool({"publish", work / "other", "--unsigned", work / "copy/Default.bundle"})
            .status,
        0);
    EXPECT_EQ(readText(work / ("other/" + first)), firstBytes) << "reproducible";

    writeText(work / "b/Default.bundle/sub/b.plist", "b, fixed");
    ASSERT_EQ(publish({"--key", work / "secret.key", work / "b/Default.bundle", "--product-type",
                       "Handset9,1"}),
              0);
    EXPECT_EQ(listedVersions(), (std::vector<std::string>{"1.0", "2.0"})) << "replaced in place";
    EXPECT_NE(archiveOf("2.0"), first);
    EXPECT_EQ(readText(work / ("out/" + first)), firstBytes) << "the previous catalog names it";
    EXPECT_EQ(verify().status, 0);
    ASSERT_EQ(runCatalogTool({"refresh", work / "out", "--key", work / "secret.key"}).status, 0);
    EXPECT_FALSE(fs::exists(work / ("out/" + first)));
    EXPECT_TRUE(fs::exists(work / ("out/" + archiveOf("2.0"))));
    EXPECT_TRUE(fs::exists(work / ("out/" + archiveOf("1.0"))));

    // A fresh catalog still continues the serial: devices would refuse a lower one.
    ASSERT_EQ(publish({"--unsigned", "--fresh", work / "a/Default.bundle", "--version", "1.0"}), 0);
    EXPECT_EQ(listedVersions(), (std::vector<std::string>{"1.0"}));
    EXPECT_EQ(serial(), 5);
    EXPECT_FALSE(fs::exists(work / "out/catalog.plist.sig")) << "a stale signature is removed";
}

// Scripts tell the verdicts apart by exit status; problems and warnings go to stderr, the report
// (as JSON when asked) to stdout.
TEST_F(CatalogToolTest, VerifyTellsGoodWarningAndBadApart) {
    ASSERT_EQ(
        publish({"--key", work / "secret.key", "--expires-in", "10", work / "b/Default.bundle"}),
        0);
    CommandResult good = verify({"--json"});
    EXPECT_EQ(good.status, 0) << good.errors;
    EXPECT_EQ(good.errors, "");
    EXPECT_NE(good.output.find("\"verdict\": \"good\""), std::string::npos) << good.output;
    CommandResult soon = verify({"--warn-days", "11"});
    EXPECT_EQ(soon.status, 3);
    EXPECT_TRUE(soon.errors.starts_with("tavrix-catalog: warning: expires within 11 days"))
        << soon.errors;
    EXPECT_EQ(verify({"--min-serial", "2"}).status, 1) << "a device holding serial 2";

    std::string tampered = readText(work / ("out/" + archiveOf("2.0")));
    tampered[tampered.size() / 2] ^= 0x20;
    writeText(work / ("out/" + archiveOf("2.0")), tampered);
    CommandResult bad = verify({"--json"});
    EXPECT_EQ(bad.status, 1);
    EXPECT_NE(bad.errors.find("tavrix-catalog: problem: archives/Default-2.0-"), std::string::npos)
        << bad.errors;
    EXPECT_NE(bad.output.find("\"verdict\": \"bad\""), std::string::npos) << bad.output;
}

// A staged catalog changes nothing devices see, holds off other changes, and goes live only with
// a signature that verifies with the key it is meant for.
TEST_F(CatalogToolTest, StagedCatalogsGoLiveOnlyWithAVerifiedSignature) {
    ASSERT_EQ(publish({"--key", work / "secret.key", work / "a/Default.bundle", "--rollout", "5"}),
              0);
    const std::string served = readText(work / "out/catalog.plist");
    ASSERT_EQ(runCatalogTool({"refresh", work / "out", "--stage", "--key-id", "next"}).status, 0);
    EXPECT_EQ(readText(work / "out/catalog.plist"), served);
    EXPECT_EQ(
        runCatalogTool({"withdraw", work / "out", "1.0", "--key", work / "secret.key"}).status, 1);
    CommandResult shown = runCatalogTool({"show", work / "out"});
    EXPECT_NE(shown.output.find("version 1.0: rollout 5 %"), std::string::npos) << shown.output;
    EXPECT_NE(shown.output.find("waiting for its signature"), std::string::npos) << shown.output;

    ASSERT_EQ(runCatalogTool({"keygen", work / "other.key", work / "other.pub"}).status, 0);
    const std::string otherSigner =
        std::string(TAVRIX_CATALOG_TOOL) + " sign-stdin --key " + (work / "other.key");
    for (const std::string& signer : {std::string("head -c 64 /dev/zero"), otherSigner,
                                      std::string("cat >/dev/null; exit 4")}) {
        SCOPED_TRACE(signer);
        CommandResult run = runCatalogTool(
            {"sign", work / "out", "--signer", signer, "--public-key", work / "public.key"});
        EXPECT_EQ(run.status, 1);
        EXPECT_EQ(readText(work / "out/catalog.plist"), served);
    }
    ASSERT_EQ(runCatalogTool({"sign", work / "out", "--key=" + (work / "secret.key")}).status, 0);
    EXPECT_EQ(serial(), 2);
    EXPECT_FALSE(fs::exists(work / "out/catalog.plist.unsigned"));
    EXPECT_EQ(
        runCatalogTool({"verify", work / "out", "--key", "next=" + (work / "public.key")}).status,
        0);
}

// Options read the same as "--opt value", "--opt=value" and with operands after "--"; mistakes
// are one usage line (2) or one failure line (1) and change nothing; keygen leaves no lone key.
TEST_F(CatalogToolTest, OptionsParseAlikeAndMistakesChangeNothing) {
    ASSERT_EQ(publish({"--serial", "50", "--key", work / "secret.key", work / "a/Default.bundle"}),
              0);
    EXPECT_EQ(serial(), 50);
    ASSERT_EQ(
        publish({"--serial=60", "--key=" + (work / "secret.key"), "--", work / "a/Default.bundle"}),
        0);
    EXPECT_EQ(serial(), 60);
    std::string catalog = readText(work / "out/catalog.plist");
    std::string secret = readText(work / "secret.key");

    const std::string out = work / "out";
    const std::string bundle = work / "a/Default.bundle";
    std::vector<std::tuple<const char*, std::vector<std::string>, int>> cases{
        {"keygen over a secret key", {"keygen", work / "secret.key", work / "other.pub"}, 1},
        {"keygen that cannot write the public key",
         {"keygen", work / "lone.key", work / "nowhere/lone.pub"},
         1},
        {"version other than the bundle's",
         {"publish", out, "--unsigned", bundle, "--version", "1.1"},
         1},
        {"public key given as secret", {"publish", out, "--key", work / "public.key", bundle}, 1},
        {"catalog of another type", {"publish", out, "--unsigned", "--asset-type=x", bundle}, 1},
        {"missing bundle", {"publish", out, "--unsigned", work / "nowhere"}, 1},
        {"withdrawing what is not listed", {"withdraw", out, "9", "--key", work / "secret.key"}, 1},
        {"neither key nor unsigned", {"publish", out, bundle}, 2},
        {"stage without the key's name", {"refresh", out, "--stage"}, 2},
        {"option before its bundle", {"publish", out, "--unsigned", "--version", "1", bundle}, 2},
        {"rollout over 100", {"publish", out, "--unsigned", bundle, "--rollout=101"}, 2},
        {"unknown option", {"publish", out, "--unsigned", "--sereal", "3", bundle}, 2},
        {"value missing", {"publish", out, bundle, "--key"}, 2},
    };
    for (const auto& [name, arguments, status] : cases) {
        SCOPED_TRACE(name);
        CommandResult run = runCatalogTool(arguments);
        EXPECT_EQ(run.status, status);
        EXPECT_EQ(std::count(run.errors.begin(), run.errors.end(), '\n'), status == 2 ? 2 : 1)
            << run.errors;
    }
    EXPECT_EQ(readText(work / "out/catalog.plist"), catalog);
    EXPECT_EQ(readText(work / "secret.key"), secret);
    EXPECT_FALSE(fs::exists(work / "lone.key")) << "a retry must not find a lone secret key";
    EXPECT_EQ(verify().status, 0);
}

// A directory that is no complete bundle is refused alike by the packer and the publisher, with
// one line naming the file, and nothing is written.
TEST_F(CatalogToolTest, PackAndPublishRefuseADirectoryThatIsNoBundle) {
    const std::string info = "/Info.plist";
    const std::string carrier = "/behavior.plist";
    auto infoWith = [](const std::string& entries) {
        return "<plist version=\"1.0\"><dict>" + entries + "</dict></plist>";
    };
    const std::tuple<const char*, std::string, std::string, std::string> cases[] = {
        {"Info.plist damaged", info, "<plist", info},
        {"no identifier", info, infoWith("<key>QZBundleVersion</key><string>1</string>"),
         "QZBundleIdentifier"},
        {"version not a string", info,
         infoWith("<key>QZBundleIdentifier</key><string>x</string>"
                  "<key>QZBundleVersion</key><integer>1</integer>"),
         "QZBundleVersion"},
        {"behavior.plist damaged", carrier, "not a plist", carrier},
    };
    for (const auto& [name, file, content, named] : cases) {
        SCOPED_TRACE(name);
        const std::string bundle = work / ("spoiled/" + std::string(name));
        writeBundle(bundle, "3.0", {}, {{"a.plist", "a"}});
        writeText(bundle + file, content);
        const std::string payload = work / "payload.tgz";
        CommandResult pack = runCommand({TAVRIX_CTL_TOOL, "pack", bundle, "-o", payload}, true);
        EXPECT_EQ(pack.status, 1);
        EXPECT_NE(pack.errors.find(named), std::string::npos) << pack.errors;
        EXPECT_EQ(std::count(pack.errors.begin(), pack.errors.end(), '\n'), 1) << pack.errors;
        EXPECT_FALSE(fs::exists(payload));
        CommandResult published = runCatalogTool({"publish", work / "out", "--unsigned", bundle});
        EXPECT_EQ(published.status, 1);
        EXPECT_NE(published.errors.find(named), std::string::npos) << published.errors;
        EXPECT_FALSE(fs::exists(work / "out/catalog.plist"));
    }
}

}  // namespace
}  // namespace tavrix::test
