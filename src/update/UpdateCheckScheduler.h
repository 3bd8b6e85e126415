// Schedules the periodic over-the-air update check.
#pragma once

namespace tavrix {

class UpdateCheckScheduler {
  public:
    // The process's scheduler, created once from any thread; creating it starts its timer.
    static UpdateCheckScheduler& sharedInstance();

    // Makes sure the update-check timer is armed.
    void startTimer();

  private:
    UpdateCheckScheduler();
};

}  // namespace tavrix
