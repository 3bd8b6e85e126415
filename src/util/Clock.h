// Wall-clock time for the daemon's schedules. Unit tests may shift it for the whole process, so
// that a schedule days ahead can be reached without waiting; the daemon itself never does.
#pragma once

#include <chrono>
#include <functional>
#include <memory>

namespace tavrix {

class Clock {
  public:
    using TimePoint = std::chrono::system_clock::time_point;
    using Offset = std::chrono::system_clock::duration;

    // The current time: the system's wall clock plus the test offset.
    static TimePoint now();

    // The current time as seconds since 2001-01-01 00:00:00 UTC, as property-list dates hold it.
    static double absoluteTimeNow();

    // Replaces the test offset and runs every change callback (unit tests only).
    static void setOffset(Offset offset);
    static Offset offset();

    // Keeps a callback that runs after each change of the offset, until the object goes.
    // Timers use it to recompute deadlines they are waiting for.
    class ChangeSubscription {
      public:
        explicit ChangeSubscription(std::function<void()> onChange);
        ~ChangeSubscription();
        ChangeSubscription(const ChangeSubscription&) = delete;
        ChangeSubscription& operator=(const ChangeSubscription&) = delete;

      private:
        std::shared_ptr<std::function<void()>> callback_;
    };
};

// Shifts the clock by offset while the object lives (unit tests).
class ScopedClockOffset {
  public:
    explicit ScopedClockOffset(Clock::Offset offset) : previous_(Clock::offset()) {
        Clock::setOffset(offset);
    }
    ~ScopedClockOffset() { Clock::setOffset(previous_); }
    ScopedClockOffset(const ScopedClockOffset&) = delete;
    ScopedClockOffset& operator=(const ScopedClockOffset&) = delete;

  private:
    Clock::Offset previous_;
};

}  // namespace tavrix
