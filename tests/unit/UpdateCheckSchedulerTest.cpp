// Each test runs in a process of its own, so each creates the process's scheduler afresh.
#include <gtest/gtest.h>

#include <chrono>
#include <cmath>
#include <optional>
#include <string>

#include "TestDoubles.h"
#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "bus/TXTransactionManager.h"
#include "daemon/UpdateCheckScheduler.h"
#include "device/BehaviorPreferences.h"
#include "plist/DateText.h"
#include "plist/PropertyListFormat.h"

namespace tavrix {
namespace {

class UpdateCheckSchedulerTest : public testing::Test {
  protected:
    void SetUp() override { test::writeDeviceTable({{"contains-cellular-radio", false}}); }

    static void enableSupport(bool enabled) {
        ASSERT_TRUE(setBehaviorPreference(kEnableSupportKey, plist::Value(enabled)));
        ASSERT_TRUE(setBehaviorPreference(kTavrixIDKey, plist::Value("acme.default")));
    }
    static std::optional<double> nextUpdate() {
        auto stored = copyBehaviorPreference(kNextUpdateKey);
        if (!stored || stored->asDate() == nullptr) {
            return std::nullopt;
        }
        return stored->asDate()->secondsSinceReferenceDate;
    }
    static void setNextUpdate(double seconds) {
        ASSERT_TRUE(setBehaviorPreference(kNextUpdateKey, plist::Value(plist::Date{seconds})));
    }
    static plist::Dictionary registeredJobs() {
        auto stored =
            plist::readFile(bus::BackgroundJobScheduler::jobsFilePath(kUpdateCheckClientName));
        return stored && stored->isDictionary() ? *stored->asDictionary() : plist::Dictionary{};
    }
    // The one registered job is the update check, with a one-hour window at "NextUpdate", and
    // "NextUpdate" is 15 days from now.
    static void expectArmedFifteenDaysAhead() {
        auto next = nextUpdate();
        ASSERT_TRUE(next);
        EXPECT_LT(std::fabs(*next - (Clock::absoluteTimeNow() + 1296000.0)), 60.0);
        const plist::Dictionary job{
            {std::string(bus::kJobWindowStartDate), *next},
            {std::string(bus::kJobWindowEndDate), *next + 3600.0},
            {std::string(bus::kJobPowerOptimizationLevel), plist::Integer(1)},
            {std::string(bus::kJobAllowedDuringVoiceCall), true}};
        EXPECT_EQ(registeredJobs(), (plist::Dictionary{{"Behavior Bundle Update Check", job}}));
    }
};

// A stored time still ahead (by at most 15 days) is kept; none, a mistyped one, a past one or one
// further ahead is replaced by one 15 days ahead, and a missed check does not run now. Exactly one
// job exists throughout.
TEST_F(UpdateCheckSchedulerTest, ArmsFifteenDaysAheadUnlessAFutureTimeIsStored) {
    enableSupport(true);
    UpdateCheckScheduler& scheduler = UpdateCheckScheduler::sharedInstance();
    expectArmedFifteenDaysAhead();

    const double ahead = std::floor(Clock::absoluteTimeNow()) + 86400.0;
    setNextUpdate(ahead);
    scheduler.startTimer();
    EXPECT_EQ(nextUpdate(), std::optional<double>(ahead));
    EXPECT_EQ(registeredJobs().size(), 1u);

    // Without a date the job is left as it is, never registered for time 0 (at once).
    const auto registered = registeredJobs();
    ASSERT_TRUE(setBehaviorPreference(kNextUpdateKey, plist::Value("tomorrow")));
    scheduler.scheduleJob();
    EXPECT_EQ(registeredJobs(), registered);
    scheduler.startTimer();
    expectArmedFifteenDaysAhead();

    setNextUpdate(Clock::absoluteTimeNow() - 600.0);
    scheduler.startTimer();
    expectArmedFifteenDaysAhead();

    // Years ahead (a clock that was once wrong) would hold every check back until then.
    setNextUpdate(Clock::absoluteTimeNow() + 20 * 365 * 86400.0);
    scheduler.startTimer();
    expectArmedFifteenDaysAhead();

    // The same past 2038, where a 32-bit time_t ends: the time stored now lies behind, and one
    // stored a day ahead stays.
    ScopedClockOffset in2040(
        std::chrono::duration_cast<Clock::Duration>(std::chrono::duration<double>(
            *plist::parseXmlDateText("2040-02-29T12:00:00Z") - Clock::absoluteTimeNow())));
    scheduler.startTimer();
    expectArmedFifteenDaysAhead();
    const double ahead2040 = std::floor(Clock::absoluteTimeNow()) + 86400.0;
    setNextUpdate(ahead2040);
    scheduler.startTimer();
    EXPECT_EQ(nextUpdate(), std::optional<double>(ahead2040));
    EXPECT_EQ(registeredJobs().size(), 1u);

    // Unsupported, it keeps even a past time and registers nothing.
    enableSupport(false);
    const auto jobs = registeredJobs();
    setNextUpdate(Clock::absoluteTimeNow() - 600.0);
    scheduler.startTimer();
    EXPECT_LT(nextUpdate().value_or(0.0), Clock::absoluteTimeNow());
    EXPECT_EQ(registeredJobs(), jobs);
}

// A fired job (here one that comes without its criteria) runs the check, which fails as no
// catalog has a bundle, re-arms 15 days from now and closes its keep-alive transaction. (A job
// firing when its window comes shows on the real daemon.)
TEST_F(UpdateCheckSchedulerTest, FiredJobWhoseCheckFailsReArmsAndLeavesNothingOpen) {
    enableSupport(true);
    UpdateCheckScheduler& scheduler = UpdateCheckScheduler::sharedInstance();
    setNextUpdate(Clock::absoluteTimeNow() - 600.0);
    scheduler.onJobFired("Behavior Bundle Update Check", nullptr);
    EXPECT_FALSE(TXTransactionManager::sharedInstance().hasOpenTransactionForName("Update Check"));
    EXPECT_EQ(test::readText((test::unitTestRoot() / "run/tavrixservicesd/keep-alive").string()),
              "0\n");
    expectArmedFifteenDaysAhead();
}

}  // namespace
}  // namespace tavrix
