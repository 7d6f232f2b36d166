#include "platform/host/DryRunAgentFactory.h"

namespace qax {

std::shared_ptr<QAXAgentProtocol> DryRunAgentFactory::makeAgent(const std::string&) {
    return nullptr;
}

void DryRunAgentFactory::scheduleActivityForDate(const std::string& identifier,
                                                 std::optional<Date> date) {
    std::lock_guard lock(mutex_);
    scheduled_.push_back(Scheduled{identifier, date});
}

std::vector<DryRunAgentFactory::Scheduled> DryRunAgentFactory::scheduled() const {
    std::lock_guard lock(mutex_);
    return scheduled_;
}

}  // namespace qax
