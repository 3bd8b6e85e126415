// Each test runs in a process of its own, so each creates the process's scheduler afresh.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <condition_variable>
#include <cstdlib>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "daemon/BehaviorPreferences.h"
#include "daemon/TXTransactionManager.h"
#include "platform/Clock.h"
#include "platform/SystemLog.h"
#include "plist/PropertyListFormat.h"
#include "update/UpdateCheckScheduler.h"

namespace tavrix {
namespace {

using namespace std::chrono_literals;

constexpr const char* kCheckBegun =
    "*********** Beginning Corvex transaction : Update Check ***********";
constexpr const char* kCheckEnded =
    "*********** Ended Corvex transaction : Update Check ***********";
constexpr const char* kCheckFailed = "Update check has failed, rescheduling the next update";

// Keeps the log and lets a test wait for a line written on another thread.
class WaitableLogSink : public platform::LogSink {
  public:
    void write(int, std::string_view message) override {
        std::lock_guard lock(mutex_);
        lines_.emplace_back(message);
        changed_.notify_all();
    }
    int count(std::string_view line) {
        std::lock_guard lock(mutex_);
        return static_cast<int>(std::count(lines_.begin(), lines_.end(), line));
    }
    bool waitFor(std::string_view line) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, 20s, [&] {
            return std::find(lines_.begin(), lines_.end(), line) != lines_.end();
        });
    }

  private:
    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<std::string> lines_;
};

class UpdateCheckSchedulerTest : public testing::Test {
  protected:
    void SetUp() override {
        runtime_ = (test::unitTestRoot() / "run/tavrixservicesd").string();
        ::setenv("RUNTIME_DIRECTORY", runtime_.c_str(), 1);
        test::writeDeviceTable({{"contains-cellular-radio", false}});
    }

    static void enableSupport(bool enabled) {
        setBehaviorPreference(kEnableSupportKey, plist::Value(enabled));
        setBehaviorPreference(kTavrixIDKey, plist::Value("acme.default"));
    }
    static std::optional<double> nextUpdate() {
        auto stored = copyBehaviorPreference(kNextUpdateKey);
        if (!stored || stored->asDate() == nullptr) {
            return std::nullopt;
        }
        return stored->asDate()->secondsSinceReferenceDate;
    }
    static void setNextUpdate(double seconds) {
        setBehaviorPreference(kNextUpdateKey, plist::Value(plist::Date{seconds}));
    }
    static plist::Dictionary registeredJobs() {
        auto stored =
            plist::readFile(platform::BackgroundJobScheduler::jobsFilePath(kUpdateCheckClientName));
        return stored && stored->isDictionary() ? *stored->asDictionary() : plist::Dictionary{};
    }
    // The one registered job is the update check, with a one-hour window at "NextUpdate", and
    // "NextUpdate" is 15 days from now.
    static void expectArmedFifteenDaysAhead() {
        auto next = nextUpdate();
        ASSERT_TRUE(next);
        EXPECT_LT(std::fabs(*next - (platform::Clock::absoluteTimeNow() + 1296000.0)), 60.0);
        plist::Dictionary jobs = registeredJobs();
        ASSERT_EQ(jobs.size(), 1u);
        EXPECT_EQ(jobs.begin()->first, "Behavior Bundle Update Check");
        const plist::Value& job = jobs.begin()->second;
        auto criterion = [&](std::string_view key) {
            const plist::Value* value = job.find(key);
            return value != nullptr ? std::optional<plist::Value>(*value) : std::nullopt;
        };
        EXPECT_EQ(criterion(platform::kJobWindowStartDate), plist::Value(*next));
        EXPECT_EQ(criterion(platform::kJobWindowEndDate), plist::Value(*next + 3600.0));
        EXPECT_EQ(criterion(platform::kJobPowerOptimizationLevel), plist::Value(plist::Integer(1)));
        EXPECT_EQ(criterion(platform::kJobAllowedDuringVoiceCall), plist::Value(true));
    }

    std::string runtime_;
    WaitableLogSink log_;
    platform::ScopedLogSink logGuard_{log_};
};

// A stored time still ahead is kept; none, a mistyped one or a past one is replaced by one 15 days
// ahead, and a missed check does not run now. Exactly one job exists throughout.
TEST_F(UpdateCheckSchedulerTest, ArmsFifteenDaysAheadUnlessAFutureTimeIsStored) {
    enableSupport(true);
    UpdateCheckScheduler& scheduler = UpdateCheckScheduler::sharedInstance();
    expectArmedFifteenDaysAhead();

    const double ahead = std::floor(platform::Clock::absoluteTimeNow()) + 86400.0;
    setNextUpdate(ahead);
    scheduler.startTimer();
    EXPECT_EQ(nextUpdate(), std::optional<double>(ahead));
    EXPECT_EQ(registeredJobs().size(), 1u);

    setBehaviorPreference(kNextUpdateKey, plist::Value("tomorrow"));
    scheduler.startTimer();
    expectArmedFifteenDaysAhead();

    setNextUpdate(platform::Clock::absoluteTimeNow() - 600.0);
    scheduler.startTimer();
    expectArmedFifteenDaysAhead();
    EXPECT_EQ(log_.count(kCheckBegun), 0);
}

TEST_F(UpdateCheckSchedulerTest, UnsupportedDeviceRegistersNothingAndKeepsNextUpdate) {
    enableSupport(false);
    const double stale = std::floor(platform::Clock::absoluteTimeNow()) - 86400.0;
    setNextUpdate(stale);
    UpdateCheckScheduler::sharedInstance();
    EXPECT_EQ(nextUpdate(), std::optional<double>(stale));
    EXPECT_TRUE(registeredJobs().empty());
}

// The job fires once its window has come (the clock moved 15 days on); the check fails here, as
// no catalog has a bundle, so it re-arms 15 days from then and closes its keep-alive transaction.
// A job object that is missing takes the same path.
TEST_F(UpdateCheckSchedulerTest, FiredJobWhoseCheckFailsReArmsAndLeavesNothingOpen) {
    enableSupport(true);
    UpdateCheckScheduler& scheduler = UpdateCheckScheduler::sharedInstance();

    platform::ScopedClockOffset fortnightLater(std::chrono::seconds(1296000 + 5));
    ASSERT_TRUE(log_.waitFor(kCheckEnded));
    EXPECT_EQ(log_.count(kCheckBegun), 1);
    EXPECT_EQ(log_.count(kCheckFailed), 1);
    EXPECT_EQ(log_.count(kCheckEnded), 1);
    expectArmedFifteenDaysAhead();
    EXPECT_FALSE(TXTransactionManager::sharedInstance().hasOpenTransactionForName("Update Check"));
    EXPECT_EQ(test::readText(runtime_ + "/keep-alive"), "0\n");

    scheduler.onJobFired("Behavior Bundle Update Check", nullptr);
    EXPECT_EQ(log_.count(kCheckFailed), 2);
    EXPECT_EQ(log_.count(kCheckEnded), 2);
    EXPECT_FALSE(TXTransactionManager::sharedInstance().hasOpenTransactionForName("Update Check"));
    expectArmedFifteenDaysAhead();
}

}  // namespace
}  // namespace tavrix
