// Schedules the periodic over-the-air update check. The time of the next check is the daemon
// preference "NextUpdate"; one background job fires inside a one-hour window starting then, and
// its handler runs the check under a keep-alive transaction.
#pragma once

#include <chrono>
#include <mutex>
#include <optional>
#include <string>

#include "bus/BackgroundJobScheduler.h"
#include "plist/Value.h"
#include "util/SerialQueue.h"

namespace tavrix {

class TXTransactionManager;

// The interval the scheduler arms itself with: 15 days.
inline constexpr double kUpdateCheckIntervalSeconds = 1296000.0;
// How long the job's window stays open after "NextUpdate".
inline constexpr double kUpdateCheckWindowSeconds = 3600.0;
// Held open, with keep-alive, from the job firing until the check has come to an end.
inline constexpr const char* TXUpdateCheckTransaction = "Update Check";

inline constexpr const char* kUpdateCheckJobName = "Behavior Bundle Update Check";
inline constexpr const char* kUpdateCheckClientName = "com.zandor.tavrixservicesd";
inline constexpr const char* kUpdateCheckQueueLabel = "com.zandor.quorrd.TimerManagerSerialQueue";

class UpdateCheckScheduler {
  public:
    // The daemon root's scheduler, created once from any thread; creating it arms its timer.
    static UpdateCheckScheduler& sharedInstance();

    // Stops the job timer and the scheduler queue, letting a check already queued run. The
    // scheduler stays usable for re-arming (a download finishing later), but no job fires.
    void stop();
    ~UpdateCheckScheduler();
    UpdateCheckScheduler(const UpdateCheckScheduler&) = delete;
    UpdateCheckScheduler& operator=(const UpdateCheckScheduler&) = delete;

    // Arms the timer from the stored "NextUpdate" (pushed 15 days ahead when missing or past).
    void startTimer();
    // Stores now + seconds as "NextUpdate" and registers the job for it.
    void setUpNewTimer(double seconds);
    // (Re)registers the one job for the stored "NextUpdate".
    void scheduleJob();
    // The job's handler, on the scheduler queue: runs the check.
    void onJobFired(const std::string& jobName, const plist::Dictionary* job);
    // Re-arms seconds ahead and ends the check; called when a started download has finished,
    // from any thread.
    void rescheduleAndEndCheck(double seconds);
    // When the registered job's window starts (seconds since the reference date), or nothing
    // when no check is registered.
    std::optional<double> nextCheckTime() const;

  private:
    // A check holds its transaction in transactions from the job firing to its end.
    explicit UpdateCheckScheduler(TXTransactionManager& transactions);
    // Registers the one job for a window starting then; the caller holds _rearmLock.
    void scheduleJobAt(double start);

    TXTransactionManager& _transactions;
    SerialQueue _schedulerQueue;
    std::optional<bus::BackgroundJobScheduler> _jobScheduler;
    // Re-arming runs on the main thread, the scheduler queue and the download thread; this keeps
    // "NextUpdate" and the registered job in step.
    std::mutex _rearmLock;
};

}  // namespace tavrix
