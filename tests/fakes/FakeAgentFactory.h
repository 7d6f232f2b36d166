// A test double of the agent factory: records every activity scheduling and every agent asked
// for (by calling process), and hands out the agent the test sets. Thread-safe.
#pragma once

#include <mutex>
#include <vector>

#include "platform/AgentFactory.h"

namespace qax::test {

class FakeAgentFactory : public AgentFactory {
  public:
    struct Scheduling {
        std::string identifier;
        std::optional<Date> date;
    };

    std::shared_ptr<QAXAgentProtocol> makeAgent(const std::string& callingProcess) override {
        std::lock_guard lock(mutex_);
        agentCallers_.push_back(callingProcess);
        return agent_;
    }
    void scheduleActivityForDate(const std::string& identifier, std::optional<Date> date) override {
        std::lock_guard lock(mutex_);
        schedulings_.push_back({identifier, date});
    }
    void setAgent(std::shared_ptr<QAXAgentProtocol> agent) {
        std::lock_guard lock(mutex_);
        agent_ = std::move(agent);
    }
    std::vector<Scheduling> schedulings() {
        std::lock_guard lock(mutex_);
        return schedulings_;
    }
    std::vector<std::string> agentCallers() {
        std::lock_guard lock(mutex_);
        return agentCallers_;
    }

  private:
    std::mutex mutex_;
    std::shared_ptr<QAXAgentProtocol> agent_;
    std::vector<Scheduling> schedulings_;
    std::vector<std::string> agentCallers_;
};

}  // namespace qax::test
