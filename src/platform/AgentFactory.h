// The agent-level objects that lower layers create but may not name: a new agent working on
// behalf of a calling process (the follow-up activities make their own), and the scheduling of
// one of the agent's six activities through a new scheduler for a new activity object (the
// warranty download schedules the conversion outreach, the monitors the follow-up post). main
// installs the real factory; tests install their own. Implementations are thread-safe.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "core/Date.h"

namespace qax {

class QAXAgentProtocol;

class AgentFactory {
  public:
    virtual ~AgentFactory() = default;
    // A new agent whose requests are made on behalf of `callingProcessBundleID`.
    virtual std::shared_ptr<QAXAgentProtocol> makeAgent(
        const std::string& callingProcessBundleID) = 0;
    // Creates a scheduler for a new activity object of `identifier` and calls its
    // scheduleActivityForDate: with `date` (no date: run at the first opportunity). Unknown
    // identifiers are logged and ignored.
    virtual void scheduleActivityForDate(const std::string& identifier,
                                         std::optional<Date> date) = 0;
};

}  // namespace qax
