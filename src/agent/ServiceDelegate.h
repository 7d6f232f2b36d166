// Decides for each new client of the agent's IPC service whether it is served: only clients
// whose executable holds the agent's entitlement as a true boolean or non-zero number get in,
// each with a QAXAgent of its own. Keeps no state of its own, so the listener may call it on
// its queue without locks.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "platform/ServiceListener.h"

namespace qax {

struct Platform;

class ServiceDelegate : public ServiceListenerDelegate {
  public:
    explicit ServiceDelegate(std::shared_ptr<Platform> platform);

    bool shouldAcceptNewConnection(ServiceListener& listener,
                                   const std::shared_ptr<ClientConnection>& connection) override;

    // The bundle identifier of the application the process runs; none when its executable
    // cannot be found or is not inside a bundle.
    std::optional<std::string> _bundleForPID(pid_t pid);

    // Whether an entitlement value grants the entitlement: a true boolean or non-zero number.
    static bool entitlementGrants(const std::optional<Value>& value);

  private:
    const std::shared_ptr<Platform> platform_;
    // What every accepted connection exports; stateless, so one serves them all.
    const std::shared_ptr<const RemoteInterface> interface_;
};

}  // namespace qax
