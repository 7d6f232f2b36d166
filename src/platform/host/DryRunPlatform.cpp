#include "platform/host/DryRunPlatform.h"

#include <utility>

namespace qax {

DryRunPlatform::DryRunPlatform(const Platform& real, std::shared_ptr<PreferenceStore> preferences)
    : preferences_(std::make_shared<DryRunPreferenceStore>(std::move(preferences))),
      followUps_(std::make_shared<DryRunFollowUpCenter>(real.followUps)),
      agentFactory_(std::make_shared<DryRunAgentFactory>()),
      platform_(std::make_shared<Platform>(real)) {
    Platform& p = *platform_;
    p.preferences = preferences_;
    p.followUps = followUps_;
    p.agentFactory = agentFactory_;
    // Everything that could reach the network, write platform state or talk to other
    // processes is left out.
    p.http = nullptr;
    p.identity = nullptr;
    p.attestation = nullptr;
    p.activities = nullptr;
    p.ipc = nullptr;
    p.launchEvents = nullptr;
    p.notifications = nullptr;
    p.store = nullptr;
    p.purchases = nullptr;
    p.analytics = nullptr;
    p.lifecycle = nullptr;
}

}  // namespace qax
