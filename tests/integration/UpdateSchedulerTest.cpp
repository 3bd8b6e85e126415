// The update check as the device sees it: a job whose window came while the daemon was gone runs
// when the daemon is started again, and the daemon still leaves when idle.
#include <filesystem>

#include "BusFixture.h"
#include "platform/BackgroundJobScheduler.h"
#include "platform/Clock.h"
#include "plist/PropertyListFormat.h"
#include "update/UpdateCheckScheduler.h"

namespace tavrix::integration {
namespace {

class UpdateSchedulerTest : public BusFixture {
  protected:
    UpdateSchedulerTest() { busOptions.idleExitSeconds = 1; }

    std::string jobsFile() {
        return platform::BackgroundJobScheduler::jobsFilePathUnder(device().root().string(),
                                                                   kUpdateCheckClientName);
    }
};

// No catalog is configured, so the check fails and re-arms 15 days ahead; it runs once although
// start-up also finds "NextUpdate" past and re-arms the job.
TEST_F(UpdateSchedulerTest, JobDueAtLaunchRunsTheCheckOnceThenTheDaemonLeaves) {
    const double now = platform::Clock::absoluteTimeNow();
    const double nextUpdate = now - 60.0;
    device().writeDaemonPreferences({{"EnableSupport", true},
                                     {"TavrixID", "acme.default"},
                                     {"NextUpdate", plist::Date{nextUpdate}}});
    plist::Dictionary job{
        {std::string(platform::kJobWindowStartDate), nextUpdate},
        {std::string(platform::kJobWindowEndDate), nextUpdate + kUpdateCheckWindowSeconds},
        {std::string(platform::kJobPowerOptimizationLevel), plist::Integer(1)},
        {std::string(platform::kJobAllowedDuringVoiceCall), true}};
    std::filesystem::create_directories(std::filesystem::path(jobsFile()).parent_path());
    ASSERT_TRUE(
        plist::writeFile(jobsFile(), plist::Value(plist::Dictionary{{kUpdateCheckJobName, job}})));

    EXPECT_TRUE(client().isTavrixBundleSupported());
    const auto pid = daemonPid();
    ASSERT_TRUE(pid);
    EXPECT_TRUE(
        waitForLogLine("*********** Beginning Corvex transaction : Update Check ***********"));
    EXPECT_TRUE(waitForLogLine("Update check has failed, rescheduling the next update"));
    EXPECT_TRUE(waitForLogLine("*********** Ended Corvex transaction : Update Check ***********"));

    ASSERT_TRUE(waitForNoNameOwner(30s));
    EXPECT_EQ(waitForDaemonExit(*pid), std::optional<int>(0));
    EXPECT_EQ(countLogLines("Update check has failed, rescheduling the next update"), 1);
    EXPECT_EQ(device().keepAliveFlag(), std::optional<std::string>("0"));

    // Re-armed 15 days ahead, with the job following "NextUpdate".
    auto preferences = device().readDaemonPreferences();
    const plist::Value* rearmed = preferences ? preferences->find("NextUpdate") : nullptr;
    ASSERT_TRUE(rearmed != nullptr && rearmed->asDate() != nullptr);
    EXPECT_GT(rearmed->asDate()->secondsSinceReferenceDate,
              now + kUpdateCheckIntervalSeconds - 60.0);
    auto jobs = plist::readFile(jobsFile());
    const plist::Value* rearmedJob = jobs ? jobs->find(kUpdateCheckJobName) : nullptr;
    ASSERT_NE(rearmedJob, nullptr);
    const plist::Value* windowStart = rearmedJob->find(platform::kJobWindowStartDate);
    EXPECT_TRUE(windowStart != nullptr &&
                *windowStart == plist::Value(rearmed->asDate()->secondsSinceReferenceDate));
}

}  // namespace
}  // namespace tavrix::integration
