#include "daemon/UpdateCheckScheduler.h"

#include <cmath>

#include "bus/TXTransactionManager.h"
#include "daemon/TXManager.h"
#include "device/BehaviorPreferences.h"
#include "util/Clock.h"
#include "util/Log.h"
#include "util/SharedInstance.h"

namespace tavrix {

UpdateCheckScheduler& UpdateCheckScheduler::sharedInstance() {
    return SharedInstance<UpdateCheckScheduler>::current().instance([] {
        return std::unique_ptr<UpdateCheckScheduler>(
            new UpdateCheckScheduler(TXTransactionManager::sharedInstance()));
    });
}

void UpdateCheckScheduler::stop() {
    // The timer first: it is what queues jobs on the scheduler queue.
    _jobScheduler->stopTimer();
    _schedulerQueue.shutdown();
}

UpdateCheckScheduler::~UpdateCheckScheduler() {
    stop();
}

UpdateCheckScheduler::UpdateCheckScheduler(TXTransactionManager& transactions)
    : _transactions(transactions), _schedulerQueue(kUpdateCheckQueueLabel) {
    logObjectFormat("Initializing Timers Manager");
    // Created on the queue: a job due at launch is queued by the binding's constructor, and so
    // reaches onJobFired only once the binding is in place.
    _schedulerQueue.dispatchSync([this] {
        _jobScheduler.emplace(kUpdateCheckClientName, _schedulerQueue,
                              [this](const std::string& jobName, const plist::Dictionary* job) {
                                  onJobFired(jobName, job);
                              });
    });
    startTimer();
}

void UpdateCheckScheduler::startTimer() {
    if (!TXManager::sharedInstance().isTavrixBundleSupported()) {
        // A job registered earlier stays: it finds the device unsupported when it fires.
        logObjectFormat("Behavior bundle is not supported, not starting the update check timer");
        return;
    }
    auto stored = copyBehaviorPreference(kNextUpdateKey);
    const plist::Date* nextUpdate = stored ? stored->asDate() : nullptr;
    if (nextUpdate == nullptr) {
        logObjectFormat("No previous update time in the preferences list");
        setUpNewTimer(kUpdateCheckIntervalSeconds);
    } else if (nextUpdate->secondsSinceReferenceDate < Clock::absoluteTimeNow()) {
        // A missed check is not run now but pushed a whole interval ahead.
        logObjectFormat("Previous update time present is past, resetting it");
        setUpNewTimer(kUpdateCheckIntervalSeconds);
    } else if (nextUpdate->secondsSinceReferenceDate >
               Clock::absoluteTimeNow() + kUpdateCheckIntervalSeconds) {
        // No check is ever armed further ahead: a date like that was set by a clock that was
        // wrong, and would hold every check back until then.
        logObjectFormat("Previous update time is more than an interval ahead, resetting it");
        setUpNewTimer(kUpdateCheckIntervalSeconds);
    } else {
        scheduleJob();
    }
}

void UpdateCheckScheduler::setUpNewTimer(double seconds) {
    std::lock_guard lock(_rearmLock);
    logObjectFormat("Setting up a new update check timer");
    // Whole seconds, as the stored date keeps them: the job and "NextUpdate" name one moment.
    const double start = std::floor(Clock::absoluteTimeNow() + seconds);
    if (!setBehaviorPreference(kNextUpdateKey, plist::Value(plist::Date{start}))) {
        // This run still checks on time; a later launch arms from what is stored.
        logCFormat(LogPriority::Warning,
                   "Could not store the next update time; scheduling the check all the same\n");
    }
    scheduleJobAt(start);
}

void UpdateCheckScheduler::scheduleJob() {
    std::lock_guard lock(_rearmLock);
    auto stored = copyBehaviorPreference(kNextUpdateKey);
    const plist::Date* nextUpdate = stored ? stored->asDate() : nullptr;
    if (nextUpdate == nullptr) {
        logObjectFormat(
            "No update time in the preferences list, the update check is not scheduled");
        return;
    }
    scheduleJobAt(nextUpdate->secondsSinceReferenceDate);
}

void UpdateCheckScheduler::scheduleJobAt(double start) {
    plist::Dictionary criteria{
        {std::string(bus::kJobWindowStartDate), start},
        {std::string(bus::kJobWindowEndDate), start + kUpdateCheckWindowSeconds},
        {std::string(bus::kJobPowerOptimizationLevel), plist::Integer(1)},
        {std::string(bus::kJobAllowedDuringVoiceCall), true},
    };
    // Every supported launch comes here: a registration that is already as asked is left alone,
    // rather than written to the job store (with its fsync) again.
    const plist::Dictionary jobs = _jobScheduler->copyJobs();
    auto registered = jobs.find(kUpdateCheckJobName);
    if (registered != jobs.end() && registered->second == plist::Value(criteria)) {
        return;
    }
    // Adding replaces the job of that name; one that cannot be added must not stay either.
    if (!_jobScheduler->addJob(kUpdateCheckJobName, criteria)) {
        _jobScheduler->removeJob(kUpdateCheckJobName);
    }
}

void UpdateCheckScheduler::onJobFired(const std::string& /*jobName*/,
                                      const plist::Dictionary* job) {
    // Keep-alive, so that the daemon stays for the download that may follow.
    _transactions.beginTransaction(TXUpdateCheckTransaction, true);
    if (job == nullptr) {
        logObjectFormat(LogPriority::Warning,
                        "Invalid Corvex job object received in the call back");
    } else if (TXManager::sharedInstance().checkForTavrixBundleUpdate()) {
        // The download path ends the transaction through rescheduleAndEndCheck.
        return;
    }
    logObjectFormat(LogPriority::Warning, "Update check has failed, rescheduling the next update");
    setUpNewTimer(kUpdateCheckIntervalSeconds);
    // Ended twice, as this path always has; the second end finds the name closed and does nothing.
    _transactions.endTransaction(TXUpdateCheckTransaction);
    _transactions.endTransaction(TXUpdateCheckTransaction);
}

void UpdateCheckScheduler::rescheduleAndEndCheck(double seconds) {
    setUpNewTimer(seconds);
    _transactions.endTransaction(TXUpdateCheckTransaction);
}

std::optional<double> UpdateCheckScheduler::nextCheckTime() const {
    return _jobScheduler ? _jobScheduler->windowStart(kUpdateCheckJobName) : std::nullopt;
}

}  // namespace tavrix
