// What the tests put behind the platform's seams: a log sink that keeps every line and a wall
// clock shifted ahead, so that a schedule days away can be reached without waiting.
#pragma once

#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "util/Clock.h"
#include "util/SystemLog.h"

namespace tavrix {

class CapturingLogSink : public LogSink {
  public:
    void write(int priority, std::string_view message) override {
        std::lock_guard lock(mutex_);
        messages_.emplace_back(message);
        priorities_.push_back(priority);
    }
    std::vector<std::string> messages() const {
        std::lock_guard lock(mutex_);
        return messages_;
    }
    // The priority of each message, in the same order.
    std::vector<int> priorities() const {
        std::lock_guard lock(mutex_);
        return priorities_;
    }
    void clear() {
        std::lock_guard lock(mutex_);
        messages_.clear();
        priorities_.clear();
    }

  private:
    mutable std::mutex mutex_;
    std::vector<std::string> messages_;
    std::vector<int> priorities_;
};

// The system's wall clock plus offset, for every thread while the object lives.
class ScopedClockOffset : private ClockSource {
  public:
    explicit ScopedClockOffset(Clock::Duration offset) : offset_(offset), installed_(*this) {}

  private:
    Clock::TimePoint now() override { return std::chrono::system_clock::now() + offset_; }

    Clock::Duration offset_;
    Clock::ScopedSource installed_;
};

}  // namespace tavrix
