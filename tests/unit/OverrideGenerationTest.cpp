#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "bundle/BundleLinks.h"
#include "bundle/OverrideGeneration.h"
#include "device/PlatformRoot.h"
#include "plist/PropertyListFormat.h"
#include "util/SystemLog.h"

namespace tavrix {
namespace {

namespace fs = std::filesystem;
using plist::Array;
using plist::Dictionary;
using plist::Value;

// A device in the test's own root with one system bundle (version 1.0) whose base carrier file
// lists behavior overrides for "ABC".
class OverrideGenerationTest : public testing::Test {
  protected:
    void TearDown() override {
        std::error_code ignored;
        fs::remove_all(device::resolvePath("/System"), ignored);
        fs::remove_all(device::resolvePath("/etc/tavrix"), ignored);
        fs::remove_all(home() + "/Library", ignored);
    }

    static std::string home() { return test::unitTestRoot().string() + "/var/mobile"; }
    static std::string bundle() {
        return device::resolvePath("/System/Library/TavrixBundles/Phone/Default.bundle");
    }
    static std::string baseFile() { return bundle() + "/behavior.plist"; }
    static std::string overlayFile(const std::string& name) {
        return home() + "/Library/TavrixBundles/Overlay/" + name;
    }

    static Dictionary behaviorSection() {
        return Dictionary{{"abc-group", Dictionary{{"SupportedBehaviorIDs", Array{"ABC"}},
                                                   {"OverrideConfiguration",
                                                    Dictionary{{"Name", "Abc"},
                                                               {"_Exclude", Array{"Dropped"}}}}}}};
    }

    static Dictionary baseCarrier() {
        return Dictionary{{"Name", "Base"},
                          {"Dropped", true},
                          {"Model", "generic"},
                          {"BehaviorOverrides", behaviorSection()}};
    }

    static void writeDevice(const std::optional<std::string>& model) {
        Dictionary table{{"DeviceClass", "Phone"}};
        if (model) {
            table.emplace("HWModelStr", *model);
        }
        std::string path = device::resolvePath("/etc/tavrix/DeviceInfo.plist");
        fs::create_directories(fs::path(path).parent_path());
        ASSERT_TRUE(plist::writeFile(path, Value(table)));
    }

    static void writeBundle(const Value& carrier) {
        fs::create_directories(bundle());
        ASSERT_TRUE(plist::writeFile(bundle() + "/Info.plist",
                                     Value(Dictionary{{"QZBundleVersion", "1.0"}})));
        ASSERT_TRUE(plist::writeFile(baseFile(), carrier));
    }

    // The device decision leaves the base bundle in the record, as the reset flow would have it.
    CarrierBundle baseBundle() {
        CarrierBundle record;
        makeDeviceOverlayDecision(record, std::nullopt);
        sink.clear();
        return record;
    }

    CapturingLogSink sink;
    ScopedLogSink guard{sink};
};

struct FileIdentity {
    ino_t inode = 0;
    timespec modified{};
};

FileIdentity identityOf(const std::string& path) {
    struct stat info {};
    EXPECT_EQ(::stat(path.c_str(), &info), 0) << path;
    return {info.st_ino, info.st_mtim};
}

TEST_F(OverrideGenerationTest, BehaviorOverlayIsWrittenOnceWithoutItsSection) {
    writeDevice("T12AP");
    writeBundle(Value(baseCarrier()));
    CarrierBundle record = baseBundle();
    ASSERT_EQ(record.carrierFilePath, baseFile());

    const std::string written = overlayFile("id+behavior+Default.bundle+abc+1.0.plist");
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("abc")), kOverrideBundleSuccess);
    EXPECT_EQ(record.carrierFilePath, written);
    EXPECT_EQ(record.overlayType, kBehaviorOverlay);
    EXPECT_EQ(record.bundlePath, bundle());
    EXPECT_EQ(record.bundleVersion, "1.0");
    EXPECT_EQ(plist::readFile(written), Value(Dictionary{{"Name", "Abc"}, {"Model", "generic"}}));
    EXPECT_EQ(fs::status(fs::path(written).parent_path()).permissions(), fs::perms(0755));

