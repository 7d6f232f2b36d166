// How the agent's process may end: the platform starts the agent on demand and may let it go
// once it is idle. Thread-safe.
#pragma once

namespace qax {

class ProcessLifecycle {
  public:
    virtual ~ProcessLifecycle() = default;
    // Tells the platform that the process may exit as soon as no client transaction is
    // outstanding; the agent is started again on demand. Returns at once.
    virtual void requestCleanExit() = 0;
};

}  // namespace qax
