#include <gtest/gtest.h>

#include <filesystem>

#include "TestDoubles.h"
#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "bus/ServiceManager.h"
#include "bus/TXTransactionManager.h"

namespace tavrix {
namespace {

// The service manager is the test's own, its keep-alive flag under the test's device root.
class TXTransactionManagerTest : public testing::Test {
  protected:
    std::string flag() const { return test::readText(flagPath); }
    bus::ServiceManager& serviceManager() { return bus::ServiceManager::shared(); }

    const std::string flagPath = (test::unitTestRoot() / "run/tavrixservicesd/keep-alive").string();
    CapturingLogSink log_;
    ScopedLogSink guard_{log_};
};

// The flag follows keep-alive transactions while clearable; not clearable, it stays set even when
// forced. Setting the value it already has writes nothing, and a name is open once however often it
// begins.
TEST_F(TXTransactionManagerTest, KeepAliveFollowsKeepAliveTransactionsWhenClearable) {
    TXTransactionManager transactions(serviceManager());
    transactions.clearKeepAliveIfNecessary(true);  // no flag yet: already clear
    EXPECT_FALSE(std::filesystem::exists(flagPath));
    transactions.beginTransaction("Update Check", true);
    EXPECT_EQ(flag(), "1\n");
    EXPECT_TRUE(transactions.isKeepAliveEnabled());
    EXPECT_FALSE(serviceManager().isIdle());

    // A second begin of an open name changes nothing, even with keep-alive.
    transactions.beginTransaction("plain");
    transactions.beginTransaction("plain", true);
    EXPECT_EQ(serviceManager().openTransactionCount(), 2);
    transactions.endTransaction("plain");
    EXPECT_EQ(flag(), "1\n");
    transactions.endTransaction("Update Check");
    EXPECT_EQ(flag(), "0\n");
    EXPECT_TRUE(serviceManager().isIdle());

    transactions.beginTransaction("Update Check", true);
    transactions.setKeepAliveClearable(false);
    transactions.endTransaction("Update Check");
    EXPECT_EQ(flag(), "1\n");
    transactions.clearKeepAliveIfNecessary(true);
    EXPECT_EQ(flag(), "1\n");
    transactions.setKeepAliveClearable(true);
    transactions.beginTransaction("other", true);
    transactions.clearKeepAliveIfNecessary(false);  // a keep-alive name is open
    EXPECT_EQ(flag(), "1\n");
    transactions.clearKeepAliveIfNecessary(true);
    EXPECT_EQ(flag(), "0\n");
}

// A flag that cannot be read counts as enabled, so the daemon stays rather than leaving early.
TEST_F(TXTransactionManagerTest, UnreadableFlagCountsAsEnabled) {
    // A directory where the flag file should be: it can be neither read nor replaced.
    std::filesystem::create_directories(flagPath);
    TXTransactionManager transactions(serviceManager());
    EXPECT_TRUE(transactions.isKeepAliveEnabled());
    EXPECT_FALSE(serviceManager().isIdle());
    transactions.clearKeepAliveIfNecessary(true);
    EXPECT_TRUE(std::filesystem::is_directory(flagPath));
}

}  // namespace
}  // namespace tavrix
