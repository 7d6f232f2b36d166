// Makes the host's IPC listeners: the socket of a service is
// $QAX_RUNTIME_DIR/<service name>. Listeners run on the main io_context of the Asio
// dispatcher (see HostServiceListener). Thread-safe.
#pragma once

#include <memory>
#include <string>

#include "core/TaskRunner.h"
#include "platform/ApplicationRegistry.h"
#include "platform/ServiceListener.h"

namespace qax {

class HostServiceListenerFactory : public ServiceListenerFactory {
  public:
    HostServiceListenerFactory(std::string runtimeDirectory, std::shared_ptr<Dispatcher> dispatcher,
                               std::shared_ptr<ApplicationRegistry> applications)
        : runtimeDirectory_(std::move(runtimeDirectory)),
          dispatcher_(std::move(dispatcher)),
          applications_(std::move(applications)) {}

    static std::string socketPath(const std::string& runtimeDirectory,
                                  const std::string& serviceName);
    // None when the dispatcher is not the Asio one (there is no main io_context to serve on).
    std::shared_ptr<ServiceListener> makeListener(const std::string& serviceName) override;

  private:
    std::string runtimeDirectory_;
    std::shared_ptr<Dispatcher> dispatcher_;
    std::shared_ptr<ApplicationRegistry> applications_;
};

}  // namespace qax
