// The real agent factory: new agents for a calling process, and the scheduling of one of the
// six activities through a new scheduler for a new activity object. main installs it in the
// platform before anything runs; it holds the platform weakly, since the platform holds it.
// Thread-safe (it keeps nothing but that reference).
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/AgentFactory.h"

namespace qax {

struct Platform;
class QAXSchedulerActivityDelegate;

class QAXAgentFactory : public AgentFactory {
  public:
    explicit QAXAgentFactory(std::weak_ptr<Platform> platform);

    std::shared_ptr<QAXAgentProtocol> makeAgent(const std::string& callingProcessBundleID) override;
    void scheduleActivityForDate(const std::string& identifier, std::optional<Date> date) override;

    // A new activity object of `identifier`; none for an identifier that is not one of the six.
    static std::shared_ptr<QAXSchedulerActivityDelegate> newActivityDelegate(
        const std::shared_ptr<Platform>& platform, const std::string& identifier);

  private:
    const std::weak_ptr<Platform> platform_;
};

}  // namespace qax
