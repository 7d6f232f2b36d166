// The agent factory of a dry run: it makes no agents (nothing may download or serve) and
// records the activities it is asked to schedule instead of scheduling them. Thread-safe.
#pragma once

#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/AgentFactory.h"

namespace qax {

class DryRunAgentFactory : public AgentFactory {
  public:
    struct Scheduled {
        std::string identifier;
        std::optional<Date> date;
    };

    std::shared_ptr<QAXAgentProtocol> makeAgent(const std::string& callingProcessBundleID) override;
    void scheduleActivityForDate(const std::string& identifier, std::optional<Date> date) override;

    std::vector<Scheduled> scheduled() const;

  private:
    mutable std::mutex mutex_;
    std::vector<Scheduled> scheduled_;
};

}  // namespace qax
