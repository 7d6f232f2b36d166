// Records the analytics events it is sent. While turned off it records nothing and never
// builds a payload, like a sink that does not want the event. Thread-safe.
#pragma once

#include <atomic>
#include <mutex>
#include <string>
#include <vector>

#include "platform/AnalyticsSink.h"

namespace qax::test {

class RecordingAnalyticsSink : public AnalyticsSink {
  public:
    struct Event {
        std::string name;
        Value payload;
    };

    void sendEventLazily(const std::string& name, std::function<Value()> payload) override {
        if (!enabled) {
            return;
        }
        // Built outside the lock: the payload callback logs.
        Value built = payload();
        std::lock_guard lock(mutex_);
        events_.push_back({name, std::move(built)});
    }

    std::vector<Event> events() const {
        std::lock_guard lock(mutex_);
        return events_;
    }
    std::atomic<bool> enabled{true};

  private:
    mutable std::mutex mutex_;
    std::vector<Event> events_;
};

}  // namespace qax::test
