#include "core/JoinCounter.h"

namespace qax {

void JoinCounter::enter() {
    std::lock_guard lock(mutex_);
    ++count_;
}

void JoinCounter::leave() {
    std::vector<std::pair<std::shared_ptr<TaskRunner>, Task>> ready;
    {
        std::lock_guard lock(mutex_);
        if (count_ == 0) {
            return;
        }
        if (--count_ == 0) {
            ready.swap(waiting_);
        }
    }
    for (auto& [runner, task] : ready) {
        runner->post(std::move(task));
    }
}

void JoinCounter::notify(std::shared_ptr<TaskRunner> runner, Task task) {
    {
        std::lock_guard lock(mutex_);
        if (count_ > 0) {
            waiting_.emplace_back(std::move(runner), std::move(task));
            return;
        }
    }
    runner->post(std::move(task));
}

int JoinCounter::outstanding() const {
    std::lock_guard lock(mutex_);
    return count_;
}

}  // namespace qax
