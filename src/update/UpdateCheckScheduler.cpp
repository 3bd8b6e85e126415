#include "update/UpdateCheckScheduler.h"

namespace tavrix {

UpdateCheckScheduler& UpdateCheckScheduler::sharedInstance() {
    static UpdateCheckScheduler* scheduler = new UpdateCheckScheduler();
    return *scheduler;
}

// Over-the-air checks are not part of the daemon yet: the scheduler has no timer to arm.
UpdateCheckScheduler::UpdateCheckScheduler() = default;

void UpdateCheckScheduler::startTimer() {}

}  // namespace tavrix
