// An in-process double of the system notification center: post() delivers to every live
// registration of the name on the queue it registered with. Thread-safe.
#pragma once

#include <map>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "platform/SystemNotificationCenter.h"

namespace qax::test {

class FakeNotificationCenter : public SystemNotificationCenter {
  public:
    std::int32_t registerForNotification(const std::string& name, std::shared_ptr<TaskRunner> queue,
                                         std::function<void()> handler) override {
        std::lock_guard lock(mutex_);
        const std::int32_t token = next_++;
        registrations_[token] = {name, std::move(queue), std::move(handler)};
        return token;
    }
    void cancelRegistration(std::int32_t token) override {
        std::lock_guard lock(mutex_);
        registrations_.erase(token);
    }
    bool postNotification(const std::string& name) override {
        std::vector<Registration> due;
        {
            std::lock_guard lock(mutex_);
            for (const auto& [token, registration] : registrations_) {
                if (registration.name == name) {
                    due.push_back(registration);
                }
            }
        }
        for (auto& registration : due) {
            registration.queue->post(registration.handler);
        }
        return true;
    }
    // Names with a live registration, one entry per registration.
    std::multiset<std::string> registeredNames() {
        std::lock_guard lock(mutex_);
        std::multiset<std::string> names;
        for (const auto& [token, registration] : registrations_) {
            names.insert(registration.name);
        }
        return names;
    }

  private:
    struct Registration {
        std::string name;
        std::shared_ptr<TaskRunner> queue;
        std::function<void()> handler;
    };
    std::mutex mutex_;
    std::int32_t next_ = 1;
    std::map<std::int32_t, Registration> registrations_;
};

}  // namespace qax::test
