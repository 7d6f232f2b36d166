#include "fakes/FakeAgentFactory.h"

namespace qax::test {

std::shared_ptr<QAXAgentProtocol> FakeAgentFactory::makeAgent(
    const std::string& callingProcessBundleID) {
    std::lock_guard lock(mutex_);
    agentsMadeFor_.push_back(callingProcessBundleID);
    return agent_;
}

void FakeAgentFactory::scheduleActivityForDate(const std::string& identifier,
                                               std::optional<Date> date) {
    std::lock_guard lock(mutex_);
    schedulings_.push_back({identifier, date});
}

void FakeAgentFactory::setAgent(std::shared_ptr<QAXAgentProtocol> agent) {
    std::lock_guard lock(mutex_);
    agent_ = std::move(agent);
}

std::vector<FakeAgentFactory::Scheduling> FakeAgentFactory::schedulings() {
    std::lock_guard lock(mutex_);
    return schedulings_;
}

std::vector<std::string> FakeAgentFactory::agentsMadeFor() {
    std::lock_guard lock(mutex_);
    return agentsMadeFor_;
}

}  // namespace qax::test
