// A test double of the agent factory: records every activity scheduling and every agent
// asked for, and hands out the agent the test sets. Thread-safe.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/AgentFactory.h"

namespace qax::test {

class FakeAgentFactory : public AgentFactory {
  public:
    struct Scheduling {
        std::string identifier;
        std::optional<Date> date;
    };

    std::shared_ptr<QAXAgentProtocol> makeAgent(const std::string& callingProcessBundleID) override;
    void scheduleActivityForDate(const std::string& identifier, std::optional<Date> date) override;

    void setAgent(std::shared_ptr<QAXAgentProtocol> agent);
    std::vector<Scheduling> schedulings();
    std::vector<std::string> agentsMadeFor();

  private:
    std::mutex mutex_;
    std::shared_ptr<QAXAgentProtocol> agent_;
    std::vector<Scheduling> schedulings_;
    std::vector<std::string> agentsMadeFor_;
};

}  // namespace qax::test
