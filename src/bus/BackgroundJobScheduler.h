// Background jobs: named jobs, each with a time window, that a client registers so that its
// handler runs once inside the window, on the client's queue.
//
// A client's jobs are kept in one property-list file, "<client name>.jobs.plist" in
// /var/lib/tavrixservicesd under the platform root: a dictionary from job name to the job's
// criteria. They outlive the process: the next binding for the same client reads them back, fires
// at once every job whose window contains that moment, and drops those whose window has passed.
// While the binding lives, a timer thread fires each job when its window starts. A job fires once
// per registration and is then forgotten; removing it, or adding it again, cancels a fire that
// has not happened yet. A damaged file is logged and read as no jobs.
//
// Safe to use from several threads, the handler's own queue included.
#pragma once

#include <condition_variable>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>

#include "plist/Value.h"
#include "util/Clock.h"
#include "util/SerialQueue.h"

namespace tavrix::bus {

// Criteria keys. The window bounds are numbers: seconds since 2001-01-01 00:00:00 UTC.
inline constexpr std::string_view kJobWindowStartDate = "WindowStartDate";
inline constexpr std::string_view kJobWindowEndDate = "WindowEndDate";
// Kept with the job and handed back to the handler; this system has no power or call states that
// would hold a job back, so they do not change when it fires.
inline constexpr std::string_view kJobPowerOptimizationLevel = "PowerOptimizationLevel";
inline constexpr std::string_view kJobAllowedDuringVoiceCall = "AllowedDuringVoiceCall";

class BackgroundJobScheduler {
  public:
    // Called on the client's queue with the job's name and criteria.
    using Handler = std::function<void(const std::string& jobName, const plist::Dictionary* job)>;

    // Reads the client's jobs back and fires those whose window contains now (handler queued on
    // queue before this returns). queue must outlive the binding.
    BackgroundJobScheduler(std::string clientName, SerialQueue& queue, Handler handler);
    // Stops the timer; jobs not yet fired stay in the file for the next binding.
    ~BackgroundJobScheduler();
    // Stops and joins the timer thread ahead of destruction; jobs can still be added and removed
    // (and are saved), but none fires any more. Safe to call twice.
    void stopTimer();
    BackgroundJobScheduler(const BackgroundJobScheduler&) = delete;
    BackgroundJobScheduler& operator=(const BackgroundJobScheduler&) = delete;

    // Registers the job under name, replacing any job of that name. False (logged) when the
    // criteria have no valid window, or the window has already passed.
    bool addJob(const std::string& name, const plist::Dictionary& criteria);
    // Forgets the job; removing an unknown name does nothing.
    void removeJob(const std::string& name);

    // The jobs waiting to fire, by name, with their criteria.
    plist::Dictionary copyJobs() const;
    // When the named job's window starts (seconds since the reference date), or nothing when no
    // such job waits.
    std::optional<double> windowStart(const std::string& name) const;

    // The file holding clientName's jobs under the process's platform root, or under root.
    static std::string jobsFilePath(std::string_view clientName);
    static std::string jobsFilePathUnder(std::string_view root, std::string_view clientName);

  private:
    struct Job {
        plist::Dictionary criteria;
        double windowStart = 0;
        double windowEnd = 0;
    };

    void load();
    // Fires the jobs whose window has started and drops those whose window has ended; saves the
    // file when anything changed.
    void processDueJobsLocked(double now);
    void saveLocked();
    void runTimer();

    const std::string clientName_;
    // Empty when the client name cannot name a file: jobs then live in memory only.
    std::string filePath_;
    SerialQueue& queue_;
    const Handler handler_;

    mutable std::mutex mutex_;
    std::condition_variable changed_;
    std::map<std::string, Job, std::less<>> jobs_;
    bool stopping_ = false;

    // Declared after what its callback touches, so it goes first.
    std::optional<Clock::ChangeSubscription> clockSubscription_;
    std::thread timer_;
};

}  // namespace tavrix::bus
