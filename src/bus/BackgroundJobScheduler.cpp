#include "bus/BackgroundJobScheduler.h"

#include <pthread.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <climits>
#include <cmath>
#include <filesystem>
#include <system_error>
#include <vector>

#include "device/PlatformRoot.h"
#include "io/AtomicFile.h"
#include "io/Directory.h"
#include "plist/PropertyListFormat.h"
#include "util/ContainExceptions.h"
#include "util/Log.h"
#include "util/PropertyListFile.h"

namespace tavrix::bus {
namespace {

constexpr std::string_view kJobsFileSuffix = ".jobs.plist";
constexpr mode_t kJobsFileMode = 0600;
// The timer looks again at least this often, so that a far deadline never overflows a wait and
// a wall clock that was set while the timer slept is noticed.
constexpr double kLongestWaitSeconds = 3600.0;

std::string errorText(int error) {
    return std::generic_category().message(error);
}

bool isValidClientName(std::string_view name) {
    return !name.empty() && name != "." && name != ".." &&
           name.size() + kJobsFileSuffix.size() <= NAME_MAX &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

// A window bound: a finite number of seconds, real or integer.
std::optional<double> timeValue(const plist::Dictionary& criteria, std::string_view key) {
    auto entry = criteria.find(key);
    if (entry == criteria.end()) {
        return std::nullopt;
    }
    if (const double* real = entry->second.asReal(); real != nullptr && std::isfinite(*real)) {
        return *real;
    }
    if (const plist::Integer* integer = entry->second.asInteger();
        integer != nullptr && !integer->isLargeUnsigned()) {
        return static_cast<double>(integer->signedValue());
    }
    return std::nullopt;
}

struct Window {
    double start;
    double end;
};

std::optional<Window> windowOf(const plist::Dictionary& criteria) {
    auto start = timeValue(criteria, kJobWindowStartDate);
    auto end = timeValue(criteria, kJobWindowEndDate);
    if (!start || !end || *end < *start) {
        return std::nullopt;
    }
    return Window{*start, *end};
}

}  // namespace

std::string BackgroundJobScheduler::jobsFilePath(std::string_view clientName) {
    return jobsFilePathUnder(device::platformRoot(), clientName);
}

std::string BackgroundJobScheduler::jobsFilePathUnder(std::string_view root,
                                                      std::string_view clientName) {
    return device::resolvePathUnder(root, device::kDaemonStateDirectory) + "/" +
           std::string(clientName) + std::string(kJobsFileSuffix);
}

BackgroundJobScheduler::BackgroundJobScheduler(std::string clientName, SerialQueue& queue,
                                               Handler handler)
    : clientName_(std::move(clientName)), queue_(queue), handler_(std::move(handler)) {
    if (isValidClientName(clientName_)) {
        filePath_ = jobsFilePath(clientName_);
    } else {
        logCFormat(LogPriority::Warning,
                   "Background jobs: the client name \"%s\" cannot name a file; its jobs are not "
                   "kept across launches",
                   clientName_.c_str());
    }
    {
        std::lock_guard lock(mutex_);
        load();
        // The launch may be what the job was waiting for: deliver it before the client can
        // change its jobs.
        processDueJobsLocked(Clock::absoluteTimeNow());
    }
    clockSubscription_.emplace([this] {
        std::lock_guard lock(mutex_);
        changed_.notify_all();
    });
    timer_ = std::thread([this] { runTimer(); });
}

BackgroundJobScheduler::~BackgroundJobScheduler() {
    stopTimer();
}

void BackgroundJobScheduler::stopTimer() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    changed_.notify_all();
    if (timer_.joinable()) {
        timer_.join();
    }
}

bool BackgroundJobScheduler::addJob(const std::string& name, const plist::Dictionary& criteria) {
    auto window = windowOf(criteria);
    if (!window) {
        logCFormat(LogPriority::Warning,
                   "Background jobs: refusing job \"%s\" of %s: its window is missing or invalid",
                   name.c_str(), clientName_.c_str());
        return false;
    }
    std::lock_guard lock(mutex_);
    jobs_.erase(name);
    if (window->end < Clock::absoluteTimeNow()) {
        logCFormat("Background jobs: dropping job \"%s\" of %s: its window has passed",
                   name.c_str(), clientName_.c_str());
        saveLocked();
        return false;
    }
    jobs_.insert_or_assign(name, Job{criteria, window->start, window->end});
    saveLocked();
    changed_.notify_all();
    return true;
}

void BackgroundJobScheduler::removeJob(const std::string& name) {
    std::lock_guard lock(mutex_);
    if (jobs_.erase(name) != 0) {
        saveLocked();
        changed_.notify_all();
    }
}

plist::Dictionary BackgroundJobScheduler::copyJobs() const {
    std::lock_guard lock(mutex_);
    plist::Dictionary jobs;
    for (const auto& [name, job] : jobs_) {
        jobs.emplace(name, job.criteria);
    }
    return jobs;
}

std::optional<double> BackgroundJobScheduler::windowStart(const std::string& name) const {
    std::lock_guard lock(mutex_);
    auto job = jobs_.find(name);
    return job != jobs_.end() ? std::optional(job->second.windowStart) : std::nullopt;
}

void BackgroundJobScheduler::load() {
    if (filePath_.empty()) {
        return;
    }
    // The daemon's own store only: nothing another user made or linked there is a job.
    int error = 0;
    io::UniqueFd file = io::openOwnFile(filePath_, &error);
    if (!file) {
        if (error != ENOENT) {
            logCFormat(LogPriority::Warning,
                       "Background jobs: cannot use %s: %s; starting with no jobs",
                       filePath_.c_str(), errorText(error).c_str());
        }
        return;
    }
    Result<plist::Value> contents = plist::readOpenFile(file.get());
    if (!contents) {
        logPropertyListRefusal(filePath_, contents.failure(), "starting with no jobs");
        return;
    }
    if (!contents->isDictionary()) {
        logCFormat(LogPriority::Warning,
                   "Background jobs: %s is damaged or not a list of jobs; starting with no jobs",
                   filePath_.c_str());
        return;
    }
    for (auto& [name, value] : *contents->asDictionary()) {
        const plist::Dictionary* criteria = value.asDictionary();
        auto window = criteria != nullptr ? windowOf(*criteria) : std::nullopt;
        if (!window) {
            logCFormat(LogPriority::Warning,
                       "Background jobs: ignoring job \"%s\" in %s: its window is missing or "
                       "invalid",
                       name.c_str(), filePath_.c_str());
            continue;
        }
        jobs_.insert_or_assign(name, Job{*criteria, window->start, window->end});
    }
}

void BackgroundJobScheduler::processDueJobsLocked(double now) {
    // In order of window start, so that jobs reach the queue in the order they became due.
    std::vector<decltype(jobs_)::node_type> due;
    for (auto it = jobs_.begin(); it != jobs_.end();) {
        auto current = it++;
        if (current->second.windowStart <= now) {
            due.push_back(jobs_.extract(current));
        }
    }
    if (due.empty()) {
        return;
    }
    std::stable_sort(due.begin(), due.end(), [](const auto& left, const auto& right) {
        return left.mapped().windowStart < right.mapped().windowStart;
    });
    // Saved before the handler can run: a job fires at most once, even if the process ends
    // in between.
    saveLocked();
    for (auto& node : due) {
        const std::string& name = node.key();
        if (node.mapped().windowEnd < now) {
            logCFormat("Background jobs: dropping job \"%s\" of %s: its window has passed",
                       name.c_str(), clientName_.c_str());
            continue;
        }
        logCFormat("Background jobs: running job \"%s\" of %s", name.c_str(), clientName_.c_str());
        if (handler_) {
            queue_.dispatchAsync(
                [handler = handler_, name, criteria = std::move(node.mapped().criteria)] {
                    handler(name, &criteria);
                });
        }
    }
}

void BackgroundJobScheduler::saveLocked() {
    if (filePath_.empty()) {
        return;
    }
    std::error_code error;
    std::filesystem::create_directories(std::filesystem::path(filePath_).parent_path(), error);
    if (error) {
        logCFormat(LogPriority::Warning, "Background jobs: cannot create the directory of %s: %s",
                   filePath_.c_str(), error.message().c_str());
        return;
    }
    plist::Dictionary contents;
    for (const auto& [name, job] : jobs_) {
        contents.emplace(name, job.criteria);
    }
    Result<std::string> bytes = plist::serialize(plist::Value(std::move(contents)));
    if (!bytes) {
        logCFormat("Background jobs: not saving the jobs of %s: %s", clientName_.c_str(),
                   bytes.reason().c_str());
        return;
    }
    if (int failure = io::replaceFileAtomically(filePath_, *bytes, kJobsFileMode); failure != 0) {
        logCFormat(LogPriority::Warning, "Background jobs: cannot save %s: %s", filePath_.c_str(),
                   errorText(failure).c_str());
    }
}

void BackgroundJobScheduler::runTimer() {
    ::pthread_setname_np(::pthread_self(), "tavrix-jobs");
    std::unique_lock lock(mutex_);
    while (!stopping_) {
        std::optional<double> wait;
        bool processed = containExceptions("The background job timer", [&] {
            const double now = Clock::absoluteTimeNow();
            processDueJobsLocked(now);
            if (jobs_.empty()) {
                return;
            }
            double nextStart = jobs_.begin()->second.windowStart;
            for (const auto& entry : jobs_) {
                nextStart = std::min(nextStart, entry.second.windowStart);
            }
            wait = std::min(nextStart - now, kLongestWaitSeconds);
        });
        if (stopping_) {
            break;
        }
        if (!processed) {
            // Whatever failed would fail again at once: look again after the longest wait.
            wait = kLongestWaitSeconds;
        }
        if (!wait) {
            changed_.wait(lock);
            continue;
        }
        // Waits on the system clock, so that a change of the wall clock or a suspended machine
        // ends the wait at the right moment; the test offset wakes it through the subscription.
        const std::chrono::duration<double> seconds(*wait);
        changed_.wait_until(lock,
                            std::chrono::system_clock::now() +
                                std::chrono::duration_cast<std::chrono::nanoseconds>(seconds));
    }
}

}  // namespace tavrix::bus
