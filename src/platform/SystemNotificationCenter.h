// System-wide named notifications (no payload). Handlers run on the queue given at
// registration. Thread-safe.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "core/TaskRunner.h"

namespace qax {

class SystemNotificationCenter {
  public:
    virtual ~SystemNotificationCenter() = default;
    // Calls `handler` on `queue` for every notification of that name; returns a token that is
    // never 0, or 0 when the registration failed.
    virtual std::int32_t registerForNotification(const std::string& name,
                                                 std::shared_ptr<TaskRunner> queue,
                                                 std::function<void()> handler) = 0;
    virtual void cancelRegistration(std::int32_t token) = 0;
    // Posts a notification to every process that listens for it; false when it could not be
    // sent.
    virtual bool postNotification(const std::string& name) = 0;
};

}  // namespace qax
