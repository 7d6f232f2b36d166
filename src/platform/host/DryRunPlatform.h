// A platform context for running the agent's rules without effect: a copy of a real context
// whose preference store, follow-up service and agent factory keep every change in memory and
// record it, and which has no network, analytics, activity scheduler, attestation, sockets or
// store. Reads (devices, accounts, locale, clock, cache files, user-interface strings) go to
// the real services. Built once on one thread; the services are thread-safe.
#pragma once

#include <memory>

#include "platform/Platform.h"
#include "platform/host/DryRunAgentFactory.h"
#include "platform/host/DryRunFollowUpCenter.h"
#include "platform/host/DryRunPreferenceStore.h"

namespace qax {

class DryRunPlatform {
  public:
    // `preferences` is the store reads go through to (none: nothing stored); the real
    // follow-up service is `real.followUps`.
    DryRunPlatform(const Platform& real, std::shared_ptr<PreferenceStore> preferences);

    const std::shared_ptr<Platform>& platform() const { return platform_; }
    const DryRunPreferenceStore& preferences() const { return *preferences_; }
    const DryRunFollowUpCenter& followUps() const { return *followUps_; }
    const DryRunAgentFactory& agentFactory() const { return *agentFactory_; }

  private:
    std::shared_ptr<DryRunPreferenceStore> preferences_;
    std::shared_ptr<DryRunFollowUpCenter> followUps_;
    std::shared_ptr<DryRunAgentFactory> agentFactory_;
    std::shared_ptr<Platform> platform_;
};

}  // namespace qax
