// When the agent's process may end on the host. Started on demand (the service manager passed
// the listening socket), the agent ends its main loop once nothing has held a transaction for
// the idle time, or at once after a clean-exit request when nothing holds one; started by hand
// it runs until stopped. Transactions begin and end on any thread (a mutex guards the count);
// the decision to exit is taken on the main queue.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string_view>

#include "core/TaskRunner.h"
#include "platform/ProcessLifecycle.h"

namespace qax {

class HostProcessLifecycle : public ProcessLifecycle,
                             public std::enable_shared_from_this<HostProcessLifecycle> {
  public:
    static constexpr double kDefaultIdleExitSeconds = 60;

    // `exitMainLoop` runs on the main queue, at most once.
    HostProcessLifecycle(bool startedOnDemand, double idleExitSeconds,
                         std::shared_ptr<TaskRunner> mainQueue, std::function<void()> exitMainLoop);

    // The idle time from QAX_IDLE_EXIT_SECONDS (a positive number), else the default.
    static double idleExitSecondsFromEnvironment();

    // Starts counting idle time from now. Called once the context is built.
    void start();
    // Stops (false) and resumes (true) accepting new clients; main queue only. Before the
    // process exits it stops accepting and looks again, so that a client accepted in the
    // meantime is served here and one still waiting on the listening socket is served by the
    // next instance.
    void setAcceptGate(std::function<void(bool accepting)> gate);

    bool startedOnDemand() const { return startedOnDemand_; }
    int openTransactions() const;

    void requestCleanExit() override;
    std::shared_ptr<void> beginTransaction(std::string_view reason) override;

  private:
    void endTransaction();
    // Main queue: exits if nothing has begun or ended since `generation` and nothing is open.
    void tryExit(std::uint64_t generation);
    void finishExit(std::uint64_t generation);

    const bool startedOnDemand_;
    const double idleExitSeconds_;
    const std::shared_ptr<TaskRunner> mainQueue_;
    const std::function<void()> exitMainLoop_;

    mutable std::mutex mutex_;
    int open_ = 0;
    // Moves on every begin and end, so an idle check armed earlier knows it is stale.
    std::uint64_t generation_ = 0;
    bool cleanExitRequested_ = false;
    bool exited_ = false;
    std::function<void(bool)> acceptGate_;
};

}  // namespace qax
