// The daemon's queues on Asio: the main queue is an io_context run by the main thread, the
// background queue is a thread pool, serial queues run their tasks one at a time on the I/O
// thread that queued them or else on that pool (never blocking there), blocking work
// gets a pool of its own (threads start on demand and end when idle), and client sockets live
// on I/O threads, each running its own io_context. Thread-safe.
#pragma once

#include <asio/any_io_executor.hpp>
#include <memory>
#include <string>

#include "core/TaskRunner.h"

namespace asio {
class io_context;
}  // namespace asio

namespace qax {

class AsioDispatcher : public Dispatcher, public std::enable_shared_from_this<AsioDispatcher> {
  public:
    // A count of 0 sizes the pool (and the I/O threads) to the machine's cores.
    explicit AsioDispatcher(unsigned backgroundThreads = 0, unsigned blockingThreads = 16);
    ~AsioDispatcher() override;

    std::shared_ptr<TaskRunner> mainQueue() override { return main_; }
    std::shared_ptr<TaskRunner> backgroundQueue() override { return background_; }
    std::shared_ptr<TaskRunner> makeSerialQueue(std::string name) override;
    std::shared_ptr<TaskRunner> blockingQueue() override { return blocking_; }

    // A serial queue that I/O objects can also be bound to: socket completions and queued
    // tasks then run one at a time on the same strand. Each strand lives on one I/O thread
    // (handed out in turn), whose single-threaded loop waits for the socket and runs its
    // handlers itself, so a request is read, served and answered without waking any other
    // thread. Work queued there must not block. The I/O threads start with the first strand.
    struct IoStrand {
        asio::any_io_executor executor;
        std::shared_ptr<TaskRunner> queue;
    };
    IoStrand makeIoStrand();

    asio::io_context& mainContext();
    // Runs the main queue on the calling thread until stopMainLoop().
    void runMainLoop();
    void stopMainLoop();
    // Stops accepting work and joins the pools and I/O threads.
    void shutdown();

    // The machine's cores (at least 1).
    static unsigned hardwareThreads();

  private:
    struct State;
    std::unique_ptr<State> state_;
    std::shared_ptr<TaskRunner> main_;
    std::shared_ptr<TaskRunner> background_;
    std::shared_ptr<TaskRunner> blocking_;
};

}  // namespace qax
