// Where work runs. A TaskRunner accepts tasks and delayed tasks; a Dispatcher hands out the
// runners the agent uses (main queue, background queue, serial queues, threads for
// blocking work). Asio backs them in the daemon, virtual time backs them in tests.
// All operations are thread-safe.
#pragma once

#include <functional>
#include <memory>
#include <string>

namespace qax {

using Task = std::function<void()>;

class TaskRunner {
  public:
    virtual ~TaskRunner() = default;
    virtual void post(Task task) = 0;
    // Runs `task` no earlier than `seconds` from now (a negative delay runs it at once).
    virtual void postDelayed(Task task, double seconds) = 0;
};

class Dispatcher {
  public:
    virtual ~Dispatcher() = default;
    // The main queue: start-up, system notifications, timers, scheduler results.
    virtual std::shared_ptr<TaskRunner> mainQueue() = 0;
    // The concurrent queue of default priority (download completions).
    virtual std::shared_ptr<TaskRunner> backgroundQueue() = 0;
    // A new serial queue: tasks run one at a time, in post order.
    virtual std::shared_ptr<TaskRunner> makeSerialQueue(std::string name) = 0;
    // Threads for work that blocks (credential renewal, attestation waits), so that
    // waiting never starves the background queue.
    virtual std::shared_ptr<TaskRunner> blockingQueue() = 0;
};

}  // namespace qax
