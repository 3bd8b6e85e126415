// The publishing tool, run as publishers run it.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>

#include "CatalogToolRunner.h"
#include "TestSupport.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::test {
namespace {

namespace fs = std::filesystem;

class CatalogToolTest : public testing::Test {
  protected:
    void SetUp() override {
        ASSERT_EQ(runCatalogTool({"keygen", work / "secret.key", work / "public.key"}).status, 0);
        makeBundle(work / "a/Default.bundle", "1.0", {{"a.plist", "a"}});
        makeBundle(work / "b/Default.bundle", "2.0", {{"sub/b.plist", "b"}});
    }

    int publish(std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), {"publish", work / "out"});
        ToolRun run = runCatalogTool(arguments);
        EXPECT_EQ(run.errors.empty(), run.status == 0) << run.errors;
        return run.status;
    }

    // Versions listed by the catalog, in order.
    std::vector<std::string> listedVersions() {
        std::vector<std::string> versions;
        std::optional<plist::Value> catalog = plist::readFile(work / "out/catalog.plist");
        const plist::Value* assets = catalog ? catalog->find("Assets") : nullptr;
        for (const plist::Value& asset : assets ? *assets->asArray() : plist::Array()) {
            versions.push_back(*asset.find("Attributes")->find("Version")->asString());
        }
        return versions;
    }

    // The tool's own check, as a device would make it.
    ToolRun verify(std::vector<std::string> arguments = {}) {
        arguments.insert(arguments.begin(), {"verify", work / "out", "--key", work / "public.key"});
        return runCatalogTool(arguments);
    }

    std::int64_t serial() {
        std::optional<plist::Value> catalog = plist::readFile(work / "out/catalog.plist");
        const plist::Value* value = catalog ? catalog->find("Serial") : nullptr;
        return value != nullptr ? value->asInteger()->signedValue() : -1;
    }

    TempDir work;
};

