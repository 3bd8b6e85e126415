#include "util/Clock.h"

#include <algorithm>
#include <atomic>
#include <mutex>
#include <vector>

#include "plist/Value.h"

namespace tavrix {
namespace {

// Ticks of the system clock's duration; trivially destructible, so threads still running while
// the process exits may read it.
std::atomic<Clock::Offset::rep> offsetTicks{0};

struct Subscribers {
    std::mutex mutex;
    std::vector<std::shared_ptr<std::function<void()>>> callbacks;
};

// Never destroyed, for the same reason.
Subscribers& subscribers() {
    static Subscribers* registry = new Subscribers();
    return *registry;
}

}  // namespace

Clock::TimePoint Clock::now() {
    return std::chrono::system_clock::now() + offset();
}

double Clock::absoluteTimeNow() {
    std::chrono::duration<double> sinceEpoch = now().time_since_epoch();
    return plist::Date::fromUnixTime(sinceEpoch.count()).secondsSinceReferenceDate;
}

void Clock::setOffset(Offset offset) {
    offsetTicks.store(offset.count());
    // Called under the lock, so that a subscription being destroyed waits for its callback.
    Subscribers& registry = subscribers();
    std::lock_guard lock(registry.mutex);
    for (const auto& callback : registry.callbacks) {
        (*callback)();
    }
}

Clock::Offset Clock::offset() {
    return Offset(offsetTicks.load());
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