    // A changed base does not bring a new file: the one there is taken as it is.
    FileIdentity before = identityOf(written);
    Dictionary changed = baseCarrier();
    changed.insert_or_assign("Name", "Changed");
    writeBundle(Value(changed));
    CarrierBundle again = baseBundle();
    EXPECT_EQ(applyMultimodeOverlay(again, std::string("abc")), kOverrideBundleSuccess);
    EXPECT_EQ(again.carrierFilePath, written);
    EXPECT_EQ(again.overlayType, kBehaviorOverlay);
    FileIdentity after = identityOf(written);
    EXPECT_EQ(after.inode, before.inode);
    EXPECT_EQ(after.modified.tv_sec, before.modified.tv_sec);
    EXPECT_EQ(after.modified.tv_nsec, before.modified.tv_nsec);
    EXPECT_EQ(plist::readFile(written)->find("Name")->description(), "Abc");
}

TEST_F(OverrideGenerationTest, WithoutAMatchTheRecordKeepsTheBaseFile) {
    writeDevice("T12AP");
    writeBundle(Value(baseCarrier()));
    CarrierBundle record = baseBundle();

    EXPECT_EQ(applyMultimodeOverlay(record, std::string("xyz")), kNoMatchForOverlay);
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("")), kOverrideNotRequired);
    EXPECT_EQ(applyMultimodeOverlay(record, std::nullopt), kOverrideNotRequired);

    writeBundle(Value(Dictionary{{"Name", "Base"}}));
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("abc")), kOverrideNotRequired);
    EXPECT_EQ(record.carrierFilePath, baseFile());
    EXPECT_EQ(record.overlayType, kNoOverlay);
    EXPECT_FALSE(fs::exists(home() + "/Library/TavrixBundles/Overlay"));
}

TEST_F(OverrideGenerationTest, DeviceOverlayKeepsTheSectionAndTheBehaviorOverlayBuildsOnIt) {
    writeDevice("T12AP");
    writeBundle(Value(baseCarrier()));
    // Only the name with the model as a whole '_' field and the right extension counts.
    ASSERT_TRUE(plist::writeFile(bundle() + "/overrides_T12.plist", Value(Dictionary{})));
    ASSERT_TRUE(plist::writeFile(bundle() + "/overrides_T12AP.txt", Value(Dictionary{})));
    ASSERT_TRUE(plist::writeFile(bundle() + "/overrides_X1_T12AP.plist",
                                 Value(Dictionary{{"Model", "T12AP"}})));

    CarrierBundle record;
    EXPECT_EQ(makeDeviceOverlayDecision(record, std::string("ignored")), kOverrideBundleSuccess);
    const std::string deviceFile = overlayFile("device+behavior+Default.bundle+T12AP+1.0.plist");
    EXPECT_EQ(record.carrierFilePath, deviceFile);
    EXPECT_EQ(record.overlayType, kDeviceOverlay);
    Dictionary deviceCarrier = baseCarrier();
    deviceCarrier.insert_or_assign("Model", "T12AP");
    EXPECT_EQ(plist::readFile(deviceFile), Value(deviceCarrier));

    // The behavior overlay reads the device file and keeps the model in its name.
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("abc")), kOverrideBundleSuccess);
    const std::string bothFile =
        overlayFile("device+id+behavior+Default.bundle+abc+T12AP+1.0.plist");
    EXPECT_EQ(record.carrierFilePath, bothFile);
    EXPECT_EQ(record.overlayType, kDeviceBehaviorOverlay);
    EXPECT_EQ(plist::readFile(bothFile), Value(Dictionary{{"Name", "Abc"}, {"Model", "T12AP"}}));
}