TEST_F(CatalogToolTest, PublishingAddsReplacesAndStartsFreshWithAValidSignatureEachTime) {
    struct stat info {};
    ASSERT_EQ(::stat((work / "secret.key").c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0600u);

    ASSERT_EQ(publish({"--key", work / "secret.key", work / "a/Default.bundle"}), 0);
    ASSERT_EQ(publish({"--key", work / "secret.key", work / "b/Default.bundle"}), 0);
    EXPECT_EQ(listedVersions(), (std::vector<std::string>{"1.0", "2.0"}));
    EXPECT_EQ(verify().status, 0);
    EXPECT_EQ(serial(), 2);

    // The same archive name replaces its entry in place.
    ASSERT_EQ(publish({"--key", work / "secret.key", work / "b/Default.bundle", "--product-type",
                       "Handset9,1"}),
              0);
    std::optional<plist::Value> catalog = plist::readFile(work / "out/catalog.plist");
    ASSERT_TRUE(catalog);
    const plist::Value& replaced = catalog->find("Assets")->asArray()->at(1);
    EXPECT_EQ(*replaced.find("Attributes")->find("SupportedProductTypes"),
              plist::Value(plist::Array{plist::Value("Handset9,1")}));
    EXPECT_EQ(listedVersions().size(), 2u);
    EXPECT_EQ(verify({"--min-serial", "3"}).status, 0);
    EXPECT_EQ(verify({"--min-serial", "4"}).status, 1) << "a device holding serial 4";

    // A fresh catalog still continues the serial: devices would refuse a lower one.
    ASSERT_EQ(publish({"--unsigned", "--fresh", work / "a/Default.bundle", "--version", "1.0"}), 0);
    EXPECT_EQ(listedVersions(), (std::vector<std::string>{"1.0"}));
    EXPECT_EQ(serial(), 4);
    EXPECT_FALSE(fs::exists(work / "out/catalog.plist.sig")) << "a stale signature is removed";
    EXPECT_EQ(verify().status, 1) << "unsigned, with a key to check";
}

// The same files make the same archive whenever and wherever they are packed, and verify finds
// an archive that no longer matches its listing.
TEST_F(CatalogToolTest, ArchivesAreReproducibleAndVerifyFindsTamperedOnes) {
    ASSERT_EQ(publish({"--key", work / "secret.key", work / "b/Default.bundle"}), 0);
    std::string first = readText(work / "out/archives/Default-2.0.tgz");
    fs::copy(work / "b", work / "copy", fs::copy_options::recursive);
    fs::last_write_time(work / "copy/Default.bundle/sub/b.plist",
                        fs::file_time_type::clock::now() - std::chrono::hours(100));
    ASSERT_EQ(
        runCatalogTool({"publish", work / "other", "--unsigned", work / "copy/Default.bundle"})
            .status,
        0);
    EXPECT_EQ(readText(work / "other/archives/Default-2.0.tgz"), first);

    ToolRun good = verify();
    EXPECT_EQ(good.status, 0) << good.errors;
    std::string tampered = first;
    tampered[tampered.size() / 2] ^= 0x20;
    writeText(work / "out/archives/Default-2.0.tgz", tampered);
    EXPECT_EQ(verify().status, 1);
    writeText(work / "out/archives/Default-2.0.tgz", first + "x");
    EXPECT_EQ(verify().status, 1);
}

TEST_F(CatalogToolTest, MistakesFailClearlyAndChangeNothing) {
    ASSERT_EQ(publish({"--key", work / "secret.key", work / "a/Default.bundle"}), 0);
    std::string catalog = readText(work / "out/catalog.plist");
    std::string secret = readText(work / "secret.key");

    struct Case {
        const char* name;
        std::vector<std::string> arguments;
        int status;
    };
    std::vector<Case> cases{
        {"keygen over a secret key", {"keygen", work / "secret.key", work / "other.pub"}, 1},
        {"version other than the bundle's",
         {"publish", work / "out", "--unsigned", work / "a/Default.bundle", "--version", "1.1"},
         1},
        {"public key given as secret",
         {"publish", work / "out", "--key", work / "public.key", work / "a/Default.bundle"},
         1},
        {"catalog of another type",
         {"publish", work / "out", "--unsigned", "--asset-type", "other",
          work / "a/Default.bundle"},
         1},
        {"missing bundle", {"publish", work / "out", "--unsigned", work / "nowhere"}, 1},
        {"neither key nor unsigned", {"publish", work / "out", work / "a/Default.bundle"}, 2},
        {"option before its bundle",
         {"publish", work / "out", "--unsigned", "--version", "1", work / "a/Default.bundle"},
         2},
        {"rollout over 100",
         {"publish", work / "out", "--unsigned", work / "a/Default.bundle", "--rollout", "101"},
         2},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        ToolRun run = runCatalogTool(c.arguments);
        EXPECT_EQ(run.status, c.status);
        EXPECT_FALSE(run.errors.empty());
    }
    EXPECT_EQ(readText(work / "out/catalog.plist"), catalog);
    EXPECT_EQ(readText(work / "secret.key"), secret);
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
    struct Case {
        const char* name;
        std::function<void(const std::string& bundle)> spoil;
        std::string named;
    };
    const std::vector<Case> cases{
        {"Info.plist damaged", [&](const std::string& b) { writeText(b + info, "<plist"); }, info},
        {"no identifier",
         [&](const std::string& b) {
             writeText(b + info, infoWith("<key>QZBundleVersion</key><string>1</string>"));
         },
         "QZBundleIdentifier"},
        {"version not a string",
         [&](const std::string& b) {
             writeText(b + info, infoWith("<key>QZBundleIdentifier</key><string>x</string>"
                                          "<key>QZBundleVersion</key><integer>1</integer>"));
         },
         "QZBundleVersion"},
        {"behavior.plist damaged",
         [&](const std::string& b) { writeText(b + carrier, "not a plist"); }, carrier},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        const std::string bundle = work / ("spoiled/" + std::string(c.name));
        makeBundle(bundle, "3.0", {{"a.plist", "a"}});
        c.spoil(bundle);
        const std::string payload = work / "payload.tgz";
        ToolRun pack = runTool(TAVRIX_CTL_TOOL, {"pack", bundle, "-o", payload});
        EXPECT_EQ(pack.status, 1);
        EXPECT_NE(pack.errors.find(c.named), std::string::npos) << pack.errors;
        EXPECT_EQ(std::count(pack.errors.begin(), pack.errors.end(), '\n'), 1) << pack.errors;
        EXPECT_FALSE(fs::exists(payload));
        ToolRun published = runCatalogTool({"publish", work / "out", "--unsigned", bundle});
        EXPECT_EQ(published.status, 1);
        EXPECT_NE(published.errors.find(c.named), std::string::npos) << published.errors;
        EXPECT_FALSE(fs::exists(work / "out/catalog.plist"));
    }
}

}  // namespace
}  // namespace tavrix::test
