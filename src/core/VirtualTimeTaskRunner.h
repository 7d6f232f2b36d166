// A task runner on virtual time for tests: tasks wait in a queue ordered by (due time, post
// order) and run only when the test says so, on the test's thread, moving a ManualClock to
// each task's due time. A 3600-second delay costs nothing. post() may be called from any
// thread; running is done by one thread at a time.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <utility>

#include "core/Clock.h"
#include "core/TaskRunner.h"

namespace qax {

class VirtualTimeTaskRunner : public TaskRunner,
                              public std::enable_shared_from_this<VirtualTimeTaskRunner> {
  public:
    explicit VirtualTimeTaskRunner(std::shared_ptr<ManualClock> clock);

    void post(Task task) override;
    void postDelayed(Task task, double seconds) override;

    // Runs every task that is due now, including tasks those tasks post for now.
    void runUntilIdle();
    // Moves time forward by `seconds`, running each task that comes due, in order, with
    // the clock set to its due time; the clock ends at the target.
    void advanceBy(double seconds);
    // Runs everything, jumping the clock to each delayed task (up to `maxTasks` tasks).
    void runAll(std::size_t maxTasks = 100000);

    std::size_t pendingCount() const;
    // Due time of the next task, or no value when the queue is empty.
    std::optional<Date> nextDueTime() const;
    const std::shared_ptr<ManualClock>& clock() const { return clock_; }

  private:
    bool runNextDueBy(double limit);

    std::shared_ptr<ManualClock> clock_;
    mutable std::mutex mutex_;
    std::uint64_t sequence_ = 0;
    std::map<std::pair<double, std::uint64_t>, Task> queue_;
};

// Every queue of this dispatcher is the one virtual-time runner.
class VirtualTimeDispatcher : public Dispatcher {
  public:
    explicit VirtualTimeDispatcher(std::shared_ptr<VirtualTimeTaskRunner> runner)
        : runner_(std::move(runner)) {}
    std::shared_ptr<TaskRunner> mainQueue() override { return runner_; }
    std::shared_ptr<TaskRunner> backgroundQueue() override { return runner_; }
    std::shared_ptr<TaskRunner> makeSerialQueue(std::string) override { return runner_; }
    std::shared_ptr<TaskRunner> blockingQueue() override { return runner_; }
    const std::shared_ptr<VirtualTimeTaskRunner>& runner() const { return runner_; }

  private:
    std::shared_ptr<VirtualTimeTaskRunner> runner_;
};

}  // namespace qax
