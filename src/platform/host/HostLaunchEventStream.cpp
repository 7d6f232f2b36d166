#include "platform/host/HostLaunchEventStream.h"

#include "core/Log.h"

namespace qax {

HostLaunchEventStream::~HostLaunchEventStream() {
    std::lock_guard lock(mutex_);
    for (auto id : subscriptions_) {
        socket_->unsubscribe(id);
    }
}

void HostLaunchEventStream::installStreamHandler(const std::string& streamName,
                                                 std::shared_ptr<TaskRunner> queue,
                                                 std::function<void(const LaunchEvent&)> handler) {
    if (!handler) {
        return;
    }
    if (!queue) {
        queue = dispatcher_->makeSerialQueue(streamName);
    }
    auto shared = std::make_shared<std::function<void(const LaunchEvent&)>>(std::move(handler));
    const std::uint64_t id =
        socket_->subscribe([queue, shared](const std::optional<std::string>& name) {
            queue->post([shared, event = LaunchEvent(name)] { (*shared)(event); });
        });
    if (id == 0) {
        qaxLog().error("Launch events of %@ cannot be received", streamName);
        return;
    }
    std::lock_guard lock(mutex_);
    subscriptions_.push_back(id);
}

}  // namespace qax
