// Every unit-test process gets a device root of its own in a temporary directory: a user
// database with the "mobile" user whose home is /var/mobile, and no device table. What a test
// does not capture of the log goes nowhere.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>

#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "plist/PropertyListFormat.h"
#include "util/SystemLog.h"

namespace tavrix::test {

const std::filesystem::path& unitTestRoot() {
    static TempDir* root = [] {
        auto* dir = new TempDir();
        writeText(*dir / "etc/passwd",
                  "root:x:0:0:root:/root:/bin/sh\n"
                  "mobile:x:" +
                      std::to_string(::getuid()) + ":" + std::to_string(::getgid()) +
                      ":Mobile User:/var/mobile:/usr/sbin/nologin\n");
        std::filesystem::create_directories(*dir / "var/mobile");
        return dir;
    }();
    return root->path();
}

void writeDeviceTable(const plist::Dictionary& table) {
    const std::filesystem::path path = unitTestRoot() / "etc/tavrix/DeviceInfo.plist";
    std::filesystem::create_directories(path.parent_path());
    if (!plist::writeFile(path.string() + ".new", plist::Value(table))) {
        throw std::runtime_error("cannot write the device table");
    }
    std::filesystem::rename(path.string() + ".new", path);
}

namespace {
class DiscardingSink : public LogSink {
  public:
    void write(int, std::string_view) override {}
};

class RootEnvironment : public testing::Environment {
  public:
    void TearDown() override {
        std::error_code ignored;
        std::filesystem::remove_all(unitTestRoot(), ignored);
    }
};
}  // namespace

}  // namespace tavrix::test

int main(int argc, char** argv) {
    ::setenv("TAVRIX_ROOT", tavrix::test::unitTestRoot().c_str(), 1);
    testing::InitGoogleTest(&argc, argv);
    testing::AddGlobalTestEnvironment(new tavrix::test::RootEnvironment);
    tavrix::test::DiscardingSink quiet;
    tavrix::ScopedLogSink discard(quiet);
    return RUN_ALL_TESTS();
}
