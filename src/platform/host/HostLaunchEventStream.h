// Launch events on the host: every stream installed here is fed by the host's notification
// socket, one event per notification, in the order received. A handler installed without a
// queue runs on a serial queue of its own (the stream's default queue), so it runs
// concurrently with the main thread but never with itself. Thread-safe.
#pragma once

#include <memory>
#include <mutex>
#include <vector>

#include "core/TaskRunner.h"
#include "platform/LaunchEventStream.h"
#include "platform/host/HostNotificationSocket.h"

namespace qax {

class HostLaunchEventStream : public LaunchEventStream {
  public:
    HostLaunchEventStream(std::shared_ptr<HostNotificationSocket> socket,
                          std::shared_ptr<Dispatcher> dispatcher)
        : socket_(std::move(socket)), dispatcher_(std::move(dispatcher)) {}
    ~HostLaunchEventStream() override;

    void installStreamHandler(const std::string& streamName, std::shared_ptr<TaskRunner> queue,
                              std::function<void(const LaunchEvent&)> handler) override;

  private:
    std::shared_ptr<HostNotificationSocket> socket_;
    std::shared_ptr<Dispatcher> dispatcher_;
    std::mutex mutex_;
    std::vector<std::uint64_t> subscriptions_;
};

}  // namespace qax
