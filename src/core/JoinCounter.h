// Counts outstanding asynchronous results and runs completions once none is outstanding
// (a wait-for-all group). Thread-safe: enter/leave may come from any thread.
#pragma once

#include <memory>
#include <mutex>
#include <utility>
#include <vector>

#include "core/TaskRunner.h"

namespace qax {

class JoinCounter {
  public:
    void enter();
    // Leaving more often than entering is a programming error and is ignored.
    void leave();
    // Posts `task` on `runner` as soon as nothing is outstanding: at once when nothing is,
    // else when the count next falls to zero.
    void notify(std::shared_ptr<TaskRunner> runner, Task task);
    int outstanding() const;

  private:
    mutable std::mutex mutex_;
    int count_ = 0;
    std::vector<std::pair<std::shared_ptr<TaskRunner>, Task>> waiting_;
};

}  // namespace qax
