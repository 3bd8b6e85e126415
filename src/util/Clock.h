// Wall-clock time for the daemon's schedules. It reads the system clock unless another source
// is installed (tests put a clock days ahead here); timers that wait for a moment subscribe to
// hear when the source changes, and recompute their deadlines.
#pragma once

#include <chrono>
#include <functional>
#include <memory>

namespace tavrix {

class ClockSource;

class Clock {
  public:
    using TimePoint = std::chrono::system_clock::time_point;
    using Duration = std::chrono::system_clock::duration;

    // The current time from the installed source.
    static TimePoint now();

    // The current time as seconds since 2001-01-01 00:00:00 UTC, as property-list dates hold it.
    static double absoluteTimeNow();

    // Installs a source for every thread while the guard lives, and runs every change callback
    // when it comes and when it goes. Guards nest.
    class ScopedSource {
      public:
        explicit ScopedSource(ClockSource& source);
        ~ScopedSource();
        ScopedSource(const ScopedSource&) = delete;
        ScopedSource& operator=(const ScopedSource&) = delete;

      private:
        ClockSource* previous_;
    };

    // Keeps a callback that runs after each change of the source, until the object goes.
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

class ClockSource {
  public:
    virtual ~ClockSource() = default;
    virtual Clock::TimePoint now() = 0;
};

}  // namespace tavrix
