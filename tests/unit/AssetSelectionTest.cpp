// Which catalog asset an update picks, with catalogs made by the publishing tool and served over
// HTTP on 127.0.0.1. The installed bundle (version 1.0) is what the bundle link points at; the
// device runs OS 9.1 on product type Tablet7,1.
#include <gtest/gtest.h>

#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "CatalogToolRunner.h"
#include "LocalHttpServer.h"
#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "catalog/AssetCatalogSettings.h"
#include "plist/PropertyListFormat.h"
#include "update/AssetHandler.h"

namespace tavrix {
namespace {

namespace fs = std::filesystem;

// One asset to publish: its version and the tool's options for it.
struct Published {
    std::string version;
    std::vector<std::string> options;
};

struct Case {
    const char* name;
    std::vector<Published> assets;
    // The chosen asset's version; empty when none is chosen.
    std::string chosen;
    // Applied to the published catalog before the query.
    std::function<void(plist::Value& catalog)> edit = nullptr;
};

class AssetSelectionTest : public testing::Test {
  protected:
    void SetUp() override {
        const fs::path& root = test::unitTestRoot();
        fs::remove_all(root / "var/lib/tavrixservicesd");  // serials other tests' catalogs left
        test::writeDeviceTable({{"contains-cellular-radio", false},
                                {"ProductVersion", "9.1"},
                                {"ProductType", "Tablet7,1"}});
        // The bundle manager reads the linked bundle's version when first used.
        const fs::path installed = root / "var/mobile/Library/TavrixBundles/Default.bundle";
        test::makeBundle(installed.string(), "1.0", {});
        fs::create_symlink(installed, root / "var/mobile/Library/Tavrix.bundle");

        server.serveDirectory("/catalog/", work.path() / "out");
        ASSERT_TRUE(plist::writeFile(
            (root / "etc/tavrix/AssetCatalog.plist").string(),
            plist::Value(plist::Dictionary{
                {catalog::kSettingsAssetTypesKey,
                 plist::Dictionary{
                     {kAssetTypeTavrixBundles,
                      plist::Dictionary{
                          {catalog::kSettingsCatalogURLKey, server.url("/catalog/catalog.plist")},
                          {catalog::kSettingsAllowUnsignedKey, true}}}}}})));
    }

    // Publishes the case's assets as a new catalog, each from a bundle directory of its own.
    void publish(const Case& c) {
        std::vector<std::string> arguments{"publish", work / "out", "--unsigned", "--fresh"};
        for (std::size_t i = 0; i < c.assets.size(); ++i) {
            const std::string bundle = work / ("bundles/Asset" + std::to_string(i) + ".bundle");
            test::makeBundle(bundle, c.assets[i].version, {});
            arguments.push_back(bundle);
            arguments.insert(arguments.end(), c.assets[i].options.begin(),
                             c.assets[i].options.end());
        }
        test::ToolRun run = test::runCatalogTool(arguments);
        ASSERT_EQ(run.status, 0) << run.errors;
        if (c.edit) {
            const std::string path = work / "out/catalog.plist";
            std::optional<plist::Value> catalog = plist::readFile(path);
            ASSERT_TRUE(catalog);
            c.edit(*catalog);
            ASSERT_TRUE(plist::writeFile(path, *catalog));
        }
    }

    test::TempDir work;
    test::LocalHttpServer server;
};

// Removes "Version" from the first asset's attributes.
void dropFirstVersion(plist::Value& catalog) {
    plist::Array& assets = *catalog.asDictionary()->at("Assets").asArray();
    assets.at(0).asDictionary()->at("Attributes").asDictionary()->erase("Version");
}

TEST_F(AssetSelectionTest, ChoosesTheHighestFittingVersionAboveTheInstalledOne) {
    const std::vector<Case> cases{
        {"a patch release above the installed version", {{"1.0", {}}, {"1.0.1", {}}}, "1.0.1"},
        {"digit runs compare as numbers", {{"2.9", {}}, {"2.10", {}}, {"2.2", {}}}, "2.10"},
        {"bounds equal to the device's version pass",
         {{"1.5", {"--min-os", "9.1", "--max-os", "9.1"}}},
         "1.5"},
        {"bounds outside the device's version reject, compared as numbers",
         {{"3.0", {"--min-os", "10.0"}}, {"2.0", {"--max-os", "9.0"}}, {"1.1", {}}},
         "1.1"},
        {"a maximum of 9.10 is above 9.1", {{"2.0", {"--max-os", "9.10"}}}, "2.0"},
        {"product types match exactly; none listed means all",
         {{"4.0", {"--product-type", "Tablet7,10", "--product-type", "tablet7,1"}},
          {"3.0", {"--product-type", "Other1,1", "--product-type", "Tablet7,1"}},
          {"2.0", {}}},
         "3.0"},
        {"an asset without a version is never chosen",
         {{"9.0", {}}, {"1.2", {}}},
         "1.2",
         dropFirstVersion},
        {"nothing fits", {{"5.0", {"--product-type", "Other1,1"}}}, ""},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        publish(c);
        AssetHandler::AssetPtr best = AssetHandler::findTheBestAsset();
        if (c.chosen.empty()) {
            EXPECT_EQ(best, nullptr);
        } else if (best == nullptr) {
            ADD_FAILURE() << "nothing chosen";
        } else {
            EXPECT_EQ(best->attributes().at("Version"), plist::Value(c.chosen));
        }
    }
}

// Among equal versions the first listed wins. (That a check finds nothing newer than what is
// installed shows on the real daemon.)
TEST_F(AssetSelectionTest, FirstOfEqualVersionsWins) {
    publish({"equal versions", {{"1.3", {"--max-os", "9.9"}}, {"1.3", {}}}, "1.3"});
    AssetHandler::AssetPtr best = AssetHandler::findTheBestAsset();
    ASSERT_NE(best, nullptr);
    EXPECT_EQ(best->attributes().at("MaximumOSVersion"), plist::Value("9.9"));
}

}  // namespace
}  // namespace tavrix
