#include "core/VirtualTimeTaskRunner.h"

#include <algorithm>
#include <limits>

namespace qax {

VirtualTimeTaskRunner::VirtualTimeTaskRunner(std::shared_ptr<ManualClock> clock)
    : clock_(std::move(clock)) {}

void VirtualTimeTaskRunner::post(Task task) {
    postDelayed(std::move(task), 0);
}

void VirtualTimeTaskRunner::postDelayed(Task task, double seconds) {
    const double due = clock_->now().secondsSince1970() + std::max(0.0, seconds);
    std::lock_guard lock(mutex_);
    queue_.emplace(std::make_pair(due, sequence_++), std::move(task));
}

bool VirtualTimeTaskRunner::runNextDueBy(double limit) {
    Task task;
    double due = 0;
    {
        std::lock_guard lock(mutex_);
        if (queue_.empty() || queue_.begin()->first.first > limit) {
            return false;
        }
        auto it = queue_.begin();
        due = it->first.first;
        task = std::move(it->second);
        queue_.erase(it);
    }
    if (due > clock_->now().secondsSince1970()) {
        clock_->set(Date(due));
    }
    task();
    return true;
}

void VirtualTimeTaskRunner::runUntilIdle() {
    while (runNextDueBy(clock_->now().secondsSince1970())) {
    }
}

void VirtualTimeTaskRunner::advanceBy(double seconds) {
    const double target = clock_->now().secondsSince1970() + std::max(0.0, seconds);
    while (runNextDueBy(target)) {
    }
    if (clock_->now().secondsSince1970() < target) {
        clock_->set(Date(target));
    }
}

void VirtualTimeTaskRunner::runAll(std::size_t maxTasks) {
    for (std::size_t n = 0; n < maxTasks; ++n) {
        if (!runNextDueBy(std::numeric_limits<double>::infinity())) {
            return;
        }
    }
}

std::size_t VirtualTimeTaskRunner::pendingCount() const {
    std::lock_guard lock(mutex_);
    return queue_.size();
}

std::optional<Date> VirtualTimeTaskRunner::nextDueTime() const {
    std::lock_guard lock(mutex_);
    if (queue_.empty()) {
        return std::nullopt;
    }
    return Date(queue_.begin()->first.first);
}

}  // namespace qax
