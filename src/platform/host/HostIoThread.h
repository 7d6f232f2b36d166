// A thread of its own running an Asio io_context, for the host's socket bindings: all socket
// state of a binding lives on this one thread, so it needs no locks, and socket I/O never
// waits behind work on the main queue. The thread starts on the first start() and is joined
// by stop() or the destructor. start() and stop() may be called from any thread except the
// I/O thread itself.
#pragma once

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <atomic>
#include <mutex>
#include <optional>
#include <thread>

namespace qax {

class HostIoThread {
  public:
    HostIoThread() = default;
    ~HostIoThread();
    HostIoThread(const HostIoThread&) = delete;
    HostIoThread& operator=(const HostIoThread&) = delete;

    asio::io_context& context() { return io_; }
    void start();
    // Stops the loop (pending handlers are dropped) and joins the thread.
    void stop();
    bool runningInThisThread() const { return std::this_thread::get_id() == threadId_; }

  private:
    asio::io_context io_;
    std::mutex mutex_;
    std::optional<asio::executor_work_guard<asio::io_context::executor_type>> work_;
    std::thread thread_;
    std::atomic<std::thread::id> threadId_{};
};

}  // namespace qax
