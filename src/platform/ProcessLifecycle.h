// How the agent's process may end: the platform starts the agent on demand and may let it go
// once it is idle. Work that must keep the process alive (a client connection, an activity
// run, a download) holds a transaction while it lasts. Thread-safe.
#pragma once

#include <memory>
#include <string_view>

namespace qax {

class ProcessLifecycle {
  public:
    virtual ~ProcessLifecycle() = default;
    // Tells the platform that the process may exit as soon as no transaction is outstanding;
    // the agent is started again on demand. Returns at once.
    virtual void requestCleanExit() = 0;
    // Keeps the process from exiting for as long as the returned token lives. Never null.
    virtual std::shared_ptr<void> beginTransaction(std::string_view reason) = 0;
};

}  // namespace qax
