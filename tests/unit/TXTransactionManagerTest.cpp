#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>

#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "bus/ServiceManager.h"
#include "bus/TXTransactionManager.h"
#include "util/SystemLog.h"

namespace tavrix {
namespace {

// Each test runs in a process of its own, so the service manager binding is created here, with the
// keep-alive flag under the test's device root.
class TXTransactionManagerTest : public testing::Test {
  protected:
    void SetUp() override {
        runtime_ = (test::unitTestRoot() / "run/tavrixservicesd").string();
        ::setenv("RUNTIME_DIRECTORY", runtime_.c_str(), 1);
    }

    std::string flag() const { return test::readText(runtime_ + "/keep-alive"); }
    bus::ServiceManager& serviceManager() { return bus::ServiceManager::shared(); }

    std::string runtime_;
    CapturingLogSink log_;
    ScopedLogSink guard_{log_};
};

TEST_F(TXTransactionManagerTest, NamesAreCountedOnceAndEndingUnknownNamesIsHarmless) {
    TXTransactionManager transactions;
    transactions.beginTransaction("A");
    transactions.beginTransaction("A");
    EXPECT_EQ(serviceManager().openTransactionCount(), 1);
    transactions.endTransaction("A");
    EXPECT_EQ(serviceManager().openTransactionCount(), 0);
    EXPECT_FALSE(transactions.hasOpenTransactionForName("A"));

    log_.clear();
    transactions.endTransaction("A");
    transactions.endTransaction("never begun");
    EXPECT_EQ(serviceManager().openTransactionCount(), 0);
    EXPECT_TRUE(log_.messages().empty());
}

TEST_F(TXTransactionManagerTest, KeepAliveFollowsKeepAliveTransactionsWhenClearable) {
    TXTransactionManager transactions;
    transactions.beginTransaction("Update Check", true);
    EXPECT_EQ(flag(), "1\n");
    EXPECT_TRUE(transactions.isKeepAliveEnabled());
    EXPECT_TRUE(log_.contains("Keep alive status: Enabled"));
    EXPECT_FALSE(serviceManager().isIdle());

    // A second begin of an open name changes nothing, even with keep-alive.
    transactions.beginTransaction("plain");
    transactions.beginTransaction("plain", true);
    transactions.endTransaction("plain");
    EXPECT_EQ(flag(), "1\n");

    transactions.endTransaction("Update Check");
    EXPECT_EQ(flag(), "0\n");
    EXPECT_TRUE(log_.contains("Keep alive status: Disabled"));
    EXPECT_TRUE(serviceManager().isIdle());
}

TEST_F(TXTransactionManagerTest, NotClearableKeepsTheFlagSetUntilForced) {
    TXTransactionManager transactions;
    transactions.beginTransaction("Update Check", true);
    transactions.setKeepAliveClearable(false);
    transactions.endTransaction("Update Check");
    EXPECT_EQ(flag(), "1\n");
    transactions.clearKeepAliveIfNecessary(true);
    EXPECT_EQ(flag(), "1\n");  // still not clearable

    transactions.setKeepAliveClearable(true);
    transactions.beginTransaction("other", true);
    transactions.clearKeepAliveIfNecessary(false);  // a keep-alive name is open
    EXPECT_EQ(flag(), "1\n");
    transactions.clearKeepAliveIfNecessary(true);
    EXPECT_EQ(flag(), "0\n");
}

TEST_F(TXTransactionManagerTest, SettingTheCurrentValueWritesAndLogsNothing) {
    TXTransactionManager transactions;
    transactions.clearKeepAliveIfNecessary(true);  // no flag yet: already clear
    EXPECT_FALSE(std::filesystem::exists(runtime_ + "/keep-alive"));
    EXPECT_TRUE(log_.messages().empty());
}

TEST_F(TXTransactionManagerTest, UnreadableFlagCountsAsEnabledAndUnwritableIsLogged) {
    // A directory where the flag file should be: it can be neither read nor replaced.
    std::filesystem::create_directories(runtime_ + "/keep-alive");
    TXTransactionManager transactions;
    EXPECT_TRUE(transactions.isKeepAliveEnabled());
    EXPECT_TRUE(log_.contains("pelgarind could not read keep alive status from stelmard."));
    EXPECT_FALSE(serviceManager().isIdle());
    transactions.clearKeepAliveIfNecessary(true);
    EXPECT_TRUE(log_.contains("pelgarind could not toggle keep alive status to stelmard."));
}

TEST_F(TXTransactionManagerTest, DestructionEndsWhatIsStillOpen) {
    {
        TXTransactionManager transactions;
        transactions.beginTransaction("A");
        transactions.beginTransaction("B", true);
    }
    EXPECT_EQ(serviceManager().openTransactionCount(), 0);
    EXPECT_EQ(flag(), "0\n");
}

}  // namespace
}  // namespace tavrix
