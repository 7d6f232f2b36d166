#include "core/RepeatingTimer.h"

#include <algorithm>
#include <utility>

namespace qax {
namespace {

// The longest single wait; a longer interval is waited out in such steps.
constexpr double kLongestWait = 3600;

}  // namespace

std::shared_ptr<RepeatingTimer> RepeatingTimer::scheduledTimer(std::shared_ptr<TaskRunner> runner,
                                                               double interval, Callback callback) {
    auto timer = std::make_shared<RepeatingTimer>(std::move(runner), interval, std::move(callback));
    timer->wait(timer->interval_);
    return timer;
}

RepeatingTimer::RepeatingTimer(std::shared_ptr<TaskRunner> runner, double interval,
                               Callback callback)
    : runner_(std::move(runner)),
      // A zero or negative interval would spin; such a timer fires at most once a second.
      interval_(interval > 0 ? interval : 1),
      callback_(std::move(callback)) {}

void RepeatingTimer::invalidate() {
    Callback dropped;
    {
        std::lock_guard lock(mutex_);
        valid_ = false;
        // Released outside the lock: the callback may own what owns this timer.
        dropped = std::move(callback_);
    }
}

bool RepeatingTimer::isValid() const {
    std::lock_guard lock(mutex_);
    return valid_;
}

void RepeatingTimer::wait(double remaining) {
    const double step = std::min(remaining, kLongestWait);
    std::weak_ptr<RepeatingTimer> weak = weak_from_this();
    runner_->postDelayed(
        [weak, left = remaining - step] {
            auto self = weak.lock();
            if (!self || !self->isValid()) {
                return;
            }
            if (left > 0) {
                self->wait(left);
            } else {
                self->fire();
            }
        },
        step);
}

void RepeatingTimer::fire() {
    Callback callback;
    {
        std::lock_guard lock(mutex_);
        if (!valid_) {
            return;
        }
        callback = callback_;
    }
    callback(*this);
    if (isValid()) {
        wait(interval_);
    }
}

}  // namespace qax
