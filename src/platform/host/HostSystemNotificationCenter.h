// System notifications on the host's notification socket: a registration is a subscription
// filtered by name whose handler is posted to the registration's queue. Thread-safe.
#pragma once

#include <map>
#include <memory>
#include <mutex>

#include "platform/SystemNotificationCenter.h"
#include "platform/host/HostNotificationSocket.h"

namespace qax {

class HostSystemNotificationCenter : public SystemNotificationCenter {
  public:
    explicit HostSystemNotificationCenter(std::shared_ptr<HostNotificationSocket> socket)
        : socket_(std::move(socket)) {}
    ~HostSystemNotificationCenter() override;

    std::int32_t registerForNotification(const std::string& name, std::shared_ptr<TaskRunner> queue,
                                         std::function<void()> handler) override;
    void cancelRegistration(std::int32_t token) override;
    bool postNotification(const std::string& name) override;

  private:
    std::shared_ptr<HostNotificationSocket> socket_;
    std::mutex mutex_;
    std::int32_t nextToken_ = 1;
    std::map<std::int32_t, std::uint64_t> subscriptions_;
};

}  // namespace qax
