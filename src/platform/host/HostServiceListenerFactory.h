// Makes the host's IPC listeners: the socket of a service is
// $QAX_RUNTIME_DIR/<service name>, or the listening socket the service manager passed when it
// started the agent on demand. Listeners run on the main io_context of the Asio dispatcher
// (see HostServiceListener). Thread-safe.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "core/TaskRunner.h"
#include "platform/ApplicationRegistry.h"
#include "platform/ServiceListener.h"

namespace qax {

class HostProcessLifecycle;

class HostServiceListenerFactory : public ServiceListenerFactory {
  public:
    // `passedSocket` goes to the first listener made; `lifecycle` may be null.
    HostServiceListenerFactory(std::string runtimeDirectory, std::shared_ptr<Dispatcher> dispatcher,
                               std::shared_ptr<ApplicationRegistry> applications,
                               std::shared_ptr<HostProcessLifecycle> lifecycle = nullptr,
                               std::optional<int> passedSocket = std::nullopt)
        : runtimeDirectory_(std::move(runtimeDirectory)),
          dispatcher_(std::move(dispatcher)),
          applications_(std::move(applications)),
          lifecycle_(std::move(lifecycle)),
          passedSocket_(passedSocket) {}

    static std::string socketPath(const std::string& runtimeDirectory,
                                  const std::string& serviceName);
    // Where a client finds the service: in `runtimeDirectory`, else (when the variable is
    // set) in $XDG_RUNTIME_DIR/qaxagent, where the user's service manager keeps the socket;
    // the first path when neither holds a socket.
    static std::string clientSocketPath(const std::string& runtimeDirectory,
                                        const std::string& serviceName);
    // None when the dispatcher is not the Asio one (there is no main io_context to serve on).
    std::shared_ptr<ServiceListener> makeListener(const std::string& serviceName) override;

  private:
    std::string runtimeDirectory_;
    std::shared_ptr<Dispatcher> dispatcher_;
    std::shared_ptr<ApplicationRegistry> applications_;
    std::shared_ptr<HostProcessLifecycle> lifecycle_;
    std::mutex mutex_;
    std::optional<int> passedSocket_;
};

}  // namespace qax
