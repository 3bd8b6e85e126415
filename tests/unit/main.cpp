// All unit tests run in one process. Each starts on a fresh device root in a temporary directory
// (a user database with the "mobile" user whose home is /var/mobile, and no device table) and
// under a daemon root of its own, so every long-lived object and every fact about the device
// starts anew and ends, its threads joined, with the test. What a test does not capture of the log
// goes nowhere.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <memory>

#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "daemon/Daemon.h"
#include "plist/PropertyListFormat.h"
#include "util/SystemLog.h"

namespace tavrix::test {

const std::filesystem::path& unitTestRoot() {
    static TempDir* root = new TempDir();
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

class RootPerTest : public testing::EmptyTestEventListener {
  public:
    // Empties the root and lays out what every test starts from.
    void OnTestStart(const testing::TestInfo&) override {
        const std::filesystem::path& root = unitTestRoot();
        for (const auto& entry : std::filesystem::directory_iterator(root)) {
            std::filesystem::remove_all(entry.path());
        }
        writeText((root / "etc/passwd").string(),
                  "root:x:0:0:root:/root:/bin/sh\n"
                  "mobile:x:" +
                      std::to_string(::getuid()) + ":" + std::to_string(::getgid()) +
                      ":Mobile User:/var/mobile:/usr/sbin/nologin\n");
        std::filesystem::create_directories(root / "var/mobile");
        root_ = std::make_unique<Daemon>();
    }
    void OnTestEnd(const testing::TestInfo&) override { root_.reset(); }

  private:
    std::unique_ptr<Daemon> root_;
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
    // Nothing reaches a bus or a proxy outside the tests: a test that wants a bus brings its own.
    ::setenv("DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nonexistent/tavrix-unit-tests", 1);
    ::unsetenv("DBUS_STARTER_ADDRESS");
    ::unsetenv("RUNTIME_DIRECTORY");
    ::setenv("no_proxy", "127.0.0.1", 1);
    ::setenv("NO_PROXY", "127.0.0.1", 1);
    testing::InitGoogleTest(&argc, argv);
    testing::AddGlobalTestEnvironment(new tavrix::test::RootEnvironment);
    testing::UnitTest::GetInstance()->listeners().Append(new tavrix::test::RootPerTest);
    tavrix::test::DiscardingSink quiet;
    tavrix::ScopedLogSink discard(quiet);
    return RUN_ALL_TESTS();
}
