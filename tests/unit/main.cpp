// Every unit-test process gets a device root of its own in a temporary directory: a user
// database with the "mobile" user whose home is /var/mobile, and no device table.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>

#include "TestSupport.h"
#include "UnitTestRoot.h"

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

namespace {
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
    return RUN_ALL_TESTS();
}
