#include "util/Clock.h"

#include <algorithm>
#include <atomic>
#include <mutex>
#include <vector>

#include "plist/Value.h"

namespace tavrix {
namespace {

// Null for the system clock; trivially destructible, so threads still running while the process
// exits may read it.
std::atomic<ClockSource*> installedSource{nullptr};

struct Subscribers {
    std::mutex mutex;
    std::vector<std::shared_ptr<std::function<void()>>> callbacks;
};

// Never destroyed, for the same reason.
Subscribers& subscribers() {
    static Subscribers* registry = new Subscribers();
    return *registry;
}

void notifySubscribers() {
    // Called under the lock, so that a subscription being destroyed waits for its callback.
    Subscribers& registry = subscribers();
    std::lock_guard lock(registry.mutex);
    for (const auto& callback : registry.callbacks) {
        (*callback)();
    }
}

}  // namespace

Clock::TimePoint Clock::now() {
    ClockSource* source = installedSource.load(std::memory_order_acquire);
    return source != nullptr ? source->now() : std::chrono::system_clock::now();
}

double Clock::absoluteTimeNow() {
    std::chrono::duration<double> sinceEpoch = now().time_since_epoch();
    return plist::Date::fromUnixTime(sinceEpoch.count()).secondsSinceReferenceDate;
}

Clock::ScopedSource::ScopedSource(ClockSource& source)
    : previous_(installedSource.exchange(&source, std::memory_order_acq_rel)) {
    notifySubscribers();
}

Clock::ScopedSource::~ScopedSource() {
    installedSource.store(previous_, std::memory_order_release);
    notifySubscribers();
}

Clock::ChangeSubscription::ChangeSubscription(std::function<void()> onChange)
    : callback_(std::make_shared<std::function<void()>>(std::move(onChange))) {
    Subscribers& registry = subscribers();
    std::lock_guard lock(registry.mutex);
    registry.callbacks.push_back(callback_);
}

Clock::ChangeSubscription::~ChangeSubscription() {
    Subscribers& registry = subscribers();
    std::lock_guard lock(registry.mutex);
    auto& callbacks = registry.callbacks;
    callbacks.erase(std::remove(callbacks.begin(), callbacks.end(), callback_), callbacks.end());
}

}  // namespace tavrix