TEST_F(OverrideGenerationTest, WithoutADeviceFileTheBaseBundleIsLeftInTheRecord) {
    writeDevice("T12AP");
    writeBundle(Value(baseCarrier()));
    CarrierBundle record;
    record.carrierFilePath = "/stale";
    EXPECT_EQ(makeDeviceOverlayDecision(record, std::nullopt), kNoMatchForOverlay);
    EXPECT_EQ(record.bundlePath, bundle());
    EXPECT_EQ(record.carrierFilePath, baseFile());
    EXPECT_EQ(record.overlayType, kNoOverlay);
}

TEST_F(OverrideGenerationTest, AnUnknownModelNeedsNoOverride) {
    writeDevice(std::nullopt);
    writeBundle(Value(baseCarrier()));
    CarrierBundle record;
    EXPECT_EQ(makeDeviceOverlayDecision(record, std::nullopt), kOverrideNotRequired);
    EXPECT_EQ(record.carrierFilePath, baseFile());
}

TEST_F(OverrideGenerationTest, AnUnreadableBaseMeansNoCarrierInfo) {
    writeDevice("T12AP");
    // No bundle at all: the empty carrier path cannot be loaded.
    CarrierBundle record;
    EXPECT_EQ(makeDeviceOverlayDecision(record, std::nullopt), kCarrierInfoNotPresent);
    EXPECT_TRUE(record.bundlePath.empty());

    // A base carrier file that holds no dictionary.
    writeBundle(Value(Array{"ABC"}));
    record = baseBundle();
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("abc")), kCarrierInfoNotPresent);
    EXPECT_EQ(record.carrierFilePath, baseFile());
}

// Behavior IDs are chosen by others: whatever they hold, each gets a file of its own inside the
// overlay directory, and one that no file name can hold leaves the record alone.
TEST_F(OverrideGenerationTest, EveryBehaviorIDGetsItsOwnFileInsideTheOverlayDirectory) {
    writeDevice("T12AP");
    const std::string escaping = "x/../../../escape";
    const std::string lookalike = "x%2f..%2f..%2f..%2fescape";
    const std::string withFields = "a+b\n<0>";
    const std::string tooLong(300, 'l');
    Dictionary carrier = baseCarrier();
    carrier.insert_or_assign(
        "BehaviorOverrides",
        Dictionary{{"g", Dictionary{{"SupportedBehaviorIDs",
                                     Array{"abc", escaping, lookalike, withFields, tooLong}},
                                    {"OverrideConfiguration", Dictionary{{"Name", "X"}}}}}});
    writeBundle(Value(carrier));

    std::set<std::string> files;
    for (const std::string& id : {escaping, lookalike, withFields}) {
        CarrierBundle record = baseBundle();
        ASSERT_EQ(applyMultimodeOverlay(record, id), kOverrideBundleSuccess) << id;
        EXPECT_EQ(dirNameOfPath(record.carrierFilePath), home() + "/Library/TavrixBundles/Overlay");
        files.insert(record.carrierFilePath);
    }
    EXPECT_EQ(files.size(), 3u);
    EXPECT_FALSE(fs::exists(home() + "/Library/escape+1.0.plist"));

    CarrierBundle record = baseBundle();
    EXPECT_EQ(applyMultimodeOverlay(record, tooLong), kOverrideBundleFailure);
    EXPECT_EQ(record.carrierFilePath, baseFile());

    // A file where the Overlay directory belongs.
    fs::remove_all(home() + "/Library/TavrixBundles/Overlay");
    test::writeText(home() + "/Library/TavrixBundles/Overlay", "in the way");
    EXPECT_EQ(applyMultimodeOverlay(record, std::string("abc")), kOverrideBundleFailure);
    EXPECT_EQ(record.carrierFilePath, baseFile());
    EXPECT_EQ(record.overlayType, kNoOverlay);
}

}  // namespace
}  // namespace tavrix
