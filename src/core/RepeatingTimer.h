// A repeating timer on a task runner (the main queue for the agent's run-loop timers): the
// callback runs every `interval` seconds until the timer is invalidated. The pending wait holds
// the timer only weakly, so a timer nobody keeps stops by itself; long intervals are waited out
// in steps of at most an hour, so an invalidated timer leaves nothing queued for longer than
// that. The callback should hold its owner weakly. Thread-safe.
#pragma once

#include <functional>
#include <memory>
#include <mutex>

#include "core/TaskRunner.h"

namespace qax {

class RepeatingTimer : public std::enable_shared_from_this<RepeatingTimer> {
  public:
    using Callback = std::function<void(RepeatingTimer& timer)>;

    // A new timer, already armed: the first fire is `interval` seconds from now.
    static std::shared_ptr<RepeatingTimer> scheduledTimer(std::shared_ptr<TaskRunner> runner,
                                                          double interval, Callback callback);

    RepeatingTimer(std::shared_ptr<TaskRunner> runner, double interval, Callback callback);

    // No fire starts after this returns.
    void invalidate();
    bool isValid() const;
    double interval() const { return interval_; }

  private:
    void wait(double remaining);
    void fire();

    const std::shared_ptr<TaskRunner> runner_;
    const double interval_;
    mutable std::mutex mutex_;
    Callback callback_;
    bool valid_ = true;
};

}  // namespace qax
