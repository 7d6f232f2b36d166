#include "platform/host/HostServiceListenerFactory.h"

#include <filesystem>

#include "core/AsioDispatcher.h"
#include "core/Log.h"
#include "platform/host/HostServiceListener.h"

namespace qax {

std::string HostServiceListenerFactory::socketPath(const std::string& runtimeDirectory,
                                                   const std::string& serviceName) {
    return (std::filesystem::path(runtimeDirectory) / serviceName).string();
}

std::shared_ptr<ServiceListener> HostServiceListenerFactory::makeListener(
    const std::string& serviceName) {
    auto asio = std::dynamic_pointer_cast<AsioDispatcher>(dispatcher_);
    if (!asio) {
        qaxLog().error("Cannot serve %@ without the main event loop", serviceName);
        return nullptr;
    }
    return std::make_shared<HostServiceListener>(
        serviceName, socketPath(runtimeDirectory_, serviceName), std::move(asio), applications_);
}

}  // namespace qax
