#include "platform/host/HostSystemNotificationCenter.h"

namespace qax {

HostSystemNotificationCenter::~HostSystemNotificationCenter() {
    std::lock_guard lock(mutex_);
    for (const auto& [token, id] : subscriptions_) {
        socket_->unsubscribe(id);
    }
}

std::int32_t HostSystemNotificationCenter::registerForNotification(
    const std::string& name, std::shared_ptr<TaskRunner> queue, std::function<void()> handler) {
    if (!queue || !handler) {
        return 0;
    }
    auto shared = std::make_shared<std::function<void()>>(std::move(handler));
    const std::uint64_t id =
        socket_->subscribe([name, queue, shared](const std::optional<std::string>& received) {
            if (received == name) {
                queue->post([shared] { (*shared)(); });
            }
        });
    if (id == 0) {
        return 0;
    }
    std::lock_guard lock(mutex_);
    const std::int32_t token = nextToken_++;
    subscriptions_[token] = id;
    return token;
}

void HostSystemNotificationCenter::cancelRegistration(std::int32_t token) {
    std::lock_guard lock(mutex_);
    auto it = subscriptions_.find(token);
    if (it != subscriptions_.end()) {
        socket_->unsubscribe(it->second);
        subscriptions_.erase(it);
    }
}

bool HostSystemNotificationCenter::postNotification(const std::string& name) {
    return HostNotificationSocket::post(socket_->runtimeDirectory(), name);
}

}  // namespace qax
